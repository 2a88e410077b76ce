// SLAppMigrator: construction, the start-up state that init loads from the
// old layout and the installer data directory, and the figures the host
// displays while the migration runs.

#include <memory>
#include <utility>

#include "AppMigrator/OldLayout.h"
#include "AppMigrator/AppMigrator.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "FileManager/SLFileManager.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemVersion.h"

namespace {

constexpr const char* kHarborMapFileName = sl::migrator::kSafeHarborMapName;
constexpr const char* kVersionFileName = sl::migrator::kLastSystemVersionFileName;

}  // namespace

std::unique_ptr<SLAppMigrator> SLAppMigrator::create() {
  // The constructor is private, so make_unique cannot reach it.
  std::unique_ptr<SLAppMigrator> migrator(new SLAppMigrator());
  if (!migrator->init()) return nullptr;  // the half-built object goes with the unique_ptr
  return migrator;
}

bool SLAppMigrator::init() {
  static constexpr char kFunctionName[] = "-[SLAppMigrator init]";
  if (!initBase()) return false;

  SLFileManager& fileManager = SLFileManager::defaultManager();
  SLGlobalConfiguration& configuration = SLGlobalConfiguration::sharedInstance();

  // A missing root leaves _itemsToMigrate absent and the install map unread.
  // When its state cannot be determined it is listed anyway, and that
  // listing decides.
  const sl::URL oldContainerRoot = configuration.oldContainerPath();
  if (!fileManager.itemDoesNotExistAtURL(oldContainerRoot)) {
    sl::Error error;
    std::optional<std::vector<sl::URL>> items =
        fileManager.urlsForItemsInDirectoryAtURL(oldContainerRoot, /*ignoringSymlinks=*/true, &error);
    if (!items) {
      // The only failure that keeps the plug-in from starting.
      SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to get items at %@ : %@",
                    oldContainerRoot, error);
      return false;
    }

    if (!items->empty()) {
      SLMigratorLog(sl::kLogLevelNotice, kFunctionName, "SLAppMigrator: %ld items to migrate",
                    static_cast<long>(items->size()));
      _itemsToMigrate = std::move(items);

      const sl::URL installMapURL = configuration.oldInstallMapPath();
      _installMap = sl::dictionaryWithContentsOfURL(installMapURL);
      if (_installMap.isNull()) {
        SLMigratorLog(sl::kLogLevelNotice, kFunctionName, "SLAppMigrator: Old install map not found at %@",
                      installMapURL);
      } else {
        // A copy of the handle: changes made through it leave _installMap as
        // it was read.
        sl::Dictionary groupContainers = _installMap.get(sl::migrator::kGroupContainersKey).asDictionary();
        if (groupContainers.isNull()) {
          SLMigratorLog(sl::kLogLevelNotice, kFunctionName,
                        "SLAppMigrator: No group container map found in install map");
        } else {
          _groupContainerMap = std::move(groupContainers);
        }
      }
    } else {
      // An empty root is never kept as an empty list: it goes now, and the
      // install map stays unread.
      if (!fileManager.removeItemAtURL(oldContainerRoot)) {
        SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to remove %@", oldContainerRoot);
      }
    }
  }

  const sl::URL dataDirectory = configuration.dataDirectory();

  const sl::URL harborMapURL = dataDirectory.URLByAppendingPathComponent(kHarborMapFileName, false);
  if (!fileManager.itemDoesNotExistAtURL(harborMapURL)) {
    _harborMap = sl::dictionaryWithContentsOfURL(harborMapURL);
    if (_harborMap.isNull()) {
      SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to load existing harbor map from %@",
                    harborMapURL);
    }
  }

  // A missing or unreadable version file is not worth a line.
  const sl::Dictionary lastVersion =
      sl::dictionaryWithContentsOfURL(dataDirectory.URLByAppendingPathComponent(kVersionFileName, false));
  if (!lastVersion.isNull()) _lastSystemBuildVersion = lastVersion.get(sl::kSystemBuildVersionKey).asString();

  return true;
}

sl::String SLAppMigrator::dataClassName() { return sl::String("SLAppMigrator"); }

float SLAppMigrator::estimatedDuration() {
  if (!_itemsToMigrate) return 20.0f;
  return 20.0f + 2.25f * static_cast<float>(_itemsToMigrate->size());
}

float SLAppMigrator::migrationProgress() {
  // _itemsToMigrate is fixed by init, so only the counter changes under the
  // host's feet. A relaxed load suffices: the figure is read on its own and
  // no other data is published through the counter.
  if (!_itemsToMigrate) return 0.5f;
  if (_itemsToMigrate->empty()) return -1.0f;
  const uint64_t count = _countItemsMigrated.load(std::memory_order_relaxed);
  return static_cast<float>(static_cast<double>(count) / static_cast<double>(_itemsToMigrate->size()));
}
