// Extended attributes over the Linux calls: names without a namespace go
// under "user.", XATTR_NOFOLLOW picks the l-variants, XATTR_CREATE and
// XATTR_REPLACE become the Linux flags of the same meaning.

#include "Platform/ExtendedAttributes.h"

#include <sys/xattr.h>

#include <array>

#include "Platform/Mutations.h"

namespace sl {

namespace {

constexpr int kKnownOptions = XATTR_NOFOLLOW | XATTR_CREATE | XATTR_REPLACE;

// Checks what every call takes alike: a position of 0 (resource forks do not
// exist here), options from the flags above, and a name. Sets errno and
// answers false when something is wrong.
bool validArguments(const char* name, uint32_t position, int options) {
  if (name == nullptr) {
    errno = EFAULT;
    return false;
  }
  if (position != 0 || (options & ~kKnownOptions) != 0) {
    errno = EINVAL;
    return false;
  }
  return true;
}

int linuxSetFlags(int options) {
  int flags = 0;
  if ((options & sl::XATTR_CREATE) != 0) flags |= ::XATTR_CREATE;
  if ((options & sl::XATTR_REPLACE) != 0) flags |= ::XATTR_REPLACE;
  return flags;  // both together: the kernel refuses them with EINVAL
}

bool nofollow(int options) { return (options & XATTR_NOFOLLOW) != 0; }

}  // namespace

std::string linuxAttributeName(std::string_view name) {
  static constexpr std::array<std::string_view, 4> kNamespaces = {"user.", "trusted.", "security.", "system."};
  for (std::string_view ns : kNamespaces) {
    if (name.starts_with(ns)) return std::string(name);
  }
  std::string linuxName("user.");
  linuxName += name;
  return linuxName;
}

ssize_t getxattr(const char* path, const char* name, void* value, size_t size, uint32_t position, int options) {
  if (!validArguments(name, position, options)) return -1;
  const std::string linuxName = linuxAttributeName(name);
  return nofollow(options) ? ::lgetxattr(path, linuxName.c_str(), value, size)
                           : ::getxattr(path, linuxName.c_str(), value, size);
}

int setxattr(const char* path, const char* name, const void* value, size_t size, uint32_t position, int options) {
  if (!validArguments(name, position, options)) return -1;
  const std::string linuxName = linuxAttributeName(name);
  const int flags = linuxSetFlags(options);
  return nofollow(options) ? mut::lsetxattr(path, linuxName.c_str(), value, size, flags)
                           : mut::setxattr(path, linuxName.c_str(), value, size, flags);
}

int removexattr(const char* path, const char* name, int options) {
  if (!validArguments(name, 0, options)) return -1;
  const std::string linuxName = linuxAttributeName(name);
  return nofollow(options) ? mut::lremovexattr(path, linuxName.c_str()) : mut::removexattr(path, linuxName.c_str());
}

// A descriptor names the item it was opened on, so XATTR_NOFOLLOW has
// nothing left to do here.
ssize_t fgetxattr(int fd, const char* name, void* value, size_t size, uint32_t position, int options) {
  if (!validArguments(name, position, options)) return -1;
  return ::fgetxattr(fd, linuxAttributeName(name).c_str(), value, size);
}

int fsetxattr(int fd, const char* name, const void* value, size_t size, uint32_t position, int options) {
  if (!validArguments(name, position, options)) return -1;
  return mut::fsetxattr(fd, linuxAttributeName(name).c_str(), value, size, linuxSetFlags(options));
}

}  // namespace sl
