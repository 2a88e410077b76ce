// The bundle facility on Linux: a bundle is nothing more than a directory,
// and everything it knows comes from the "Info.plist" at its top.

#include "Platform/Bundle.h"

#include <sys/stat.h>

#include <vector>

#include "Platform/PropertyList.h"

namespace sl {

namespace {

URL infoPlistURLOf(const URL& bundle) { return bundle.URLByAppendingPathComponent(kBundleInfoPlistName, false); }

}  // namespace

std::shared_ptr<Bundle> Bundle::createUnique(const URL& url) {
  if (url.isNull()) return nullptr;
  // stat, not lstat: a bundle opened by path is opened through any link on
  // the way, its last component included.
  struct stat st;
  if (::stat(url.fileSystemRepresentation(), &st) != 0 || !S_ISDIR(st.st_mode)) return nullptr;
  // A fresh object every time, so that no caller ever sees another caller's
  // cached info dictionary.
  return std::shared_ptr<Bundle>(new Bundle(url));
}

Dictionary Bundle::infoDictionary() const {
  if (!infoLoaded_) {
    const URL infoPlistURL = infoPlistURLOf(url_);
    Dictionary info = dictionaryWithContentsOfURL(infoPlistURL);
    if (!info.isNull()) info.set(kBundleInfoPlistURLKey, infoPlistURL);
    info_ = std::move(info);
    // A failed read is kept too: the object answers the same thing for
    // its whole life, as the facility's bundle objects do.
    infoLoaded_ = true;
  }
  return info_;
}

String Bundle::identifier() const { return infoDictionary().get(kBundleIdentifierKey).asString(); }

Value Bundle::createFilteredInfoPlist(const Array& keys, int options) const {
  // There is only one way of reading here; the selector changes nothing.
  (void)options;
  std::vector<uint8_t> bytes;
  if (!readFileContents(infoPlistURLOf(url_), &bytes)) return nullptr;
  Value top = propertyListFromData(bytes);
  if (top.kind() != ValueKind::Dictionary) return top;  // null on a parse failure

  const Dictionary whole = top.asDictionary();
  Dictionary filtered = Dictionary::create();
  for (const Value& key : keys) {
    const String name = key.asString();
    if (name.isNull()) continue;
    // set() with a null value would remove, which is what an absent key
    // should leave behind anyway: nothing.
    filtered.set(name.view(), whole.get(name.view()));
  }
  return filtered;
}

}  // namespace sl
