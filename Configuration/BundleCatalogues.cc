// SLGlobalConfiguration: the catalogues of the bundles that come with the
// system, keyed by bundle identifier.
//
// Lock order: the cached catalogues are scanned while the object's lock
// (`_lock`) is held, and a scan calls SLLoadInfoPlist, which takes its own
// process-wide lock for each bundle. That loader never calls back into the
// configuration, so the object lock is always taken first and the loader's
// lock second, never the other way round. Nothing here may be called from
// code that holds the loader's lock.

#include <cerrno>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Configuration/SLGlobalConfiguration.h"
#include "FileManager/SLFileManager.h"
#include "Platform/Bundle.h"
#include "Support/InfoPlist.h"
#include "Support/Log.h"

namespace {

constexpr char kBundleVersionKey[] = "PBBundleVersion";
// The entry added to every catalogue entry: where the bundle was found.
constexpr char kCatalogueBundleURLKey[] = "com.vantor.Stowline.bundleURL";
constexpr char kAppExtension[] = "app";
constexpr char kFrameworkExtension[] = "framework";

}  // namespace

// Takes no lock of its own: the callers that cache hold `_lock` around it.
sl::Dictionary SLGlobalConfiguration::_bundleIDMapForBundlesInDirectory(const sl::URL& directory,
                                                                        const std::string& withExtension) {
  static constexpr char kFunctionName[] = "-[SLGlobalConfiguration _bundleIDMapForBundlesInDirectory:withExtension:]";

  sl::Error error;
  const std::optional<std::vector<sl::URL>> entries =
      SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(directory, true, &error);
  if (!entries) {
    // A directory that is not there simply holds no bundles; anything else
    // is worth a line.
    if (!error.isPOSIX(ENOENT)) {
      SLLog(sl::kLogLevelError, kFunctionName, "Failed to search for apps in %@ : %@", directory, error);
    }
    return nullptr;
  }

  const sl::Array keys{sl::String(sl::kBundleIdentifierKey), sl::String(kBundleVersionKey)};
  sl::Dictionary catalogue = sl::Dictionary::create();
  // In the listing's order: for an identifier met twice, the later bundle
  // replaces the earlier one.
  for (const sl::URL& entry : *entries) {
    // Exact and case-sensitive: "X.APP" is not an "app" bundle.
    if (entry.pathExtension() != withExtension) continue;

    sl::Dictionary info = SLLoadInfoPlist(entry, keys);
    if (info.isNull()) {
      SLLog(sl::kLogLevelDebug, kFunctionName, "Failed to load Info.plist from bundle %@", entry);
      continue;
    }
    const sl::String identifier = info.get(sl::kBundleIdentifierKey).asString();
    if (identifier.isNull()) {
      SLLog(sl::kLogLevelDebug, kFunctionName, "Failed to get PBBundleIdentifier from bundle %@", entry);
      continue;
    }
    info.set(kCatalogueBundleURLKey, entry);
    catalogue.set(identifier.view(), info);
  }
  return catalogue;
}

sl::Dictionary SLGlobalConfiguration::_bundleIDMapForAppsInDirectory(const sl::URL& directory) {
  return _bundleIDMapForBundlesInDirectory(directory, kAppExtension);
}

// The three cached application catalogues: scanned under the lock, so that
// concurrent first calls scan once and the others wait for the result. A
// scan that gives nothing (the directory cannot be listed) leaves the field
// null, and the next call scans again.

sl::Dictionary SLGlobalConfiguration::basaltAppBundleIDToInfoMap() {
  std::lock_guard<std::recursive_mutex> guard(_lock);
  if (_basaltAppBundleIDToInfoMap.isNull()) {
    _basaltAppBundleIDToInfoMap = _bundleIDMapForAppsInDirectory(basaltDirectory());
  }
  return _basaltAppBundleIDToInfoMap;
}

sl::Dictionary SLGlobalConfiguration::systemAppBundleIDToInfoMap() {
  std::lock_guard<std::recursive_mutex> guard(_lock);
  if (_systemAppBundleIDToInfoMap.isNull()) {
    _systemAppBundleIDToInfoMap = _bundleIDMapForAppsInDirectory(systemAppsDirectory());
  }
  return _systemAppBundleIDToInfoMap;
}

sl::Dictionary SLGlobalConfiguration::internalAppBundleIDToInfoMap() {
  std::lock_guard<std::recursive_mutex> guard(_lock);
  if (_internalAppBundleIDToInfoMap.isNull()) {
    _internalAppBundleIDToInfoMap = _bundleIDMapForAppsInDirectory(internalAppsDirectory());
  }
  return _internalAppBundleIDToInfoMap;
}

// Built anew on every call and not locked: the directories of attached disk
// images come and go.
sl::Dictionary SLGlobalConfiguration::diskImageAppBundleIDToInfoMap() {
  sl::Dictionary merged = sl::Dictionary::create();
  for (const sl::URL& directory : diskImageApplicationsDirectories()) {
    const sl::Dictionary catalogue = _bundleIDMapForAppsInDirectory(directory);
    // A later directory replaces what an earlier one had under the same
    // identifier.
    for (const auto& [identifier, info] : catalogue) merged.set(identifier, info);
  }
  return merged;
}

// Three separately locked reads: not atomic with respect to a concurrent
// rescan. The core-services (basalt) applications are not built-in ones.
std::set<std::string> SLGlobalConfiguration::builtInApplicationBundleIDs() {
  std::set<std::string> identifiers;
  for (const sl::Dictionary& catalogue :
       {systemAppBundleIDToInfoMap(), internalAppBundleIDToInfoMap(), diskImageAppBundleIDToInfoMap()}) {
    for (const auto& entry : catalogue) identifiers.insert(entry.first);
  }
  return identifiers;
}

std::set<std::string> SLGlobalConfiguration::builtInFrameworkBundleIDs() {
  std::lock_guard<std::recursive_mutex> guard(_lock);
  if (!_builtInFrameworkBundleIDs) {
    std::set<std::string> identifiers;
    // allFrameworksDirectories takes `_lock` again; it is re-entrant.
    for (const sl::URL& directory : allFrameworksDirectories()) {
      for (const auto& entry : _bundleIDMapForBundlesInDirectory(directory, kFrameworkExtension)) {
        identifiers.insert(entry.first);
      }
    }
    // Filled even when every scan failed: a failed framework scan is not
    // retried until a rescan empties the field.
    _builtInFrameworkBundleIDs = std::move(identifiers);
  }
  return *_builtInFrameworkBundleIDs;
}

// Rescans only empty the fields; the next use scans again. A catalogue
// handed out earlier stays valid for its holder.

void SLGlobalConfiguration::reScanSystemApps() {
  std::lock_guard<std::recursive_mutex> guard(_lock);
  _systemAppBundleIDToInfoMap = nullptr;
  _builtInFrameworkBundleIDs.reset();
}

void SLGlobalConfiguration::reScanBasaltApps() {
  std::lock_guard<std::recursive_mutex> guard(_lock);
  _basaltAppBundleIDToInfoMap = nullptr;
}

void SLGlobalConfiguration::reScanInternalApps() {
  std::lock_guard<std::recursive_mutex> guard(_lock);
  _internalAppBundleIDToInfoMap = nullptr;
  _builtInFrameworkBundleIDs.reset();
}
