// The bundle facility: a bundle is a directory with an "Info.plist" (XML or
// binary property list) at its top.
//
// A bundle's info dictionary is that file's dictionary plus
// kBundleInfoPlistURLKey, the file's URL, as the facility adds it. Its
// identifier is the string under kBundleIdentifierKey.
//
// A bundle object caches its info dictionary without a lock: it belongs to
// the caller that made it and is not used from two threads at once. In
// messages a bundle is written as its URL (url()).
#pragma once

#include <memory>
#include <string>

#include "Platform/URL.h"
#include "Platform/Value.h"

namespace sl {

inline constexpr char kBundleIdentifierKey[] = "PBBundleIdentifier";
inline constexpr char kBundleInfoPlistURLKey[] = "PBBundleInfoPlistURL";
inline constexpr char kBundleInfoPlistName[] = "Info.plist";

class Bundle {
 public:
  // A new bundle object for the directory at url, never one shared with
  // another caller; null when nothing stands there or it is not a directory
  // (links are followed, as opening a bundle by path does).
  static std::shared_ptr<Bundle> createUnique(const URL& url);

  const URL& url() const { return url_; }

  // The info dictionary, read on first use and kept; null when "Info.plist"
  // is missing, unreadable, malformed or not a dictionary.
  Dictionary infoDictionary() const;

  // kBundleIdentifierKey of the info dictionary when it is a string; null
  // otherwise.
  String identifier() const;

  // A new object read from "Info.plist" now: its dictionary with only the
  // top-level keys named in `keys` (an array of strings; other values are
  // ignored, and a null or empty array keeps no key), or, when the file's
  // top level is not a dictionary, that value as it is. Null when the file
  // cannot be read or parsed. kBundleInfoPlistURLKey is not added: the
  // result holds only what the file has. `options` is the caller's selector
  // of the read and does not change the result.
  Value createFilteredInfoPlist(const Array& keys, int options) const;

 private:
  explicit Bundle(URL url) : url_(std::move(url)) {}
  URL url_;
  mutable bool infoLoaded_ = false;
  mutable Dictionary info_;
};

}  // namespace sl
