// SLGlobalConfiguration: the installation system's settings and its
// file-system layout, one instance per process.
//
// Settings are read once, when the instance is made, from the preferences
// domain "com.vantor.stowline". Every path of the system is derived here from
// three bases that hang below the system root (Platform/SystemRoot.h):
// the installer base ROOT/private/var/stowd/, the user base
// ROOT/private/var/mobile/ and the root ROOT/ itself. Some paths are cached
// on first use, and the directories that the system writes into are created
// on every request (a creation failure is logged and the path returned all
// the same). The class also answers fixed item-name lists, persisted flags,
// the catalogues of built-in bundles and the applications directories of
// attached disk images.
//
// One re-entrant lock per instance guards every cached field, for the whole
// accessor including a directory creation or a catalogue scan. A scan under
// the lock calls SLLoadInfoPlist, which takes its own lock; that lock is
// never held while this one is taken.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "Platform/DeviceRegistry.h"
#include "Platform/URL.h"
#include "Platform/Value.h"

class SLGlobalConfiguration {
 public:
  // The process's instance, made on the first call (thread-safe) and never
  // destroyed.
  static SLGlobalConfiguration& sharedInstance();

  // Reads the settings and fixes the bases from the current system root.
  // Clients use sharedInstance(); tests make instances of their own.
  SLGlobalConfiguration();
  SLGlobalConfiguration(const SLGlobalConfiguration&) = delete;
  SLGlobalConfiguration& operator=(const SLGlobalConfiguration&) = delete;

  // ---- Settings ----
  bool lowerInstallPriority() const { return _lowerInstallPriority; }
  bool skipDeviceFamilyCheck() const { return _skipDeviceFamilyCheck; }
  bool skipThinningCheck() const { return _skipThinningCheck; }
  int32_t nSimultaneousInstallations() const { return _nSimultaneousInstallations; }
  uint32_t uid() const { return _uid; }
  uint32_t gid() const { return _gid; }
  // Computed once per process and cached.
  bool codeSigningEnforcementIsDisabled();

  // The persisted flag, read and written through the preferences store on
  // every call.
  bool haveUpdatedPluginContainersWithParentID();
  void setHaveUpdatedPluginContainersWithParentID(bool value);
  // "ThinnedAppVariantID" of the suite "com.vantor.jukorastored", read on
  // every call; a number gives its text form; null when absent or of
  // another type.
  sl::String alternateThinningModelIdentifier();

  // ---- Paths: only computed ----
  sl::URL oldContainerPath();
  sl::URL oldInstallMapPath();
  sl::URL oldDataDirectoryPath();
  sl::URL oldLoggingPath();
  sl::URL oldArchiveDirectory();
  sl::URL dataDirectoryPath();
  sl::URL roleUserMigrationMarkerFilePath();

  // ---- Paths: cached, and created on every call ----
  sl::URL carrierBundlesDirectory();
  sl::URL stagingRoot();  // class 4; computed from cachesDirectory under the same lock
  sl::URL dataDirectory();  // class 4; the same path as dataDirectoryPath
  sl::URL cachesDirectory();
  // Created on every call, neither cached nor locked. Class 4.
  sl::URL logDirectory();

  // ---- Paths: cached, never created ----
  sl::URL basaltDirectory();
  sl::URL systemAppsDirectory();
  sl::URL internalAppsDirectory();
  sl::URL developerAppsDirectory();
  sl::URL factoryMountDirectory();
  sl::URL systemFrameworksRootDirectory();
  sl::URL internalFrameworksRootDirectory();
  sl::URL developerFrameworksRootDirectory();
  // Frameworks and PrivateFrameworks of the system and internal roots.
  std::vector<sl::URL> allFrameworksDirectories();

  // ---- Item lists ----
  // "Manifest.plist", "JukoraArtwork", "JukoraMetadata.plist", "GeoJSON":
  // the file-system layer's store data items, the one list for both.
  std::vector<std::string> appBundleMetadataItemNames() const;
  // "Documents", "Library", "tmp", "Tillbox".
  std::vector<std::string> appUserDataItemNames() const;
  // Identifiers excluded from installation; made once per process.
  static const std::set<std::string>& installationBlacklist();

  // ---- Built-in bundle catalogues ----
  // A catalogue maps a bundle identifier to a dictionary holding
  // "PBBundleIdentifier", "PBBundleVersion" (when the bundle has them) and
  // "com.vantor.Stowline.bundleURL".
  sl::Dictionary basaltAppBundleIDToInfoMap();
  sl::Dictionary systemAppBundleIDToInfoMap();
  sl::Dictionary internalAppBundleIDToInfoMap();
  sl::Dictionary diskImageAppBundleIDToInfoMap();
  std::set<std::string> builtInApplicationBundleIDs();
  std::set<std::string> builtInFrameworkBundleIDs();
  void reScanSystemApps();
  void reScanBasaltApps();
  void reScanInternalApps();

  // ---- Disk images ----
  // The mount point of the first medium below the entry that is mounted.
  sl::String mountPointForDevice(sl::dv_object_t device);
  std::vector<sl::String> diskImageMountPoints();
  std::vector<sl::URL> diskImageApplicationsDirectories();

 private:
  sl::Dictionary _bundleIDMapForBundlesInDirectory(const sl::URL& directory, const std::string& withExtension);
  sl::Dictionary _bundleIDMapForAppsInDirectory(const sl::URL& directory);

  // Creates `path` with intermediate directories, mode 0755 and the class
  // (-1 for none), logging `failureFormat` under `function` on failure.
  void createDirectoryLogged(const sl::URL& path, int32_t protectionClass, const char* function,
                             const char* failureFormat);

  std::recursive_mutex _lock;

  sl::URL _stowdPath;
  sl::URL _mobilePath;
  sl::URL _rootPath;
  sl::URL _carrierBundlesDir;
  sl::URL _stagingRoot;
  sl::URL _basaltDir;
  sl::URL _systemAppsDir;
  sl::URL _internalAppsDir;
  sl::URL _developerAppsDir;
  sl::URL _factoryMountDir;
  sl::URL _systemFrameworksRootDirectory;
  sl::URL _internalFrameworksRootDirectory;
  sl::URL _developerFrameworksRootDirectory;
  sl::URL _dataDir;
  sl::URL _cachesDir;
  std::optional<std::vector<sl::URL>> _allFrameworksDirectories;
  sl::Dictionary _systemAppBundleIDToInfoMap;
  sl::Dictionary _basaltAppBundleIDToInfoMap;
  sl::Dictionary _internalAppBundleIDToInfoMap;
  std::once_flag _codeSigningOnce;
  bool _codeSigningEnforcementIsDisabled = false;
  std::optional<std::set<std::string>> _builtInFrameworkBundleIDs;
  bool _lowerInstallPriority = true;
  bool _skipDeviceFamilyCheck = false;
  bool _skipThinningCheck = false;
  int32_t _nSimultaneousInstallations = 4;
  uint32_t _uid = 33;
  uint32_t _gid = 33;
};
