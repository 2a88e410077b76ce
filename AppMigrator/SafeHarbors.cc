// SLAppMigrator: registering the installer's safe harbors with the
// installer library, and retiring the safe harbor map once all of them are.

#include "AppMigrator/OldLayout.h"
#include "AppMigrator/AppMigrator.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "FileManager/SLFileManager.h"
#include "Platform/InstallerLibrary.h"

namespace {

using sl::migrator::kSafeHarborMapName;
using sl::migrator::kHarborPathKey;
// The container type every harbor is registered with.
constexpr int kSafeHarborContainerType = 2;

}  // namespace

// The map is identifier -> { "HarborPathKey": path }. Malformed entries are
// logged and skipped; they do not keep the map file. A failed registration
// is logged, the remaining harbors are still registered, and the file stays
// so that the next run registers every harbor again.
bool SLAppMigrator::_migrateSafeHarbors() {
  static constexpr char kFunctionName[] = "-[SLAppMigrator _migrateSafeHarbors]";
  // No map, or one that could not be read: the file (if any) stays.
  if (_harborMap.isNull()) return true;

  bool result = true;
  // Each key's values live in the loop body's scope and are released when
  // the key is done, so memory does not grow with the map.
  //
  // The keys of a dictionary are strings by construction here, so an
  // identifier that is not a string ("SLAppMigrator: Identifier in harbor
  // map was not string; skipping") cannot occur and has no check.
  for (const auto& [key, value] : _harborMap) {
    const sl::String identifier(key);
    const sl::Dictionary entry = value.asDictionary();
    if (entry.isNull()) {
      SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to get harbor info for identifier %@",
                    identifier);
      continue;
    }
    const sl::String path = entry.get(kHarborPathKey).asString();
    if (path.isNull()) {
      SLMigratorLog(sl::kLogLevelError, kFunctionName,
                    "SLAppMigrator: Failed to get harbor path from harbor entry for %@ : %@", identifier, entry);
      continue;
    }
    SLMigratorLog(sl::kLogLevelNotice, kFunctionName, "SLAppMigrator: Migrating safe harbor for %@ at %@", identifier,
                  path);
    if (StowlineRegisterSafeHarborForContainerType(path, identifier, kSafeHarborContainerType, nullptr) == 0) {
      SLMigratorLog(sl::kLogLevelError, kFunctionName,
                    "SLAppMigrator: Failed to migrate safe harbor for identifier %@ at %@ : %@", identifier, path,
                    StowlineCopyLastSafeHarborRegistrationError());
      result = false;
    }
  }
  if (!result) return false;

  // Every harbor is registered (or there was none): the map has served.
  (void)SLFileManager::defaultManager().removeItemAtURL(
      SLGlobalConfiguration::sharedInstance().dataDirectory().URLByAppendingPathComponent(kSafeHarborMapName, false));
  return true;
}
