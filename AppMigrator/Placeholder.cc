// Placeholder installation: a minimal bundle (identity, versions, display
// name, icon) installed for an application the registry does not know yet,
// so that the registry hands out a data container before the data moves.
//
// The placeholder is built in TMP/com.vantor.stowline.migrator/<id>.app and
// that directory is removed at the end of every call, whatever happened;
// the parent stays. TMP is shared: the parent must be a private directory
// of this user, so that nobody else can plant or swap anything in it.

#include <cerrno>
#include <cstdint>
#include <memory>
#include <string_view>

#include "AppMigrator/AppMigrator.h"
#include "FileManager/SLFileManager.h"
#include "Platform/ApplicationRegistry.h"
#include "Platform/AtomicFile.h"
#include "Platform/FileData.h"
#include "Platform/Icon.h"
#include "Platform/ImageDestination.h"
#include "Platform/PropertyList.h"
#include "Platform/TemporaryDirectory.h"

namespace {

constexpr char kPlaceholderFunctionName[] =
    "-[SLAppMigrator _stageAndInstallPlaceholderForBundleAtURL:withIdentifier:inContainerURL:]";
constexpr char kIconFunctionName[] = "-[SLAppMigrator _writeIconForBundle:toURL:]";

constexpr char kStagingParentName[] = "com.vantor.stowline.migrator";
constexpr char kStoreMetadataName[] = "JukoraMetadata.plist";
constexpr char kIconFileName[] = "Icon.png";
constexpr uint64_t kMigratorInstallType = 6;

// The keys the placeholder takes over from the real bundle, in this order.
// (The dictionary keeps its keys sorted, so the order does not survive into
// the file; it is the order of the copy.)
constexpr const char* kCopiedInfoKeys[] = {
    "PBBundleIdentifier", "PBBundleDisplayName", "PBBundleExecutable", "PBBundleVersion", "PBBundleShortVersionString",
};
constexpr char kIconFileKey[] = "PBBundleIconFile";

}  // namespace

bool SLAppMigrator::_stageAndInstallPlaceholderForBundleAtURL(const sl::URL& bundle, const sl::String& withIdentifier,
                                                              const sl::URL& inContainerURL) {
  SLFileManager& fm = SLFileManager::defaultManager();
  const sl::URL metadataURL = inContainerURL.URLByAppendingPathComponent(kStoreMetadataName, false);
  const sl::URL placeholder = sl::perProcessTemporaryDirectory()
                                  .URLByAppendingPathComponent(kStagingParentName, true)
                                  .URLByAppendingPathComponent(withIdentifier.view(), true)
                                  .URLByAppendingPathExtension("app");

  // An identifier holding a separator or a NUL (or none at all) would put the
  // directory, and its removal at the end, somewhere else than below the
  // staging parent; a staging parent that is not this user's own would let
  // that removal reach through whatever stands there. Either is refused as
  // a creation failure, and nothing is removed.
  sl::Error refusal;
  const bool usableName = withIdentifier.length() != 0 &&
                          withIdentifier.view().find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
  if (!usableName) {
    refusal = sl::Error::posix(EINVAL, sl::format("%@ is not usable as a placeholder directory name", withIdentifier));
  }
  if (!usableName || sl::privateTemporarySubdirectory(kStagingParentName, &refusal).isNull()) {
    SLMigratorLog(sl::kLogLevelError, kPlaceholderFunctionName,
                  "SLAppMigrator: Failed to create staged placeholder directory at %@ : %@", placeholder, refusal);
    return false;
  }
  // What a run that stopped half-way left is not built upon.
  if (fm.itemExistsAtURL(placeholder)) (void)fm.removeItemAtURL(placeholder);

  const bool result = [&]() -> bool {
    // The placeholder is scratch until the registry has installed it, and
    // the install's commit flushes it whole: its files wait for that flush.
    // After a crash before it, they are made again.
    sl::DeferredSyncs scratch(sl::DeferredSyncs::What::kDirectoriesAndContent);
    sl::Error error;
    if (!fm.createDirectoryAtURL(placeholder, true, 0755, &error)) {
      SLMigratorLog(sl::kLogLevelError, kPlaceholderFunctionName,
                    "SLAppMigrator: Failed to create staged placeholder directory at %@ : %@", placeholder, error);
      return false;
    }

    // A missing file is the usual case and silent; any other failure is
    // logged and the placeholder goes without store metadata.
    sl::Error readError;
    const sl::Data metadata = sl::dataWithContentsOfURL(metadataURL, &readError);
    if (metadata.isNull() &&
        !(readError.domain() == sl::kFileErrorDomain && readError.code() == sl::kFileReadNoSuchFileError)) {
      SLMigratorLog(sl::kLogLevelError, kPlaceholderFunctionName, "SLAppMigrator: Failed to read %@ : %@", metadataURL,
                    readError);
    }

    const std::shared_ptr<sl::Bundle> opened = sl::Bundle::createUnique(bundle);
    if (!opened) {
      SLMigratorLog(sl::kLogLevelError, kPlaceholderFunctionName, "SLAppMigrator: Failed to create PBBundle for %@",
                    bundle);
      return false;
    }
    const sl::Dictionary info = opened->infoDictionary();
    if (info.isNull()) {
      SLMigratorLog(sl::kLogLevelError, kPlaceholderFunctionName,
                    "SLAppMigrator: Failed to get bundle info dictionary for bundle %@", bundle);
      return false;
    }

    sl::Dictionary placeholderInfo = sl::Dictionary::create();
    for (const char* key : kCopiedInfoKeys) {
      const sl::Value value = info.get(key);
      if (!value.isNull()) placeholderInfo.set(key, value);
    }

    const sl::URL iconURL = placeholder.URLByAppendingPathComponent(kIconFileName, false);
    if (_writeIconForBundle(*opened, iconURL)) {
      placeholderInfo.set(kIconFileKey, sl::String(kIconFileName));
    } else {
      SLMigratorLog(sl::kLogLevelError, kPlaceholderFunctionName,
                    "SLAppMigrator: Writing placeholder icon for app %@ to %@ failed", withIdentifier, iconURL);
    }

    const sl::URL infoURL = placeholder.URLByAppendingPathComponent(sl::kBundleInfoPlistName, false);
    // Binary, which carries whatever the bundle's own Info.plist held.
    if (!sl::writePropertyListToURL(placeholderInfo, infoURL, sl::PropertyListFormat::Binary)) {
      SLMigratorLog(sl::kLogLevelError, kPlaceholderFunctionName,
                    "SLAppMigrator: Failed to write placeholder Info.plist to %@", infoURL);
      return false;
    }

    SLMigratorLog(sl::kLogLevelNotice, kPlaceholderFunctionName, "SLAppMigrator: Installing placeholder for %@",
                  withIdentifier);

    sl::Dictionary options{
        {RGInstallTypeKey, sl::Number(kMigratorInstallType)},
        {RGPackageTypeKey, sl::String(RGPackageTypePlaceholder)},
        {RGBundleIdentifierOptionKey, withIdentifier},
        {RGSkipBlacklistOptionKey, sl::Boolean(true)},
    };
    if (!metadata.isNull()) options.set(RGJukoraMetadataKey, metadata);

    sl::Error installError;
    if (!RGApplicationWorkspace::defaultWorkspace().installApplication(placeholder, options, &installError)) {
      SLMigratorLog(sl::kLogLevelError, kPlaceholderFunctionName,
                    "SLAppMigrator: Failed to install placeholder for %@: %@", withIdentifier, installError.userInfo());
      return false;
    }
    return true;
  }();

  // The registry has taken what it needs by now (on success it moved the
  // bundle away); whatever is left goes, and the outcome does not matter.
  (void)fm.removeItemAtURL(placeholder);
  return result;
}

bool SLAppMigrator::_writeIconForBundle(const sl::Bundle& bundle, const sl::URL& toURL) {
  const std::shared_ptr<const sl::Image> image = sl::renderHomeScreenIcon(bundle.url());
  if (!image) {
    SLMigratorLog(sl::kLogLevelError, kIconFunctionName, "SLAppMigrator: Failed to create icon from bundle %@",
                  bundle.url());
    return false;
  }

  sl::MutableDataBuffer buffer;
  const KVImageDestinationOwner destination(KVImageDestinationCreateWithData(buffer, kUTTypePNG, 1));
  if (!destination) {
    SLMigratorLog(sl::kLogLevelError, kIconFunctionName,
                  "SLAppMigrator: KVImageDestinationCreateWithData returned NULL kvImage from bundle %@", bundle.url());
    return false;
  }
  KVImageDestinationAddImage(destination.get(), *image);
  if (!KVImageDestinationFinalize(destination.get())) {
    SLMigratorLog(sl::kLogLevelError, kIconFunctionName,
                  "SLAppMigrator: KVImageDestinationFinalize failed for icon from bundle %@", bundle.url());
    return false;
  }

  sl::Error error;
  if (!sl::writeFileAtomically(toURL, buffer.bytes, 0644, &error)) {
    SLMigratorLog(sl::kLogLevelError, kIconFunctionName, "SLAppMigrator: Failed to write image data to %@ : %@", toURL,
                  error);
    return false;
  }
  return true;
}
