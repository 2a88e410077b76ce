// SLAppMigrator: carrying one old container into the new layout, and the
// check for anything left behind in it.
//
// The order of the steps is what makes an interrupted run resumable: the
// record goes into the container as its migration marker before anything is
// moved out of it, every step after that tolerates finding its part already
// done (a missing source is nothing to move), and the container is deleted
// only at the end. A container whose migration fails keeps its marker, so
// that the next run takes the record from it; the one exception is a failed
// bundle installation, after which the data already lives in the new data
// container and the old container is deleted all the same.

#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "AppMigrator/OldLayout.h"
#include "AppMigrator/AppMigrator.h"
#include "FileManager/SLFileManager.h"
#include "Platform/ApplicationRegistry.h"
#include "Platform/AtomicFile.h"
#include "Platform/PropertyList.h"

namespace {

using sl::migrator::kContainerPathKey;
using sl::migrator::kBundlePathKey;
using sl::migrator::kSecondBundlePathKey;
using sl::migrator::kBundleIdentifierKey;
using sl::migrator::kContainerTypeKey;
using sl::migrator::kContainerTypeApp;

// The marker this system writes, and the two older marker names that are
// never read but are not leftovers either.
using sl::migrator::kMigrationMarkerName;
constexpr std::string_view kMarkerFamilyNames[] = {
    kMigrationMarkerName,
    "com.vantor.stowline.migration_marker",
    "com.vantor.stowline.placeholder",
};

// The record holds paths as plain strings; containers and bundles are
// directories. A missing (or non-string) value gives a null URL.
sl::URL directoryURLInRecord(const sl::Dictionary& record, std::string_view key) {
  return sl::URL::fileURLWithPath(record.get(key).asString().view(), true);
}

bool isMarkerFamilyName(std::string_view name) {
  for (std::string_view marker : kMarkerFamilyNames) {
    if (name == marker) return true;
  }
  return false;
}

}  // namespace

bool SLAppMigrator::_migrateContainerWithInfo(const sl::Dictionary& info) {
  static constexpr char kFunctionName[] = "-[SLAppMigrator _migrateContainerWithInfo:]";
  SLFileManager& fileManager = SLFileManager::defaultManager();
  // The placeholder, the moves, the new containers: their flushes wait for
  // the next step that depends on them (a registry commit, a removal),
  // which makes them all at once.
  sl::DeferredSyncs deferred;

  const sl::URL container = directoryURLInRecord(info, kContainerPathKey);
  const sl::URL bundle = directoryURLInRecord(info, kBundlePathKey);
  // Null when the container holds no VPN plug-in beside the application.
  const sl::URL secondBundle = directoryURLInRecord(info, kSecondBundlePathKey);
  const sl::String identifier = info.get(kBundleIdentifierKey).asString();
  const sl::String type = info.get(kContainerTypeKey).asString();

  // Asked before anything changes: a resumed run may already have moved the
  // bundle away, and then it is no placeholder.
  const bool bundleIsPlaceholder = fileManager.bundleAtURLIsPlaceholder(bundle);

  const auto markerFailed = [&] {
    SLMigratorLog(sl::kLogLevelError, kFunctionName,
                  "SLAppMigrator: Failed to write out container marker dictionary... hopefully we don't need it to "
                  "recover.");
  };
  // Binary, which carries any bytes of a name; XML cannot carry a path that
  // is not UTF-8, and a container without its marker cannot be resumed.
  if (!sl::writePropertyListToURL(info, container.URLByAppendingPathComponent(kMigrationMarkerName, false),
                                  sl::PropertyListFormat::Binary)) {
    markerFailed();
  }

  // Without a registered application there is no data container to move the
  // data into, so a placeholder comes first. A VPN plug-in gets none.
  if (type == kContainerTypeApp) {
    if (RGApplicationWorkspace::defaultWorkspace().applicationIsInstalled(identifier)) {
      SLMigratorLog(sl::kLogLevelNotice, kFunctionName,
                    "SLAppMigrator: App %@ is already installed, so not creating placeholder.", identifier);
    } else if (!_stageAndInstallPlaceholderForBundleAtURL(bundle, identifier, container)) {
      return false;
    }
  }

  const std::shared_ptr<RGBundleProxy> proxy = RGBundleProxy::bundleProxyForIdentifier(identifier);
  if (!proxy) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to get bundle proxy for identifier %@",
                  identifier);
    return false;
  }
  const sl::URL dataContainer = proxy->dataContainerURL();
  if (dataContainer.isNull()) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to get data container URL for %@",
                  identifier);
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Proxy had bundle identifier %@",
                  proxy->bundleIdentifier());
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Proxy had bundle type %@", proxy->bundleType());
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Proxy had bundle URL %@", proxy->bundleURL());
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Proxy had bundle container URL %@",
                  proxy->bundleContainerURL());
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Proxy %s have backing bundle",
                  proxy->foundBackingBundle() ? "did" : "did not");
    return false;
  }

  // The marker's name is on disk before anything leaves the container (its
  // content was flushed as it was written). A placeholder's install has
  // flushed it already, with its own changes.
  if (!sl::flushDeferredSyncs()) markerFailed();

  SLMigratorLog(sl::kLogLevelNotice, kFunctionName, "SLAppMigrator: Moving data from container %@ to %@", container,
                dataContainer);
  if (!_migrateDataContainerForIdentifier(identifier, container, dataContainer)) return false;

  bool result = true;
  // A placeholder bundle is not installed over the placeholder the registry
  // already holds; its container has nothing more to give.
  if (!bundleIsPlaceholder) {
    SLMigratorLog(sl::kLogLevelNotice, kFunctionName,
                  "SLAppMigrator: Staging and installing app %@ at %@ (and secondary %@)", identifier, bundle,
                  secondBundle);
    if (!_stageAndInstallBundleAtURL(bundle, identifier, secondBundle, container)) {
      // The data has moved already: keeping the container would only have
      // the next run find it without its data. It goes, and the result
      // stays false.
      result = false;
    } else {
      if (!_migrateGroupContainersForIdentifier(identifier)) return false;
      if (_containerHasMissedItems(container, identifier)) return false;
    }
  }

  SLMigratorLog(sl::kLogLevelNotice, kFunctionName, "SLAppMigrator: Removing container for %@ at %@", identifier,
                container);
  sl::Error error;
  if (!fileManager.removeItemAtURL(container, &error)) {
    // The final check of the old container root finds it and fails the
    // migration; this container's result stands.
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to remove container %@ : %@", container,
                  error);
  }
  return result;
}

// True when the container holds anything but the marker family, or cannot
// be listed: either way it must not be deleted.
bool SLAppMigrator::_containerHasMissedItems(const sl::URL& container, const sl::String& withIdentifier) {
  static constexpr char kFunctionName[] = "-[SLAppMigrator _containerHasMissedItems:withIdentifier:]";
  sl::Error error;
  const std::optional<std::vector<sl::URL>> items =
      SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(container, false, &error);
  if (!items) {
    SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Failed to enumerate container %@ for %@ : %@",
                  container, withIdentifier, error);
    return true;
  }
  sl::Array missed = sl::Array::create();
  for (const sl::URL& item : *items) {
    if (!isMarkerFamilyName(item.lastPathComponent())) missed.append(item);
  }
  if (missed.isEmpty()) return false;
  SLMigratorLog(sl::kLogLevelError, kFunctionName, "SLAppMigrator: Found missed items in %@ for %@: %@", container,
                withIdentifier, missed);
  return true;
}
