// SLAppMigrator: the main migration pass that the host runs once.

#include <cerrno>
#include <deque>
#include <exception>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "AppMigrator/Classification.h"
#include "AppMigrator/OldLayout.h"
#include "AppMigrator/AppMigrator.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "FileManager/SLFileManager.h"
#include "Platform/InstallerLibrary.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemVersion.h"

namespace {

constexpr const char* kWhereDidMyApplicationsGoFileName = sl::migrator::kWhereDidMyApplicationsGoName;
constexpr const char* kVersionFileName = sl::migrator::kLastSystemVersionFileName;

}  // namespace

bool SLAppMigrator::performMigration() {
  // An exception that escapes the passes (an allocation failure) ends the
  // migration with false instead of crossing into the host; what was done
  // is then as durable as after a kill, and the next run resumes it.
  try {
    return runPasses();
  } catch (const std::exception& e) {
    SLMigratorLog(sl::kLogLevelError, "-[SLAppMigrator performMigration]", "SLAppMigrator: Migration stopped: %s",
                  e.what());
    return false;
  }
}

bool SLAppMigrator::runPasses() {
  static constexpr char kFunctionName[] = "-[SLAppMigrator performMigration]";
  static constexpr char kReturningFailed[] =
      "SLAppMigrator: Returning migration failed. Please include the contents of /var/mobile/Library/Logs/Stowline "
      "and /var/Mobile/Library/Logs/Movantis in a bug report.";
  SLFileManager& fileManager = SLFileManager::defaultManager();
  SLGlobalConfiguration& configuration = SLGlobalConfiguration::sharedInstance();
  // Only this thread writes the counter; the host may read it meanwhile.
  auto countItem = [this] { _countItemsMigrated.fetch_add(1, std::memory_order_relaxed); };

  // The policy: a failure ends only the item at hand; it turns the result
  // false and the passes go on with the next one.
  bool result = true;

  if (_itemsToMigrate) {
    // Introspection: every entry becomes a record or is dealt with here.
    // Early records (applications) go to the front, so among them the one
    // found last is migrated first, and all of them before the others.
    std::deque<sl::Dictionary> records;
    for (const sl::URL& item : *_itemsToMigrate) {
      SLMigratorLog(sl::kLogLevelNotice, kFunctionName, "SLAppMigrator: Introspecting %@", item);
      if (item.lastPathComponent() == kWhereDidMyApplicationsGoFileName) {
        (void)fileManager.removeItemAtURL(item);
        countItem();
        continue;
      }
      bool orderEarly = false;
      sl::Dictionary record = _introspectContainer(item, &orderEarly);
      if (record.isNull()) {
        // Deleted, vanished or left in place; the final check finds what
        // was left.
        countItem();
      } else if (orderEarly) {
        records.push_front(std::move(record));
      } else {
        records.push_back(std::move(record));
      }
    }

    // Containers that claim one identifier stay for the final check: which
    // of them holds the application cannot be told.
    std::map<std::string, size_t> claims = sl::migrator::identifierClaims({records.begin(), records.end()});
    std::erase_if(records, [&](const sl::Dictionary& record) {
      const sl::String identifier = record.get(sl::migrator::kBundleIdentifierKey).asString();
      const size_t claimed = claims[identifier.str()];
      if (claimed < 2) return false;
      SLMigratorLog(sl::kLogLevelError, kFunctionName,
                    "SLAppMigrator: Leaving %@ in place: %lu containers claim the identifier %@",
                    record.get(sl::migrator::kContainerPathKey), static_cast<unsigned long>(claimed), identifier);
      countItem();
      return true;
    });

    // Migration: each record counts once, whatever its outcome.
    for (const sl::Dictionary& record : records) {
      const sl::Value identifier = record.get(sl::migrator::kBundleIdentifierKey);
      const sl::Value bundlePath = record.get(sl::migrator::kBundlePathKey);
      SLMigratorLog(sl::kLogLevelNotice, kFunctionName, "SLAppMigrator: Migrating %@ at %@", identifier, bundlePath);
      if (!_migrateContainerWithInfo(record)) {
        SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Migration of %@ at %@ failed", identifier,
                      bundlePath);
        result = false;
      }
      countItem();
    }
  }

  // Safe harbors and data protection run whatever the passes found, also
  // when there was no old container root at all.
  const bool harborsMigrated = _migrateSafeHarbors();
  if (!StowlineUpdateContainerDataProtectionForMigratorOnly(
          sl::Dictionary{{kSLUpdateSystemAppDataContainerDataProtection, sl::Boolean(true)}})) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to update container data protection");
    result = false;
  }
  if (!harborsMigrated) result = false;

  // The final check, links included this time: anything still standing in
  // the root (a link, a container left in place, one whose migration
  // failed) fails the migration and keeps the old layout. A root that is
  // gone, or that cannot be listed, leaves everything as it is.
  const sl::URL oldContainerRoot = configuration.oldContainerPath();
  const sl::URL installMapURL = configuration.oldInstallMapPath();
  sl::Error error;
  std::optional<std::vector<sl::URL>> remaining =
      fileManager.urlsForItemsInDirectoryAtURL(oldContainerRoot, /*ignoringSymlinks=*/false, &error);
  if (!remaining) {
    if (!error.isPOSIX(ENOENT)) {
      SLMigratorLog(sl::kLogLevelError, kFunctionName,
                    "SLAppMigrator: Failed to determine if any items were remaining to migrate: %@", error);
    }
  } else if (!remaining->empty()) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName,
                  "SLAppMigrator: Not removing %@ because %lu items remain unmigrated.", installMapURL,
                  static_cast<unsigned long>(remaining->size()));
    SLMigratorLog(sl::kLogLevelError, kFunctionName, kReturningFailed);
    return false;
  } else {
    // Failed removals are logged and do not change the result.
    sl::Error removeError;
    if (!fileManager.removeItemAtURL(oldContainerRoot, &removeError)) {
      SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to remove %@ : %@", oldContainerRoot,
                    removeError);
    }
    if (!fileManager.removeItemAtURL(installMapURL, &removeError)) {
      SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to remove %@ : %@", installMapURL,
                    removeError);
    }
  }

  if (!result) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName, kReturningFailed);
    return false;
  }

  // Record the version for which migration succeeded. A failed write does
  // not change the result. Without a system-version dictionary (no
  // os-release below the root) there is nothing to record, which counts as
  // a failed write.
  const sl::URL versionURL =
      configuration.dataDirectory().URLByAppendingPathComponent(kVersionFileName, /*isDirectory=*/false);
  const sl::Dictionary systemVersion = sl::copySystemVersionDictionary();
  if (!systemVersion.isNull() && sl::writePropertyListToURL(systemVersion, versionURL)) {
    SLMigratorLog(sl::kLogLevelNotice, kFunctionName, "SLAppMigrator: Recorded current system version as %@",
                  systemVersion.get(sl::kSystemBuildVersionKey));
  } else {
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to write current build info to %@",
                  versionURL);
  }
  return true;
}
