// SLAppMigrator: classifying the entries of the old container root, and
// reading back the migration marker that an earlier run left in a container.
//
// An entry is an old container holding an application bundle and/or a VPN
// plug-in (a record is built for it), a container that an interrupted run
// began to migrate (its marker is the record), something holding nothing to
// migrate (deleted), or something that cannot be handled safely now (left in
// place for the main pass's final check).

#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "AppMigrator/AppMigrator.h"
#include "FileManager/SLFileManager.h"
#include "Platform/Bundle.h"
#include "Platform/Error.h"
#include "Platform/PropertyList.h"

namespace {

constexpr char kContainerPathKey[] = "ContainerPath";
constexpr char kBundlePathKey[] = "BundlePath";
constexpr char kContainerTypeKey[] = "ContainerType";
constexpr char kBundleIdentifierKey[] = "BundleIdentifier";
constexpr char kSecondBundlePathKey[] = "SecondBundlePath";

constexpr char kContainerTypeApp[] = "App";
constexpr char kContainerTypeVPNBundle[] = "VPNBundle";

constexpr char kAppExtension[] = "app";
constexpr char kVPNPluginExtension[] = "vpnplugin";
constexpr char kMigrationMarkerName[] = "com.vantor.stowline.container_migrator.plist";

// An entry whose last component holds no dot at all is plain data and is not
// even stat'ed. This is deliberately wider than "has a path extension":
// ".hidden" and "name." have none, yet they are examined.
bool lastComponentHasDot(const sl::URL& url) { return url.lastPathComponent().find('.') != std::string::npos; }

bool isStringValue(const sl::Value& value) { return value.kind() == sl::ValueKind::String; }

}  // namespace

sl::Dictionary SLAppMigrator::_introspectContainer(const sl::URL& url, bool* orderResultEarly) {
  static constexpr char kFunctionName[] = "-[SLAppMigrator _introspectContainer:orderResultEarly:]";
  SLFileManager& fileManager = SLFileManager::defaultManager();
  sl::Dictionary record = sl::Dictionary::create();

  sl::Error error;
  const std::optional<std::vector<sl::URL>> entries =
      fileManager.urlsForItemsInDirectoryAtURL(url, false /* links included */, &error);
  if (!entries) {
    if (error.isPOSIX(ENOTDIR)) {
      SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Found regular file at %@ ; removing", url);
      (void)fileManager.removeItemAtURL(url);
    } else if (error.isPOSIX(ENOENT)) {
      SLMigratorLog(sl::kLogLevelNotice, kFunctionName,
                    "SLAppMigrator: Got ENOENT when introspecting %@ ; ignoring (likely raced with stowd)", url);
    } else {
      SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to get URLs in container %@ : %@", url,
                    error);
    }
    return nullptr;
  }

  record.set(kContainerPathKey, sl::String(url.path()));

  sl::URL appBundle;
  sl::URL vpnPlugin;
  // Once a marker failed to load, the record is dropped: later entries are
  // still examined (and can still stop the introspection or save the
  // container from deletion), but nothing more is recorded.
  bool recordDropped = false;

  for (const sl::URL& entry : *entries) {
    if (!lastComponentHasDot(entry)) continue;

    // Before any name is compared: an entry that cannot be examined stops
    // this container, whatever it is.
    struct stat st;
    if (::lstat(entry.fileSystemRepresentation(), &st) != 0) {
      int statErrno = errno;
      SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to stat path %s : %s", entry.path(),
                    strerror(statErrno));
      return nullptr;
    }
    const bool isLink = S_ISLNK(st.st_mode);
    const std::string extension = entry.pathExtension();

    if (extension == kAppExtension) {
      if (isLink) {
        SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Skipping container with app symlink at %@",
                      entry);
        return nullptr;
      }
      SLMigratorLog(sl::kLogLevelNotice, kFunctionName, "SLAppMigrator: Found app %@", entry);
      sl::String identifier = _bundleIdentifierForBundle(entry);
      if (identifier.isNull()) {
        SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Could not get identifier for bundle at %@",
                      entry);
        continue;
      }
      appBundle = entry;
      if (!recordDropped) {
        record.set(kBundlePathKey, sl::String(entry.path()));
        record.set(kContainerTypeKey, sl::String(kContainerTypeApp));
        record.set(kBundleIdentifierKey, identifier);
        if (orderResultEarly) *orderResultEarly = true;
      }
    } else if (extension == kVPNPluginExtension) {
      SLMigratorLog(sl::kLogLevelNotice, kFunctionName, "SLAppMigrator: Found vpn plugin %@", entry);
      if (isLink) {
        SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: VPN plugin was symlink; skipping container %@",
                      entry);
        return nullptr;
      }
      sl::String identifier = _bundleIdentifierForBundle(entry);
      if (identifier.isNull()) continue;
      vpnPlugin = entry;
      // An application bundle, once found, stays the principal bundle.
      if (appBundle.isNull() && !recordDropped) {
        record.set(kBundlePathKey, sl::String(entry.path()));
        record.set(kContainerTypeKey, sl::String(kContainerTypeVPNBundle));
        record.set(kBundleIdentifierKey, identifier);
        if (orderResultEarly) *orderResultEarly = false;
      }
    } else if (entry.lastPathComponent() == kMigrationMarkerName) {
      SLMigratorLog(sl::kLogLevelNotice, kFunctionName, "SLAppMigrator: Found migration marker %@", entry);
      if (isLink) {
        SLMigratorLog(sl::kLogLevelError, kFunctionName,
                      "SLAppMigrator: Migration marker was symlink; skipping container %@", entry);
        return nullptr;
      }
      sl::Dictionary marker = _loadAndValidateMigrationMarkerAtURL(entry);
      if (!marker.isNull()) {
        // The marker wins over everything else in the container: what was
        // gathered so far is dropped and nothing after it is looked at.
        if (orderResultEarly) *orderResultEarly = marker.get(kContainerTypeKey).asString() == kContainerTypeApp;
        return marker;
      }
      SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to load migration marker file from %@",
                    entry);
      recordDropped = true;
    }
  }

  if (appBundle.isNull() && vpnPlugin.isNull()) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName,
                  "SLAppMigrator: No app or vpn bundle found in container %@ ; removing it", url);
    (void)fileManager.removeItemAtURL(url);
    return nullptr;
  }
  if (recordDropped) return nullptr;

  if (!appBundle.isNull() && !vpnPlugin.isNull()) record.set(kSecondBundlePathKey, sl::String(vpnPlugin.path()));
  return record;
}

sl::String SLAppMigrator::_bundleIdentifierForBundle(const sl::URL& bundle) {
  std::shared_ptr<sl::Bundle> reader = sl::Bundle::createUnique(bundle);
  if (!reader) return nullptr;
  return reader->identifier();
}

sl::Dictionary SLAppMigrator::_loadAndValidateMigrationMarkerAtURL(const sl::URL& url) {
  static constexpr char kFunctionName[] = "-[SLAppMigrator _loadAndValidateMigrationMarkerAtURL:]";
  // Missing, unreadable, malformed or not a dictionary all read as null.
  sl::Dictionary marker = sl::dictionaryWithContentsOfURL(url);
  if (marker.isNull()) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to load migration marker file from %@",
                  url);
    return nullptr;
  }
  if (!isStringValue(marker.get(kBundlePathKey))) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName,
                  "SLAppMigrator: Failed to get bundle path from migration marker file %@", url);
    return nullptr;
  }
  // Only the kind is checked: a type other than App or VPNBundle is passed
  // on as it is.
  if (!isStringValue(marker.get(kContainerTypeKey))) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName,
                  "SLAppMigrator: Failed to get container type from migration marker file %@", url);
    return nullptr;
  }
  if (!isStringValue(marker.get(kContainerPathKey))) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName,
                  "SLAppMigrator: Failed to get container path from migration marker file %@", url);
    return nullptr;
  }
  if (!isStringValue(marker.get(kBundleIdentifierKey))) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName,
                  "SLAppMigrator: Failed to get container bundle ID from migration marker file %@", url);
    return nullptr;
  }
  if (marker.contains(kSecondBundlePathKey) && !isStringValue(marker.get(kSecondBundlePathKey))) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Second bundle path was not a string: %@",
                  marker.get(kSecondBundlePathKey));
    return nullptr;
  }
  // Keys beyond the five are kept and travel on with the record.
  return marker;
}
