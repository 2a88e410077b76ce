// SLFileManager: symbolic links, real paths and the containment check.
//
// The containment check decides whether an item found in a tree that
// someone else left behind really lies inside that tree. It works in two
// stages: a lexical walk over a relative link's content (no file-system
// access, no link followed), then a comparison of real paths component by
// component. Every refusal is one error line in the installer log; the check
// makes no error record.

#include <limits.h>
#include <stdlib.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "FileManager/SLFileManager.h"
#include "FileManager/StowlineAdditions.h"
#include "Platform/Mutations.h"
#include "Support/Errors.h"
#include "Support/Log.h"

namespace {

// Link contents and real paths are read into zeroed buffers of Linux's
// PATH_MAX, the longest path the kernel accepts, so nothing it accepts is cut.
using PathBuffer = std::array<char, PATH_MAX>;

// A path that begins with this loses its first eight characters, "/private":
// "/private/var/x" becomes "/var/x".
constexpr std::string_view kPrivatePrefix = "/private/";

// readlink into `buffer`, whose content is then zero-terminated. A content
// that fills the whole buffer may have been cut; it is refused with
// ENAMETOOLONG rather than used. Returns the length, or -1 with errno.
ssize_t readLinkInto(const char* path, PathBuffer& buffer) {
  ssize_t length = ::readlink(path, buffer.data(), buffer.size());
  if (length < 0) return -1;
  if (static_cast<size_t>(length) >= buffer.size()) {
    errno = ENAMETOOLONG;
    return -1;
  }
  buffer[static_cast<size_t>(length)] = '\0';
  return length;
}

// Joins components as path joining does: "/" + "a" gives "/a", "a" + "b"
// gives "a/b".
std::string joinComponents(std::vector<std::string>::const_iterator begin,
                           std::vector<std::string>::const_iterator end) {
  std::string joined;
  for (auto it = begin; it != end; ++it) {
    if (!joined.empty() && joined.back() != '/') joined += '/';
    joined += *it;
  }
  return joined;
}

// The path less its last component: "/a/l" gives "/a", "/l" gives "/", "l"
// gives "".
std::string deletingLastPathComponent(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  size_t slash = path.rfind('/');
  if (slash == std::string_view::npos) return {};
  if (slash == 0) return "/";
  return std::string(path.substr(0, slash));
}

// `component` appended to `path` with one separator between them.
std::string appendingPathComponent(std::string path, std::string_view component) {
  if (!path.empty() && path.back() != '/') path += '/';
  path += component;
  return path;
}

// The URL for `url`'s path without a leading "/private" ("/private/var/x"
// becomes "/var/x"); `url` itself when its path does not begin "/private/".
sl::URL strippingPrivatePrefix(const sl::URL& url) {
  std::string_view path = url.path();
  if (!path.starts_with(kPrivatePrefix)) return url;
  return sl::URL::fileURLWithPath(path.substr(kPrivatePrefix.size() - 1), url.isDirectory());
}

// The first index to compare of a real path's components: a second
// component "private" is skipped.
size_t firstComparedComponent(const std::vector<std::string>& components) {
  return components.size() > 1 && components[1] == "private" ? 2 : 1;
}

}  // namespace

bool SLFileManager::createSymbolicLinkAtURL(const sl::URL& url, const sl::URL& withDestinationURL,
                                            sl::Error* error) {
  static constexpr char kFunctionName[] = "-[SLFileManager createSymbolicLinkAtURL:withDestinationURL:error:]";
  const char* content = withDestinationURL.fileSystemRepresentation();
  const char* linkPath = url.fileSystemRepresentation();
  if (sl::mut::symlink(content, linkPath) != 0) {
    int symlinkErrno = errno;
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, symlinkErrno,
                                        "Could not create symlink containing %s at %s: %s", content, linkPath,
                                        strerror(symlinkErrno)));
  }
  return true;
}

sl::URL SLFileManager::destinationOfSymbolicLinkAtURL(const sl::URL& url, sl::Error* error) {
  static constexpr char kFunctionName[] = "-[SLFileManager destinationOfSymbolicLinkAtURL:error:]";
  const char* linkPath = url.fileSystemRepresentation();
  PathBuffer buffer{};
  ssize_t length = readLinkInto(linkPath, buffer);
  if (length < 0) {
    int readlinkErrno = errno;
    sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, readlinkErrno,
                                 "Could not readlink %s : %s", linkPath, strerror(readlinkErrno)));
    return nullptr;
  }
  // The content as it stands: a relative content stays relative, it is not
  // resolved against the link's directory.
  sl::String content = StowlineAdditions::stringWithFileSystemRepresentation(buffer.data(), length);
  return sl::URL::fileURLWithPath(content.view(), false);
}

bool SLFileManager::_validateSymlink(const sl::String& path, int32_t withStartingDepth, int32_t* andEndingDepth) {
  if (path.isNull()) return false;
  int32_t depth = withStartingDepth;
  for (const std::string& component : sl::pathComponents(path.view())) {
    if (component == "..") {
      --depth;
    } else if (component != "." && component != "/") {
      ++depth;
    }
    if (depth < withStartingDepth) return false;
  }
  if (andEndingDepth != nullptr) *andEndingDepth = depth;
  return true;
}

sl::URL SLFileManager::_realPathForURL(const sl::URL& url, bool allowNonExistentPathComponents) {
  static constexpr char kFunctionName[] = "-[SLFileManager _realPathForURL:allowNonExistentPathComponents:]";
  const char* path = url.fileSystemRepresentation();
  PathBuffer resolved{};
  if (::realpath(path, resolved.data()) != nullptr) {
    return sl::URL::fileURLWithFileSystemRepresentation(resolved.data(), false);
  }
  int realpathErrno = errno;
  if (realpathErrno == ENOENT && allowNonExistentPathComponents) {
    return _realPathWhatExistsInPath(sl::String(url.path()));
  }
  // On failure the buffer holds the part of the path that was resolved
  // before the component at which resolution stopped.
  SLLog(sl::kLogLevelError, kFunctionName, "Failed to realpath %s : %s at %s", path, strerror(realpathErrno),
        resolved.data());
  return nullptr;
}

sl::URL SLFileManager::_realPathWhatExistsInPath(const sl::String& path) {
  static constexpr char kFunctionName[] = "-[SLFileManager _realPathWhatExistsInPath:]";
  const std::vector<std::string> components = sl::pathComponents(path.view());
  const size_t count = components.size();
  if (count < 2) return nullptr;

  // Longest prefix first; "/" (or a relative path's first component) alone
  // is never tried. A prefix that exists but does not resolve, such as a
  // dangling link, only sends the search on to the next shorter one.
  for (size_t k = count; k >= 2; --k) {
    const sl::URL prefix = sl::URL::fileURLWithPath(joinComponents(components.begin(), components.begin() + k), false);
    if (!itemExistsAtURL(prefix)) continue;
    const sl::URL realPrefix = _realPathForURL(prefix, false);
    if (realPrefix.isNull()) continue;
    const std::string remainder = joinComponents(components.begin() + k, components.end());
    SLLog(sl::kLogLevelDebug, kFunctionName, "Realpathed %@ ; appending non-existing components %@",
          sl::String(realPrefix.path()), sl::String(remainder));
    return realPrefix.URLByAppendingPathComponent(remainder, false);
  }
  return nullptr;
}

sl::URL SLFileManager::realPathForURL(const sl::URL& url, const sl::URL& ifChildOfURL) {
  static constexpr char kFunctionName[] = "-[SLFileManager realPathForURL:ifChildOfURL:]";
  if (url.isNull() || ifChildOfURL.isNull()) {
    SLLog(sl::kLogLevelError, kFunctionName, "The base path %@ and/or suspicious path %@ were nil", ifChildOfURL,
          url);
    return nullptr;
  }

  // The same tree may be named with or without the "/private" that the
  // system's top-level directories resolve into.
  const sl::URL base = strippingPrivatePrefix(ifChildOfURL);
  const sl::URL suspicious = strippingPrivatePrefix(url);
  const sl::String basePath(base.path());
  const sl::String suspiciousPath(suspicious.path());

  // A cheap first filter only: "/var/basement" passes for "/var/base" here
  // and is caught by the component comparison below.
  if (!suspiciousPath.view().starts_with(basePath.view())) {
    SLLog(sl::kLogLevelError, kFunctionName, "supiscious path %@ does not contain base path %@ as a prefix",
          suspiciousPath, basePath);
    return nullptr;
  }
  if (StowlineAdditions::containsDotDotPathComponents(suspiciousPath)) {
    SLLog(sl::kLogLevelError, kFunctionName, "The suspicious path %@ contains '..' paths, which are invalid",
          suspiciousPath);
    return nullptr;
  }

  PathBuffer content{};
  bool isRelativeLink = false;
  if (readLinkInto(suspicious.fileSystemRepresentation(), content) < 0) {
    int readlinkErrno = errno;
    // Not a link, or nothing there yet: an ordinary item, judged by its real
    // path below.
    if (readlinkErrno != EINVAL && readlinkErrno != ENOENT) {
      SLLog(sl::kLogLevelError, kFunctionName, "Readlink failed: %s", strerror(readlinkErrno));
      return nullptr;
    }
  } else if (content[0] == '/') {
    SLLog(sl::kLogLevelError, kFunctionName, "Rejecting %@ -> %s, as absolute symlinks are not allowed",
          suspiciousPath, content.data());
    return nullptr;
  } else {
    // Read the content from the link's directory, lexically: it must never
    // climb above the base at any step, whatever the components name.
    int32_t baseDepth = 0;
    if (!_validateSymlink(basePath, 0, &baseDepth)) {
      SLLog(sl::kLogLevelError, kFunctionName, "Failed to retrieve depth of %@", basePath);
      return nullptr;
    }
    const std::string linkDirectory = deletingLastPathComponent(suspiciousPath.view().substr(basePath.length()));
    const sl::String joined(appendingPathComponent(linkDirectory, content.data()));
    if (!_validateSymlink(joined, baseDepth, nullptr)) {
      SLLog(sl::kLogLevelError, kFunctionName, "Rejecting %@ -> %@, as it is points outside or to the base %@",
            suspiciousPath, joined, basePath);
      return nullptr;
    }
    isRelativeLink = true;
  }

  const sl::URL realBase = _realPathForURL(base, false);
  if (realBase.isNull()) {
    SLLog(sl::kLogLevelError, kFunctionName, "Failed to retrieve realpath for base path %@ ", basePath);
    return nullptr;
  }
  // realpath follows the link itself, so this is where the link leads.
  const sl::URL realSuspicious = _realPathForURL(suspicious, true);
  if (realSuspicious.isNull()) {
    SLLog(sl::kLogLevelError, kFunctionName, "Failed to retrieve realpath for suspicious path %@", suspiciousPath);
    return nullptr;
  }
  if (isRelativeLink) return realSuspicious;

  const sl::String realBasePath(realBase.path());
  const sl::String realSuspiciousPath(realSuspicious.path());
  const std::vector<std::string> baseComponents = sl::pathComponents(realBasePath.view());
  const std::vector<std::string> suspiciousComponents = sl::pathComponents(realSuspiciousPath.view());
  if (baseComponents.size() < 2 || suspiciousComponents.size() < 2) {
    SLLog(sl::kLogLevelError, kFunctionName,
          "Rejecting %@ with base %@ because real component counts don't make sense (reals %@ ; %@)",
          suspiciousPath, basePath, realSuspiciousPath, realBasePath);
    return nullptr;
  }
  const size_t baseFirst = firstComparedComponent(baseComponents);
  const size_t suspiciousFirst = firstComparedComponent(suspiciousComponents);
  if (baseComponents.size() - baseFirst > suspiciousComponents.size() - suspiciousFirst) {
    SLLog(sl::kLogLevelError, kFunctionName,
          "Rejecting %@ with base %@ because base component count is greater than child component count "
          "(reals %@ ; %@)",
          suspiciousPath, basePath, realSuspiciousPath, realBasePath);
    return nullptr;
  }
  for (size_t b = baseFirst, s = suspiciousFirst; b < baseComponents.size(); ++b, ++s) {
    if (baseComponents[b] != suspiciousComponents[s]) {
      SLLog(sl::kLogLevelError, kFunctionName,
            "Rejecting %@ with base %@ (reals %@ ; %@) because components diverge at %@ != %@", suspiciousPath,
            basePath, realSuspiciousPath, realBasePath, sl::String(baseComponents[b]),
            sl::String(suspiciousComponents[s]));
      return nullptr;
    }
  }
  return realSuspicious;
}
