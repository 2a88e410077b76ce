// Data-protection classes kept in an extended attribute of the item.
//
// The stored value is the class as a 32-bit little-endian integer, exactly 4
// bytes, written and read byte by byte so that the format does not depend on
// the host's byte order.

#include "Platform/DataProtection.h"

#include <cerrno>
#include <cstdint>

#include "Platform/ExtendedAttributes.h"

namespace sl {

namespace {

constexpr int kLowestClass = 1;
constexpr int kHighestClass = 7;
constexpr size_t kStoredSize = 4;

bool validClass(int protectionClass) { return protectionClass >= kLowestClass && protectionClass <= kHighestClass; }

int getProtectionClass(int fd) {
  uint8_t bytes[kStoredSize] = {};
  ssize_t length = sl::fgetxattr(fd, kProtectionClassAttribute, bytes, sizeof bytes, 0, 0);
  if (length < 0) {
    const int getErrno = errno;
    // No attribute: the item never had a class set. A volume that cannot
    // hold user attributes at all has no item with a class either.
    if (getErrno == ENOATTR || getErrno == ENOTSUP) return 0;
    // Longer than any value this code writes: not a class record of ours.
    errno = getErrno == ERANGE ? EINVAL : getErrno;
    return -1;
  }
  if (static_cast<size_t>(length) != kStoredSize) {
    errno = EINVAL;
    return -1;
  }
  const uint32_t raw = static_cast<uint32_t>(bytes[0]) | static_cast<uint32_t>(bytes[1]) << 8 |
                       static_cast<uint32_t>(bytes[2]) << 16 | static_cast<uint32_t>(bytes[3]) << 24;
  const int protectionClass = static_cast<int32_t>(raw);
  // Only classes 1..7 are ever written; anything else was put there by
  // someone else and is not reported as a class.
  if (!validClass(protectionClass)) {
    errno = EINVAL;
    return -1;
  }
  return protectionClass;
}

int setProtectionClass(int fd, int protectionClass) {
  if (!validClass(protectionClass)) {
    errno = EINVAL;
    return -1;
  }
  const uint32_t raw = static_cast<uint32_t>(protectionClass);
  const uint8_t bytes[kStoredSize] = {static_cast<uint8_t>(raw), static_cast<uint8_t>(raw >> 8),
                                      static_cast<uint8_t>(raw >> 16), static_cast<uint8_t>(raw >> 24)};
  return sl::fsetxattr(fd, kProtectionClassAttribute, bytes, sizeof bytes, 0, 0) == 0 ? 0 : -1;
}

}  // namespace

int protectionClassFcntl(int fd, int command, int protectionClass) {
  switch (command) {
    case F_GETPROTECTIONCLASS:
      return getProtectionClass(fd);
    case F_SETPROTECTIONCLASS:
      return setProtectionClass(fd, protectionClass);
    default:
      errno = EINVAL;
      return -1;
  }
}

}  // namespace sl
