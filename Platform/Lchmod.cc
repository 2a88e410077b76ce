// lchmod over lstat and fchmodat.

#include "Platform/Lchmod.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>

#include "Platform/Mutations.h"

namespace sl {

int lchmod(const char* path, mode_t mode) {
  struct stat st;
  if (::lstat(path, &st) != 0) return -1;
  // A link's own mode bits mean nothing on Linux; there is nothing to change.
  if (S_ISLNK(st.st_mode)) return 0;
  // The path may have been swapped for a link since the lstat. With
  // AT_SYMLINK_NOFOLLOW the C library pins the item without following a link
  // (O_PATH|O_NOFOLLOW) and refuses a link with EOPNOTSUPP, so the target of
  // such a link is never changed; a non-link has its mode changed as by
  // chmod.
  return mut::fchmodat(AT_FDCWD, path, mode, AT_SYMLINK_NOFOLLOW);
}

}  // namespace sl
