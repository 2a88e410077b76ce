// SLAppMigrator: moving an application's user data from its old container
// into the data container the registry assigned to it.

#include <string>
#include <vector>

#include "AppMigrator/AppMigrator.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "FileManager/SLFileManager.h"

// Moves each user-data item of the configuration's list, in list order.
// The old data wins: whatever the data container holds under the same name
// is removed first, never merged with. The first item that cannot be moved
// ends the call; items moved before it stay moved, and nothing removed at
// the destination is restored. An item the old container lacks is skipped
// and its namesake in the data container left alone, which is also what
// makes a resumed run harmless.
bool SLAppMigrator::_migrateDataContainerForIdentifier(const sl::String& identifier, const sl::URL& fromURL,
                                                       const sl::URL& toURL) {
  static constexpr char kFunctionName[] = "-[SLAppMigrator _migrateDataContainerForIdentifier:fromURL:toURL:]";
  SLFileManager& fileManager = SLFileManager::defaultManager();
  // The list names the top-level directories of a container.
  for (const std::string& name : SLGlobalConfiguration::sharedInstance().appUserDataItemNames()) {
    const sl::URL source = fromURL.URLByAppendingPathComponent(name, true);
    const sl::URL destination = toURL.URLByAppendingPathComponent(name, true);
    if (!fileManager.itemExistsAtURL(source)) continue;

    // Not examined: whatever the removal leaves behind makes the move fail,
    // and that failure is the one reported.
    (void)fileManager.removeItemAtURL(destination);
    sl::Error error;
    if (!fileManager.moveItemIfExistsAtURL(source, destination, &error)) {
      SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to move %@ to %@ migrating for %@ : %@",
                    source, destination, identifier, error);
      return false;
    }
  }
  return true;
}
