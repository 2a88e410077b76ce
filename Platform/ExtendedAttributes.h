// Extended attributes with the options and names the system uses.
//
// A name without a Linux namespace ("com.vantor.stowd.placeholder") is kept
// under "user." ("user.com.vantor.stowd.placeholder"); a name that already
// has one ("user.", "trusted.", "security.", "system.") is used as it is.
// XATTR_NOFOLLOW works on the link itself (lgetxattr, lsetxattr). Linux
// refuses "user." attributes on symbolic links (EPERM): that is the answer
// such a call gets, never a write through the link. An absent attribute
// fails with ENOATTR, which is ENODATA here.
#pragma once

#include <sys/types.h>

#include <cerrno>
#include <cstdint>
#include <string>
#include <string_view>

namespace sl {

inline constexpr int XATTR_NOFOLLOW = 0x0001;
inline constexpr int XATTR_CREATE = 0x0002;
inline constexpr int XATTR_REPLACE = 0x0004;
inline constexpr int ENOATTR = ENODATA;

// The Linux name under which `name` is stored.
std::string linuxAttributeName(std::string_view name);

// As the system calls of the same names, with a `position` that must be 0
// and `options` made of the flags above (another position or any other bit
// fails with EINVAL; XATTR_CREATE and XATTR_REPLACE matter to the setters
// only). Each answers what the Linux call answers, -1 with errno on failure.
ssize_t getxattr(const char* path, const char* name, void* value, size_t size, uint32_t position, int options);
int setxattr(const char* path, const char* name, const void* value, size_t size, uint32_t position, int options);
int removexattr(const char* path, const char* name, int options);

// On an open descriptor; XATTR_NOFOLLOW changes nothing there, the
// descriptor already names the item. An O_PATH descriptor cannot carry
// these calls (EBADF).
ssize_t fgetxattr(int fd, const char* name, void* value, size_t size, uint32_t position, int options);
int fsetxattr(int fd, const char* name, const void* value, size_t size, uint32_t position, int options);

}  // namespace sl
