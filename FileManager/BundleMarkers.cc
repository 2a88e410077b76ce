// SLFileManager: the placeholder marker and the install type, two extended
// attributes of a bundle directory.
//
// Both live on the bundle path itself (XATTR_NOFOLLOW), at position 0, and
// are created or replaced by a write. The names carry no Linux namespace, so
// they are stored under "user.". Values are little-endian whatever the host:
// the bytes are assembled and taken apart here one by one.
//
//   "com.vantor.stowd.placeholder"  4 bytes, the 32-bit integer 1; readers
//                                   only ask whether a 4-byte value is there
//   "com.vantor.stowd.installType"  8 bytes, an unsigned 64-bit number stored
//                                   and returned without interpretation;
//                                   absent means 0

#include <cerrno>
#include <cstdint>
#include <cstring>

#include "FileManager/SLFileManager.h"
#include "Platform/ExtendedAttributes.h"
#include "Support/Errors.h"

namespace {

constexpr char kPlaceholderAttribute[] = "com.vantor.stowd.placeholder";
constexpr char kInstallTypeAttribute[] = "com.vantor.stowd.installType";
constexpr size_t kPlaceholderSize = 4;
constexpr size_t kInstallTypeSize = 8;

}  // namespace

bool SLFileManager::markBundleAsPlaceholder(const sl::URL& url, sl::Error* withError) {
  static constexpr char kFunctionName[] = "-[SLFileManager markBundleAsPlaceholder:withError:]";
  const char* path = url.fileSystemRepresentation();
  const uint8_t value[kPlaceholderSize] = {1, 0, 0, 0};  // 1, little-endian
  if (sl::setxattr(path, kPlaceholderAttribute, value, sizeof value, 0, sl::XATTR_NOFOLLOW) != 0) {
    const int setErrno = errno;
    return sl::fail(withError, _CreateAndLogError(kFunctionName, __LINE__, SLInstallerErrorDomain,
                                                  kSLInstallerFileSystemError, sl::Error::posix(setErrno), nullptr,
                                                  "Could't set placeholder EA on \"%s\": %s", path,
                                                  strerror(setErrno)));
  }
  return true;
}

bool SLFileManager::bundleAtURLIsPlaceholder(const sl::URL& url) {
  // Presence of a 4-byte value is the whole test: its bytes are not
  // compared with 1. Every failure, a longer value (ERANGE) included, is NO.
  uint8_t value[kPlaceholderSize];
  ssize_t length = sl::getxattr(url.fileSystemRepresentation(), kPlaceholderAttribute, value, sizeof value, 0,
                                sl::XATTR_NOFOLLOW);
  return length == static_cast<ssize_t>(kPlaceholderSize);
}

bool SLFileManager::setInstallType(const sl::Number& installType, const sl::URL& onBundle, sl::Error* error) {
  static constexpr char kFunctionName[] = "-[SLFileManager setInstallType:onBundle:error:]";
  const char* path = onBundle.fileSystemRepresentation();
  const uint64_t type = installType.uint64Value();
  uint8_t value[kInstallTypeSize];
  for (size_t i = 0; i < kInstallTypeSize; ++i) value[i] = static_cast<uint8_t>(type >> (8 * i));
  if (sl::setxattr(path, kInstallTypeAttribute, value, sizeof value, 0, sl::XATTR_NOFOLLOW) != 0) {
    const int setErrno = errno;
    return sl::fail(error, _CreateAndLogError(kFunctionName, __LINE__, SLInstallerErrorDomain,
                                              kSLInstallerFileSystemError, sl::Error::posix(setErrno), nullptr,
                                              "Could't set installType EA on \"%s\": %s", path, strerror(setErrno)));
  }
  return true;
}

sl::Number SLFileManager::installTypeForBundle(const sl::URL& url, sl::Error* error) {
  static constexpr char kFunctionName[] = "-[SLFileManager installTypeForBundle:error:]";
  const char* path = url.fileSystemRepresentation();
  uint8_t value[kInstallTypeSize] = {};
  const ssize_t length = sl::getxattr(path, kInstallTypeAttribute, value, sizeof value, 0, sl::XATTR_NOFOLLOW);
  if (length < 0) {
    const int getErrno = errno;
    if (getErrno == sl::ENOATTR) return sl::Number(uint64_t{0});
    // A value longer than 8 bytes lands here too: the buffer is refused with
    // ERANGE.
    sl::fail(error, _CreateAndLogError(kFunctionName, __LINE__, SLInstallerErrorDomain, kSLInstallerFileSystemError,
                                       sl::Error::posix(getErrno), nullptr,
                                       "Couldn't get installType EA from \"%s\": %s", path, strerror(getErrno)));
    return nullptr;
  }
  if (static_cast<size_t>(length) != kInstallTypeSize) {
    sl::fail(error, _CreateAndLogError(kFunctionName, __LINE__, SLInstallerErrorDomain, kSLInstallerFileSystemError,
                                       nullptr, nullptr, "getxattr for installType EA on %s returned %zd (expected %zu)",
                                       path, length, kInstallTypeSize));
    return nullptr;
  }
  uint64_t type = 0;
  for (size_t i = 0; i < kInstallTypeSize; ++i) type |= static_cast<uint64_t>(value[i]) << (8 * i);
  return sl::Number(type);
}
