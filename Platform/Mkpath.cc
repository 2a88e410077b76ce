// Creation of a directory with its missing parents.
//
// The path is the caller's and is resolved by the system like any other:
// a component that is a link to a directory is passed through. Only the
// last component is judged with lstat, so a link standing at the path is a
// non-directory there (ENOTDIR), never followed to report EEXIST.
//
// Order of work: mkdir of the whole path first, which is the only call when
// the parent exists. On ENOENT the walk goes back one component at a time
// until a mkdir succeeds or meets a directory, then forward again making the
// rest. Races are tolerated: a component that someone else makes at the same
// moment (mkdir's EEXIST, and a directory is found there) is taken as it is.
// A component removed behind the walk fails with the ENOENT of the next
// mkdir. Directories made before a failure stay.
//
// Every component is made with `mode` under the umask. A mode without the
// owner's write and search bits therefore leaves an intermediate directory
// that an unprivileged caller cannot make the next component in (EACCES):
// that is what the caller asked for.

#include "Platform/Mkpath.h"

#include <sys/stat.h>

#include <cerrno>
#include <string>
#include <vector>

#include "Platform/Mutations.h"

namespace sl {
namespace {

// What stands at a prefix that mkdir found taken: 0 for a directory (links
// followed, as for any component in the middle of a path), else the error.
int intermediateStanding(const std::string& prefix) {
  struct stat st;
  if (stat(prefix.c_str(), &st) != 0) return errno;  // a dangling link: ENOENT
  return S_ISDIR(st.st_mode) ? 0 : ENOTDIR;
}

// What stands at the whole path when mkdir found it taken. The last
// component is not followed.
int lastStanding(const std::string& path) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) return errno;
  return S_ISDIR(st.st_mode) ? EEXIST : ENOTDIR;
}

}  // namespace

int mkpath_np(const char* path, mode_t mode) {
  if (path == nullptr) return EINVAL;
  std::string p(path);
  if (p.empty()) return ENOENT;
  // "a/b/" names a/b; the root keeps its slash.
  while (p.size() > 1 && p.back() == '/') p.pop_back();

  if (mut::mkdir(p.c_str(), mode) == 0) return 0;
  int err = errno;
  if (err == EEXIST) return lastStanding(p);
  if (err != ENOENT) return err;

  // Ends of the components before the last: prefix i is p.substr(0, ends[i]).
  // A run of slashes ends one component; a leading slash ends none.
  std::vector<size_t> ends;
  for (size_t i = 1; i < p.size(); ++i) {
    if (p[i] == '/' && p[i - 1] != '/') ends.push_back(i);
  }

  // Back: find the deepest prefix that stands as a directory or can be
  // made. Prefixes [from, ends.size()) and the path itself are then left.
  size_t from = ends.size();
  for (;; --from) {
    // Every prefix failed with ENOENT, the first component included: a
    // relative path whose working directory is gone, or a vanished root.
    if (from == 0) return ENOENT;
    std::string prefix = p.substr(0, ends[from - 1]);
    if (mut::mkdir(prefix.c_str(), mode) == 0) break;
    err = errno;
    if (err == EEXIST) {
      if (int standing = intermediateStanding(prefix); standing != 0) return standing;
      break;
    }
    if (err != ENOENT) return err;
  }

  // Forward: the remaining prefixes, then the path itself.
  for (size_t i = from; i <= ends.size(); ++i) {
    const bool last = i == ends.size();
    std::string prefix = last ? p : p.substr(0, ends[i]);
    if (mut::mkdir(prefix.c_str(), mode) == 0) continue;
    err = errno;
    if (err != EEXIST) return err;
    if (last) return lastStanding(p);
    if (int standing = intermediateStanding(prefix); standing != 0) return standing;
  }
  return 0;
}

}  // namespace sl
