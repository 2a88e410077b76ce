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
  // Read once, by the constructor, from the domain "com.vantor.stowline";
  // each setting that a stored value changes writes one notice line under
  // "-[SLGlobalConfiguration init]". Only the boolean false turns
  // "LowerInstallPriority" off (default on), only the boolean true turns
  // "SkipDeviceFamilyCheck" or "SkipThinningCheck" on, and any number is
  // taken for "SimultaneousInstallsNumber" (default 4, no range check);
  // values of other kinds are ignored without a word.
  bool lowerInstallPriority() const { return _lowerInstallPriority; }
  bool skipDeviceFamilyCheck() const { return _skipDeviceFamilyCheck; }
  bool skipThinningCheck() const { return _skipThinningCheck; }
  int32_t nSimultaneousInstallations() const { return _nSimultaneousInstallations; }
  uint32_t uid() const { return _uid; }
  uint32_t gid() const { return _gid; }
  // Asked on the first call, once (thread-safely), and cached; with one
  // instance per process that is once per process. Linux enforces no code
  // signing: always true.
  bool codeSigningEnforcementIsDisabled();

  // The persisted flag "UpdatedPluginContainersWithParentIDWithSafeHarborFix"
  // of "com.vantor.stowline", read and written through the preferences store
  // on every call: absent reads false, any value but the boolean false reads
  // true. The setter stores a boolean and synchronises the domain at once; a
  // failed synchronise is not reported (the value stays pending in this
  // process).
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
  // Each holds the lock for the whole call, creation included, and asks for
  // the directory (with its parents, mode 0755) on every call. A failure is
  // logged at level error under the accessor's name, with the path and the
  // record, and the path is returned all the same.
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
  //
  // The basalt, system and internal catalogues and the framework set are
  // scanned on first use and cached under the lock; an application catalogue
  // is null (and scanned again on the next call) while its directory cannot
  // be listed, whereas the framework set is cached even when every scan
  // failed. The rescans empty the cached fields: reScanSystemApps and
  // reScanInternalApps their catalogue and the framework set,
  // reScanBasaltApps its catalogue. The disk-image catalogue is built on
  // every call, never null; builtInApplicationBundleIDs is the union of the
  // system, internal and disk-image catalogues' identifiers (not basalt).
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
  // Neither cached nor locked: each call walks the device registry and reads
  // the mount table afresh. Failures are logged, never returned.
  //
  // The mount point of the first medium below the entry that is mounted;
  // null when none is (or the registry or mount table fails).
  sl::String mountPointForDevice(sl::dv_object_t device);
  // The mount points of the attached image drives, in registry order; empty
  // without a disk-image controller.
  std::vector<sl::String> diskImageMountPoints();
  // MOUNTPOINT/Applications for each mount point that does not begin with
  // "/private/var/debug_mount", then developerAppsDirectory() unless it is
  // already there: never empty.
  std::vector<sl::URL> diskImageApplicationsDirectories();

 private:
  // The catalogue of the entries of `directory` whose extension is exactly
  // `withExtension` (symbolic links left out); null when the directory
  // cannot be listed. Takes no lock of its own.
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
