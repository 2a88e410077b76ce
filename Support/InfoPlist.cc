// SLLoadInfoPlist.

#include "Support/InfoPlist.h"

#include <atomic>
#include <memory>
#include <mutex>

#include "FileManager/SLFileManager.h"
#include "Platform/Bundle.h"
#include "Support/Log.h"

namespace {

constexpr char kFunctionName[] = "SLLoadInfoPlist";
// What the filtered read is asked for; the facility decides what it selects.
constexpr int kFilteredInfoPlistOptions = 1;

// Serialises the bundle work of every load in the process. Constant-
// initialised, so it is ready before any static constructor could call in.
// It is the innermost lock of the system: the configuration's lock may be
// held around a load, but nothing that takes the configuration's lock runs
// while this one is held.
constinit std::mutex gLoadLock;
std::atomic<uint64_t> gLockAcquisitions{0};

}  // namespace

sl::Dictionary SLLoadInfoPlist(const sl::URL& bundleURL, const sl::Array& keys) {
  const sl::URL infoPlistURL = bundleURL.URLByAppendingPathComponent(sl::kBundleInfoPlistName, false);
  // Only a path that is certainly absent ends the load here; one whose state
  // cannot be determined is tried, and fails below if it must.
  if (SLFileManager::defaultManager().itemDoesNotExistAtURL(infoPlistURL)) {
    SLLog(sl::kLogLevelDebug, kFunctionName, "Missing Info.plist at %@", infoPlistURL);
    return nullptr;
  }

  // Declared before the bundle and the values read from it, so that every one
  // of them is released before the lock is, on every path.
  std::lock_guard<std::mutex> guard(gLoadLock);
  gLockAcquisitions.fetch_add(1, std::memory_order_relaxed);

  const std::shared_ptr<sl::Bundle> bundle = sl::Bundle::createUnique(bundleURL);
  if (!bundle) {
    SLLog(sl::kLogLevelError, kFunctionName, "Failed to create PBBundle from URL %@", bundleURL);
    return nullptr;
  }

  if (!keys.isNull()) {
    const sl::Value filtered = bundle->createFilteredInfoPlist(keys, kFilteredInfoPlistOptions);
    if (filtered.isNull()) {
      SLLog(sl::kLogLevelError, kFunctionName, "Failed to get filtered Info.plist with keys %@ from bundle %@", keys,
            bundle->url());
      return nullptr;
    }
    if (filtered.kind() != sl::ValueKind::Dictionary) {
      SLLog(sl::kLogLevelError, kFunctionName,
            "Object returned from _PBBundleCreateFilteredInfoPlist was not a dictionary, was type %@",
            sl::String(filtered.typeName()));
      return nullptr;
    }
    // The filtered object was made for this call alone; once it goes out of
    // scope the result is its only holder, and the caller's changes touch
    // nothing else.
    return filtered.asDictionary();
  }

  const sl::Dictionary info = bundle->infoDictionary();
  if (info.isNull()) {
    SLLog(sl::kLogLevelError, kFunctionName, "PBBundleGetInfoDictionary failed for bundle %@", bundleURL);
    return nullptr;
  }
  // The copy is changed, never the bundle's own dictionary.
  sl::Dictionary result = info;
  result.remove(sl::kBundleInfoPlistURLKey);
  return result;
}

namespace sl::infoplist_detail {

uint64_t lockAcquisitionCount() { return gLockAcquisitions.load(std::memory_order_relaxed); }

}  // namespace sl::infoplist_detail
