// SLGlobalConfiguration: the instance, its settings, the persisted flags,
// the path layout and the item lists.
//
// Locking: the cached accessors hold _lock for their whole body, the
// directory creation included, so a field is computed once and two
// creation requests on one instance never interleave. The lock is
// re-entrant because stagingRoot and allFrameworksDirectories compute their
// fields through other cached accessors. The uncached paths, logDirectory,
// the item lists and the preference reads take no lock.

#include <cstdint>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "Configuration/SLGlobalConfiguration.h"
#include "FileManager/SLFileManager.h"
#include "Platform/CodeSigning.h"
#include "Platform/Error.h"
#include "Platform/Preferences.h"
#include "Platform/SystemRoot.h"
#include "Support/Log.h"

namespace {

constexpr char kPreferencesDomain[] = "com.vantor.stowline";
constexpr char kLowerInstallPriorityKey[] = "LowerInstallPriority";
constexpr char kSkipDeviceFamilyCheckKey[] = "SkipDeviceFamilyCheck";
constexpr char kSkipThinningCheckKey[] = "SkipThinningCheck";
constexpr char kSimultaneousInstallsNumberKey[] = "SimultaneousInstallsNumber";
constexpr char kUpdatedPluginContainersKey[] = "UpdatedPluginContainersWithParentIDWithSafeHarborFix";
constexpr char kThinningSuite[] = "com.vantor.jukorastored";
constexpr char kThinnedAppVariantIDKey[] = "ThinnedAppVariantID";

constexpr int32_t kDefaultSimultaneousInstallations = 4;
constexpr uint32_t kInstallationSystemID = 33;
constexpr mode_t kDirectoryMode = 0755;
constexpr int32_t kNoProtectionClass = -1;
constexpr int32_t kWorkingDirectoryProtectionClass = 4;

sl::URL directoryBelow(const sl::URL& base, std::string_view component) {
  return base.URLByAppendingPathComponent(component, true);
}

}  // namespace

// ---- Creation and settings ----

SLGlobalConfiguration& SLGlobalConfiguration::sharedInstance() {
  // Made once (a function-local static is initialised thread-safely) and
  // never destroyed, so it outlives every static that may still use it.
  static SLGlobalConfiguration* const instance = new SLGlobalConfiguration();
  return *instance;
}

SLGlobalConfiguration::SLGlobalConfiguration() {
  static constexpr char kFunctionName[] = "-[SLGlobalConfiguration init]";

  // Only the boolean false turns the lowered priority off: a number 0 or a
  // string "NO" does not.
  sl::Value value = sl::preferencesCopyValue(kLowerInstallPriorityKey, kPreferencesDomain);
  _lowerInstallPriority = !(value == sl::Boolean(false));
  if (!_lowerInstallPriority) {
    SLLog(sl::kLogLevelNotice, kFunctionName,
          "Not running installation at background priority because of a set default");
  }

  // Likewise, only the boolean true turns a skip on.
  value = sl::preferencesCopyValue(kSkipDeviceFamilyCheckKey, kPreferencesDomain);
  _skipDeviceFamilyCheck = value == sl::Boolean(true);
  if (_skipDeviceFamilyCheck) {
    SLLog(sl::kLogLevelNotice, kFunctionName, "Skipping device family check because of a set default");
  }

  value = sl::preferencesCopyValue(kSkipThinningCheckKey, kPreferencesDomain);
  _skipThinningCheck = value == sl::Boolean(true);
  if (_skipThinningCheck) {
    SLLog(sl::kLogLevelNotice, kFunctionName, "Skipping device thinning check because of a set default");
  }

  // Any number is taken as it is (consumers decide what a value below 1
  // means), a boolean as 1 or 0; a value of another kind is ignored without
  // a word.
  _nSimultaneousInstallations = kDefaultSimultaneousInstallations;
  value = sl::preferencesCopyValue(kSimultaneousInstallsNumberKey, kPreferencesDomain);
  if (sl::Number number = value.asNumber(); !number.isNull() || value.kind() == sl::ValueKind::Boolean) {
    _nSimultaneousInstallations = number.isNull() ? int32_t{value.asBoolean().boolValue()} : number.int32Value();
    SLLog(sl::kLogLevelNotice, kFunctionName, "Setting simultaneous installations allowed to %ld",
          static_cast<long>(_nSimultaneousInstallations));
  }

  _stowdPath = sl::URL::fileURLWithPath(sl::pathBelowSystemRoot("/private/var/stowd/"), true);
  _mobilePath = sl::URL::fileURLWithPath(sl::pathBelowSystemRoot("/private/var/mobile/"), true);
  _rootPath = sl::URL::fileURLWithPath(sl::pathBelowSystemRoot("/"), true);

  _uid = kInstallationSystemID;
  _gid = kInstallationSystemID;
}

bool SLGlobalConfiguration::codeSigningEnforcementIsDisabled() {
  std::call_once(_codeSigningOnce,
                 [this] { _codeSigningEnforcementIsDisabled = sl::codeSigningEnforcementIsDisabledForOwnProcess(); });
  return _codeSigningEnforcementIsDisabled;
}

// ---- Persisted flags ----

bool SLGlobalConfiguration::haveUpdatedPluginContainersWithParentID() {
  sl::Value value = sl::preferencesCopyValue(kUpdatedPluginContainersKey, kPreferencesDomain);
  if (value.isNull()) return false;
  return !(value == sl::Boolean(false));
}

void SLGlobalConfiguration::setHaveUpdatedPluginContainersWithParentID(bool value) {
  sl::preferencesSetValue(kUpdatedPluginContainersKey, sl::Boolean(value), kPreferencesDomain);
  // A failed synchronise is not reported: the change stays pending in this
  // process (reads here see it) and goes out with the next synchronise.
  (void)sl::preferencesSynchronize(kPreferencesDomain);
}

sl::String SLGlobalConfiguration::alternateThinningModelIdentifier() {
  sl::Value value = sl::preferencesCopyValue(kThinnedAppVariantIDKey, kThinningSuite);
  switch (value.kind()) {
    case sl::ValueKind::String:
      return value.asString();
    case sl::ValueKind::Number:
    case sl::ValueKind::Boolean:  // "1" or "0"
      return sl::String(value.description());
    default:
      return nullptr;
  }
}

// ---- Paths: only computed ----

sl::URL SLGlobalConfiguration::oldContainerPath() { return directoryBelow(_mobilePath, "Applications"); }

sl::URL SLGlobalConfiguration::oldInstallMapPath() {
  return _mobilePath.URLByAppendingPathComponent("Library/Caches/com.vantor.stowline.plist", false);
}

sl::URL SLGlobalConfiguration::oldDataDirectoryPath() { return directoryBelow(_mobilePath, "Library/Stowline"); }

sl::URL SLGlobalConfiguration::oldLoggingPath() { return directoryBelow(_mobilePath, "Library/Logs/Stowline"); }

sl::URL SLGlobalConfiguration::oldArchiveDirectory() {
  return directoryBelow(_mobilePath, "Media/ApplicationArchives");
}

sl::URL SLGlobalConfiguration::dataDirectoryPath() { return directoryBelow(_stowdPath, "Library/Stowline"); }

sl::URL SLGlobalConfiguration::roleUserMigrationMarkerFilePath() {
  return dataDirectoryPath().URLByAppendingPathComponent("RoleUserMigration.plist", false);
}

// ---- Paths: cached, and created on every call ----

void SLGlobalConfiguration::createDirectoryLogged(const sl::URL& path, int32_t protectionClass, const char* function,
                                                  const char* failureFormat) {
  sl::Error error;
  if (!SLFileManager::defaultManager().createDirectoryAtURL(path, true, kDirectoryMode, protectionClass, &error)) {
    // failureFormat is one of the literals below, each taking the path and
    // the record.
    SLLog(sl::kLogLevelError, function, sl::runtimeFormat(failureFormat), path, error);
  }
}

sl::URL SLGlobalConfiguration::carrierBundlesDirectory() {
  static constexpr char kFunctionName[] = "-[SLGlobalConfiguration carrierBundlesDirectory]";
  std::lock_guard<std::recursive_mutex> guard(_lock);
  if (_carrierBundlesDir.isNull()) _carrierBundlesDir = directoryBelow(_mobilePath, "Library/Carrier Bundles");
  createDirectoryLogged(_carrierBundlesDir, kNoProtectionClass, kFunctionName,
                        "Failed to create carrier bundles directory at \"%@\": %@");
  return _carrierBundlesDir;
}

sl::URL SLGlobalConfiguration::stagingRoot() {
  static constexpr char kFunctionName[] = "-[SLGlobalConfiguration stagingRoot]";
  std::lock_guard<std::recursive_mutex> guard(_lock);
  // The first call also makes the caches directory (without a class), as
  // cachesDirectory does; the lock is taken there a second time.
  if (_stagingRoot.isNull()) _stagingRoot = directoryBelow(cachesDirectory(), "com.vantor.mobile.stowd.staging");
  createDirectoryLogged(_stagingRoot, kWorkingDirectoryProtectionClass, kFunctionName,
                        "Failed to create staging root at \"%@\": %@");
  return _stagingRoot;
}

sl::URL SLGlobalConfiguration::logDirectory() {
  static constexpr char kFunctionName[] = "-[SLGlobalConfiguration logDirectory]";
  sl::URL path = directoryBelow(_stowdPath, "Library/Logs/Stowline");
  createDirectoryLogged(path, kWorkingDirectoryProtectionClass, kFunctionName,
                        "Failed to create log directory at \"%@\": %@");
  return path;
}

sl::URL SLGlobalConfiguration::dataDirectory() {
  static constexpr char kFunctionName[] = "-[SLGlobalConfiguration dataDirectory]";
  std::lock_guard<std::recursive_mutex> guard(_lock);
  if (_dataDir.isNull()) _dataDir = dataDirectoryPath();
  createDirectoryLogged(_dataDir, kWorkingDirectoryProtectionClass, kFunctionName,
                        "Failed to create data dir at \"%@\": %@");
  return _dataDir;
}

sl::URL SLGlobalConfiguration::cachesDirectory() {
  static constexpr char kFunctionName[] = "-[SLGlobalConfiguration cachesDirectory]";
  std::lock_guard<std::recursive_mutex> guard(_lock);
  if (_cachesDir.isNull()) _cachesDir = directoryBelow(_stowdPath, "Library/Caches");
  // The message names the data dir, though this is the caches directory.
  createDirectoryLogged(_cachesDir, kNoProtectionClass, kFunctionName, "Failed to create data dir at \"%@\": %@");
  return _cachesDir;
}

// ---- Paths: cached, never created ----

namespace {

// The body of every cached, never created accessor: the field is computed
// once under the instance's lock.
template <class Compute>
sl::URL cachedPath(std::recursive_mutex& lock, sl::URL& field, Compute compute) {
  std::lock_guard<std::recursive_mutex> guard(lock);
  if (field.isNull()) field = compute();
  return field;
}

}  // namespace

sl::URL SLGlobalConfiguration::basaltDirectory() {
  return cachedPath(_lock, _basaltDir, [this] { return directoryBelow(_rootPath, "System/Library/Basalt"); });
}

sl::URL SLGlobalConfiguration::systemAppsDirectory() {
  return cachedPath(_lock, _systemAppsDir, [this] { return directoryBelow(_rootPath, "Applications"); });
}

sl::URL SLGlobalConfiguration::internalAppsDirectory() {
  return cachedPath(_lock, _internalAppsDir,
                    [this] { return directoryBelow(_rootPath, "VantorInternal/Applications"); });
}

sl::URL SLGlobalConfiguration::developerAppsDirectory() {
  return cachedPath(_lock, _developerAppsDir, [this] { return directoryBelow(_rootPath, "Developer/Applications"); });
}

sl::URL SLGlobalConfiguration::factoryMountDirectory() {
  return cachedPath(_lock, _factoryMountDir,
                    [this] { return directoryBelow(_rootPath, "private/var/factory_mount/"); });
}

sl::URL SLGlobalConfiguration::systemFrameworksRootDirectory() {
  return cachedPath(_lock, _systemFrameworksRootDirectory,
                    [this] { return directoryBelow(_rootPath, "System/Library"); });
}

sl::URL SLGlobalConfiguration::internalFrameworksRootDirectory() {
  return cachedPath(_lock, _internalFrameworksRootDirectory,
                    [this] { return directoryBelow(_rootPath, "VantorInternal"); });
}

sl::URL SLGlobalConfiguration::developerFrameworksRootDirectory() {
  return cachedPath(_lock, _developerFrameworksRootDirectory,
                    [this] { return directoryBelow(_rootPath, "Developer"); });
}

std::vector<sl::URL> SLGlobalConfiguration::allFrameworksDirectories() {
  std::lock_guard<std::recursive_mutex> guard(_lock);
  if (!_allFrameworksDirectories) {
    // The developer root is left out on purpose.
    const sl::URL system = systemFrameworksRootDirectory();
    const sl::URL internal = internalFrameworksRootDirectory();
    _allFrameworksDirectories = std::vector<sl::URL>{
        directoryBelow(system, "Frameworks"),
        directoryBelow(system, "PrivateFrameworks"),
        directoryBelow(internal, "Frameworks"),
        directoryBelow(internal, "PrivateFrameworks"),
    };
  }
  return *_allFrameworksDirectories;
}

// ---- Item lists ----

std::vector<std::string> SLGlobalConfiguration::appBundleMetadataItemNames() const {
  // The file-system layer's store data items: one list for both.
  return SLFileManager::storeDataItemNames();
}

std::vector<std::string> SLGlobalConfiguration::appUserDataItemNames() const {
  return {"Documents", "Library", "tmp", "Tillbox"};
}

const std::set<std::string>& SLGlobalConfiguration::installationBlacklist() {
  // Made once, thread-safely, and shared; never destroyed.
  static const std::set<std::string>* const blacklist = new std::set<std::string>{"com.vantor.Orbis6Updater"};
  return *blacklist;
}
