// Data-protection classes of files and directories.
//
// The class of an item is a number from 1 to 7, kept in the extended
// attribute kProtectionClassAttribute of the item itself and read and set
// through an open descriptor of it. An item without the attribute has class
// 0. These stand in for the fcntl commands of the same names.
//
// The attribute holds the class as a 32-bit little-endian integer, exactly
// 4 bytes. A stored value of another length or outside 1..7 was not written
// here and reads as EINVAL. A volume that cannot hold user attributes
// (ENOTSUP) reports class 0 for every item, and refuses to set one.
#pragma once

namespace sl {

inline constexpr int F_GETPROTECTIONCLASS = 63;
inline constexpr int F_SETPROTECTIONCLASS = 64;
inline constexpr const char kProtectionClassAttribute[] = "user.stowline.protection-class";

// fcntl(fd, F_GETPROTECTIONCLASS) answers the class (0 or more) or -1 with
// errno; fcntl(fd, F_SETPROTECTIONCLASS, cls) answers 0, or -1 with errno
// (EINVAL for a class outside 1..7). Any other command fails with EINVAL.
int protectionClassFcntl(int fd, int command, int protectionClass = 0);

}  // namespace sl
