// lchmod: change the mode of an item without following a link.
#pragma once

#include <sys/types.h>

namespace sl {

// Linux links have no mode bits of their own, so for a link this succeeds
// without changing anything. Anything else has its mode changed as
// fchmodat(..., AT_SYMLINK_NOFOLLOW) would: an item swapped for a link after
// the check is refused with EOPNOTSUPP, never changed through the link.
// (The C library pins the item with O_PATH and changes it through /proc, so
// without /proc mounted every non-link fails with EOPNOTSUPP too.) Returns
// 0, or -1 with errno.
int lchmod(const char* path, mode_t mode);

}  // namespace sl
