// SLFileManager: carrying the store metadata items that accompany an
// application bundle from one directory into another.

#include <array>
#include <string>
#include <vector>

#include "FileManager/SLFileManager.h"
#include "Support/Errors.h"

namespace {

// The store items in the order they are captured, each beside the key that
// names its failure. This table is the one list of the names: the
// configuration answers it (through storeDataItemNames()) as its bundle
// metadata item names.
struct StoreDataItem {
  const char* name;
  const char* failureKey;
};
constexpr std::array<StoreDataItem, 4> kStoreDataItems{{
    {"Manifest.plist", "ManifestCaptureFailed"},
    {"JukoraArtwork", "JukoraArtworkCaptureFailed"},
    {"JukoraMetadata.plist", "JukoraMetadataCaptureFailed"},
    {"GeoJSON", "GeoJSONCaptureFailed"},
}};

constexpr char kLegacyErrorStringKey[] = "LegacyErrorString";

}  // namespace

const std::vector<std::string>& SLFileManager::storeDataItemNames() {
  // Made once and never destroyed, like the shared instance, so that it
  // outlives every static that may ask for it.
  static const std::vector<std::string>* const names = [] {
    auto* made = new std::vector<std::string>();
    for (const StoreDataItem& item : kStoreDataItems) made->emplace_back(item.name);
    return made;
  }();
  return *names;
}

bool SLFileManager::captureStoreDataFromDirectory(const sl::URL& source, const sl::URL& toDirectory, bool doCopy,
                                                  bool failureIsFatal, sl::Error* withError) {
  static constexpr char kFunctionName[] =
      "-[SLFileManager captureStoreDataFromDirectory:toDirectory:doCopy:failureIsFatal:withError:]";
  // Each item by itself: a missing item is simply not carried, and a failing
  // one either ends the capture (failureIsFatal) or leaves one logged line
  // and lets the rest go on. Items carried before a fatal failure stay where
  // they went.
  for (const StoreDataItem& item : kStoreDataItems) {
    const sl::URL from = source.URLByAppendingPathComponent(item.name, false);
    const sl::URL to = toDirectory.URLByAppendingPathComponent(item.name, false);
    sl::Error callError;
    const bool carried =
        doCopy ? copyItemIfExistsAtURL(from, to, &callError) : moveItemIfExistsAtURL(from, to, &callError);
    if (carried) continue;

    const sl::Dictionary userInfo{{kLegacyErrorStringKey, sl::String(item.failureKey)}};
    // Making the record writes its log line.
    sl::Error record = doCopy ? _CreateAndLogError(kFunctionName, __LINE__, SLInstallerErrorDomain,
                                                   kSLInstallerStoreDataCaptureError, callError, userInfo,
                                                   "Failed to copy %@ to %@", from, to)
                              : _CreateAndLogError(kFunctionName, __LINE__, SLInstallerErrorDomain,
                                                   kSLInstallerStoreDataCaptureError, callError, userInfo,
                                                   "Failed to move %@ to %@", from, to);
    if (failureIsFatal) return sl::fail(withError, std::move(record));
  }
  return true;
}
