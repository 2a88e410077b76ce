// Staging an old container's bundle as a customer package and installing it
// through the registry.
//
// The package is built inside the old container itself:
//   container/Staging/Payload/<bundle>      the application, moved
//   container/Staging/Payload/<plug-in>     the VPN plug-in, moved, when any
//   container/Staging/<store data items>    moved from the container
// Nothing is undone on failure: whatever was moved stays in the staging
// directory, which goes away with the old container.

#include <sys/stat.h>

#include <cstdint>

#include "AppMigrator/OldLayout.h"
#include "AppMigrator/AppMigrator.h"
#include "FileManager/SLFileManager.h"
#include "Platform/ApplicationRegistry.h"

namespace {

constexpr char kFunctionName[] =
    "-[SLAppMigrator _stageAndInstallBundleAtURL:withIdentifier:andVPNPluginAtURL:inContainerURL:]";
using sl::migrator::kStagingDirectoryName;
using sl::migrator::kPayloadDirectoryName;
constexpr uint64_t kMigratorInstallType = 6;

// The staging directory and its Payload are this system's own names in the
// old container. Anything else standing at one of them (a link planted to
// lead the package's moves out of the container, a file) would go with the
// container anyway: it goes now, so that the package is built in a
// directory of the container itself.
void removeIfNotADirectory(const sl::URL& url) {
  struct stat st;
  if (::lstat(url.fileSystemRepresentation(), &st) != 0 || S_ISDIR(st.st_mode)) return;
  SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Removing %@ before staging: it is not a directory",
                url);
  (void)SLFileManager::defaultManager().removeItemAtURL(url);
}

}  // namespace

bool SLAppMigrator::_stageAndInstallBundleAtURL(const sl::URL& bundle, const sl::String& withIdentifier,
                                                const sl::URL& andVPNPluginAtURL, const sl::URL& inContainerURL) {
  SLFileManager& fm = SLFileManager::defaultManager();
  const sl::URL staging = inContainerURL.URLByAppendingPathComponent(kStagingDirectoryName, true);
  const sl::URL payload = staging.URLByAppendingPathComponent(kPayloadDirectoryName, true);

  removeIfNotADirectory(staging);
  removeIfNotADirectory(payload);
  sl::Error error;
  if (!fm.createDirectoryAtURL(payload, true, 0755, &error)) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to create %@ : %@", payload, error);
    return false;
  }

  const sl::URL stagedBundle = payload.URLByAppendingPathComponent(bundle.lastPathComponent(), true);
  if (!fm.moveItemIfExistsAtURL(bundle, stagedBundle, &error)) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to move bundle from %@ to %@: %@", bundle,
                  stagedBundle, error);
    return false;
  }

  if (!andVPNPluginAtURL.isNull()) {
    const sl::URL stagedPlugin = payload.URLByAppendingPathComponent(andVPNPluginAtURL.lastPathComponent(), true);
    if (!fm.moveItemIfExistsAtURL(andVPNPluginAtURL, stagedPlugin, &error)) {
      SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to move vpn bundle from %@ to %@: %@",
                    andVPNPluginAtURL, stagedPlugin, error);
      return false;
    }
  }

  // Moved, not copied; a failing item is logged by the capture and does not
  // end it, so this branch only guards against a change of that contract.
  if (!fm.captureStoreDataFromDirectory(inContainerURL, staging, false, false, &error)) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to move app metadata from %@ to %@: %@",
                  inContainerURL, staging, error);
    return false;
  }

  const sl::Dictionary options{
      {RGInstallTypeKey, sl::Number(kMigratorInstallType)}, {RGPackageTypeKey, sl::String(RGPackageTypeCustomer)},
      {RGVerifyForMigratorOptionKey, sl::Boolean(true)},    {RGSkipBlacklistOptionKey, sl::Boolean(true)},
      {RGBundleIdentifierOptionKey, withIdentifier},
  };

  // Shared with the handler by reference without a lock: the install call
  // is synchronous, so every report has been handled before it returns and
  // the flag is read only after that.
  bool alreadyInstalled = false;
  const RGProgressHandler handler = [&bundle, &alreadyInstalled](const sl::Dictionary& progress) {
    const sl::String errorName = progress.get(RGProgressErrorKey).asString();
    if (errorName.isNull()) return;
    if (errorName == RGErrorApplicationAlreadyInstalled) {
      SLMigratorLog(sl::kLogLevelNotice, kFunctionName,
                    "SLAppMigrator: Installation of %@ failed because it's older than what's built into the system. "
                    "Data migration already happened so we're done here.",
                    bundle);
      alreadyInstalled = true;
      return;
    }
    SLMigratorLog(sl::kLogLevelError, kFunctionName,
                  "SLAppMigrator: Installation of %@ failed with Stowline error %@ (%@ : %@)", bundle,
                  progress.get(RGProgressErrorDescriptionKey), errorName, progress.get(RGProgressErrorDetailKey));
  };

  sl::Error installError;
  if (RGApplicationWorkspace::defaultWorkspace().installApplication(staging, options, &installError, handler)) {
    return true;
  }
  // The data has already moved into the new data container: a built-in
  // application at least as new is the installed one, and that is success.
  if (alreadyInstalled) return true;
  SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to install %@ : %@", staging, installError);
  return false;
}
