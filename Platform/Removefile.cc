// Recursive removal: an iterative walk over directory descriptors.
//
// Threat model. The trees removed here were left behind by applications and
// old installations; they may hold symbolic links that point anywhere, and
// something else may change them while the walk runs. So:
//  - The item named by the caller is reached through its parent directory,
//    opened by path (the caller's prefix is trusted), and its last component
//    is never followed: a link there is removed as the link.
//  - Inside the tree every call is relative to a directory descriptor:
//    fstatat(AT_SYMLINK_NOFOLLOW), openat(O_DIRECTORY|O_NOFOLLOW) and
//    unlinkat on a single name. No path is rebuilt to operate on; paths are
//    built only to report an entry to the error callback.
//  - The kind of an entry (directory or not) is read from the listing and may
//    be stale. A directory swapped for a link fails to open (ELOOP) and is
//    then unlinked as the link it now is; a file swapped for a directory
//    fails to unlink (EISDIR) and is then entered. Neither is ever followed.
//  - A parent whose descriptor was closed to save descriptors is opened again
//    through ".." of its child, and must be the very directory (st_dev,
//    st_ino) recorded when it was entered. If it is not, the tree was moved
//    while the walk ran and going on would remove entries of whatever
//    directory now holds the child: the walk stops at once.
//
// Descriptor budget. The walk is iterative, so the depth of a tree costs heap
// (one Level per directory on the way down), not stack. At most
// kMaxOpenLevels directory descriptors of the walk are open at once, plus the
// descriptor of the top item's parent and, for a moment, one more while a
// directory is listed or a parent is opened again. Each directory's entries
// are read whole into memory when it is entered, so closing its descriptor
// loses nothing: the shallowest open levels are closed as the walk goes
// deeper and opened again through ".." on the way back up.
//
// Error policy: report and go on. Each entry that cannot be removed (an
// unlink or rmdir that fails, a directory that cannot be opened or listed) is
// reported to the callback with its path, its errno readable through
// REMOVEFILE_STATE_ERRNO. REMOVEFILE_PROCEED and REMOVEFILE_SKIP go on with
// the rest of the tree; REMOVEFILE_STOP (and any answer this code does not
// know) ends the walk with -1 and that errno. Without a callback the first
// failing entry ends the walk the same way. An entry that vanished during
// the walk (ENOENT) is reported like any other failure: whether that matters
// is the caller's decision. A directory whose child could not be removed then
// fails its own rmdir with ENOTEMPTY, and that is reported too.
//
// Failures that are not about one entry end the walk with -1 and errno,
// without a callback: the top item that cannot be reached or examined (ENOENT
// when nothing stands there), and a parent that cannot be opened again or is
// not the directory it was (ESTALE, see below).
//
// Mount points get no special treatment: a file system mounted inside the
// tree is emptied like any directory, and its root then fails rmdir (EBUSY),
// which is reported.

#include "Platform/Removefile.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "Platform/DirectoryEntries.h"
#include "Platform/UniqueFd.h"

struct sl::removefile_state {
  removefile_callback_t callback = nullptr;
  void* context = nullptr;
  int entryErrno = 0;  // errno of the entry being reported
};

namespace sl {

// Test hook: when set, called after each directory of a recursive walk has
// been listed and before any of its entries is handled, with the directory's
// descriptor and the path reported for it. Tests use it to change the tree at
// that exact point (remove an entry, swap a directory for a link, move a
// subtree). Null outside tests; it is not declared in the header.
extern void (*removefile_test_hook_after_listing)(int dirFd, const char* path);
void (*removefile_test_hook_after_listing)(int dirFd, const char* path) = nullptr;

namespace {

constexpr size_t kMaxOpenLevels = 32;

// What an entry of a listing is taken to be before it is touched.
enum class Kind { kDirectory, kOther };

using Entry = DirectoryEntry;

// What the listing says an entry is; only asked when its type is known.
Kind kindOf(const Entry& entry) { return entry.type == DT_DIR ? Kind::kDirectory : Kind::kOther; }

// One directory on the way down from the top item.
struct Level {
  UniqueFd fd;  // closed while the level is evicted
  dev_t dev;    // identity recorded when the directory was entered
  ino_t ino;
  std::string name;  // name in the parent directory
  std::vector<Entry> entries;
  size_t next = 0;  // first entry not yet handled
};

// A step of the walk either lets it go on or ends it with -1 and errno.
enum class Step { kGoOn, kStop };

// What one attempt at an entry came to.
enum class Attempt { kDone, kWrongKind, kFailed };

class Walk {
 public:
  Walk(removefile_state* state, std::string topPath, UniqueFd topParent, std::string topName, bool recursive)
      : state_(state),
        topPath_(std::move(topPath)),
        topParent_(std::move(topParent)),
        topName_(std::move(topName)),
        recursive_(recursive) {}

  // Removes the top item, of the given kind. Returns 0, or -1 with errno.
  int run(Kind topKind) {
    if (handleEntry(topParent_.get(), topName_, topKind) == Step::kStop) return -1;
    while (!stack_.empty()) {
      Level& level = stack_.back();
      if (level.next < level.entries.size()) {
        // handleEntry may push a level: work on a copy of the entry.
        Entry entry = std::move(level.entries[level.next++]);
        Step step = entry.type != DT_UNKNOWN ? handleEntry(level.fd.get(), entry.name, kindOf(entry))
                                    : handleUnknownEntry(level.fd.get(), entry.name);
        if (step == Step::kStop) return -1;
        continue;
      }
      if (finishLevel() == Step::kStop) return -1;
    }
    return 0;
  }

 private:
  // The path reported for stack_[depth]: the top path, then the names.
  std::string levelPath(size_t depth) const {
    std::string path = topPath_;
    for (size_t i = 1; i <= depth; ++i) {
      path += '/';
      path += stack_[i].name;
    }
    return path;
  }

  // The path reported for an entry of the deepest level (or for the top item
  // while nothing has been entered).
  std::string entryPath(const std::string& name) const {
    if (stack_.empty()) return topPath_;
    return levelPath(stack_.size() - 1) + "/" + name;
  }

  Step report(const std::string& path, int err) {
    removefile_callback_t callback = state_ != nullptr ? state_->callback : nullptr;
    if (callback == nullptr) {
      errno = err;
      return Step::kStop;
    }
    state_->entryErrno = err;
    int answer = callback(state_, path.c_str(), state_->context);
    if (answer == REMOVEFILE_PROCEED || answer == REMOVEFILE_SKIP) return Step::kGoOn;
    errno = err;
    return Step::kStop;
  }

  Step handleUnknownEntry(int dirFd, const std::string& name) {
    struct stat st;
    if (fstatat(dirFd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
      int err = errno;
      return report(entryPath(name), err);
    }
    return handleEntry(dirFd, name, S_ISDIR(st.st_mode) ? Kind::kDirectory : Kind::kOther);
  }

  // Removes the entry `name` of dirFd, or enters it when it is a directory of
  // a recursive walk (it is then removed when its level is finished). The
  // kind may be stale: one change of kind is followed; a second one is
  // reported as the failure it is.
  Step handleEntry(int dirFd, const std::string& name, Kind kind) {
    int err = 0;
    for (int tries = 0; tries < 2; ++tries) {
      Attempt attempt = kind == Kind::kDirectory ? removeDirectory(dirFd, name, err) : removeOther(dirFd, name, err);
      if (attempt == Attempt::kDone) return Step::kGoOn;
      if (attempt == Attempt::kFailed) break;
      kind = kind == Kind::kDirectory ? Kind::kOther : Kind::kDirectory;
    }
    return report(entryPath(name), err);
  }

  Attempt removeOther(int dirFd, const std::string& name, int& err) {
    if (unlinkat(dirFd, name.c_str(), 0) == 0) return Attempt::kDone;
    err = errno;
    return err == EISDIR ? Attempt::kWrongKind : Attempt::kFailed;
  }

  Attempt removeDirectory(int dirFd, const std::string& name, int& err) {
    if (!recursive_) {
      if (unlinkat(dirFd, name.c_str(), AT_REMOVEDIR) == 0) return Attempt::kDone;
      err = errno;
      return err == ENOTDIR ? Attempt::kWrongKind : Attempt::kFailed;
    }
    UniqueFd fd(openat(dirFd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) {
      err = errno;
      // ELOOP: a link stands there now; ENOTDIR: some other non-directory.
      if (err == ELOOP || err == ENOTDIR) return Attempt::kWrongKind;
      return removeIfEmpty(dirFd, name);
    }
    struct stat st;
    std::vector<Entry> entries;
    if (fstat(fd.get(), &st) != 0) {
      err = errno;
      return removeIfEmpty(dirFd, name);
    }
    err = readDirectoryEntries(fd.get(), entries);
    if (err != 0) {
      fd.reset();
      return removeIfEmpty(dirFd, name);
    }
    stack_.push_back(Level{std::move(fd), st.st_dev, st.st_ino, name, std::move(entries)});
    if (stack_.size() - lowestOpen_ > kMaxOpenLevels) stack_[lowestOpen_++].fd.reset();
    if (removefile_test_hook_after_listing != nullptr) {
      removefile_test_hook_after_listing(stack_.back().fd.get(), levelPath(stack_.size() - 1).c_str());
    }
    return Attempt::kDone;
  }

  // A directory that could not be entered is still removed when it is empty
  // (its rmdir needs only the parent's permissions). When that fails too,
  // the reason it could not be entered is the one reported.
  static Attempt removeIfEmpty(int dirFd, const std::string& name) {
    return unlinkat(dirFd, name.c_str(), AT_REMOVEDIR) == 0 ? Attempt::kDone : Attempt::kFailed;
  }

  // All entries of the deepest level are handled: remove the directory from
  // its parent, opening the parent again first if it was evicted.
  Step finishLevel() {
    size_t depth = stack_.size() - 1;
    int parentFd = topParent_.get();
    if (depth > 0) {
      Level& parent = stack_[depth - 1];
      if (!parent.fd && reopenParent(depth) == Step::kStop) return Step::kStop;
      parentFd = parent.fd.get();
    }
    std::string name = std::move(stack_.back().name);
    stack_.pop_back();  // closes the directory before its rmdir
    if (unlinkat(parentFd, name.c_str(), AT_REMOVEDIR) == 0) return Step::kGoOn;
    int err = errno;
    return report(depth == 0 ? topPath_ : levelPath(depth - 1) + "/" + name, err);
  }

  // Opens stack_[depth - 1] again through ".." of stack_[depth]. The parent
  // is needed only as the base of *at calls (its entries are in memory), so
  // O_PATH suffices and no read permission on it is needed. When ".." is not
  // the directory recorded on the way down, the tree was moved during the
  // walk: it stops with ESTALE, our record of where we came from being stale.
  // A child that the caller may not search cannot give its ".." either: the
  // walk then stops with that errno (EACCES). Only trees deeper than the
  // budget meet this, and such a child could not be emptied anyway.
  Step reopenParent(size_t depth) {
    Level& parent = stack_[depth - 1];
    UniqueFd fd(openat(stack_[depth].fd.get(), "..", O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!fd) return Step::kStop;  // errno from openat
    struct stat st;
    if (fstat(fd.get(), &st) != 0) return Step::kStop;
    if (st.st_dev != parent.dev || st.st_ino != parent.ino) {
      errno = ESTALE;
      return Step::kStop;
    }
    parent.fd = std::move(fd);
    lowestOpen_ = depth - 1;
    return Step::kGoOn;
  }

  removefile_state* state_;
  std::string topPath_;
  UniqueFd topParent_;
  std::string topName_;
  bool recursive_;
  std::vector<Level> stack_;
  // Levels [lowestOpen_, stack_.size()) hold open descriptors; those below
  // were evicted.
  size_t lowestOpen_ = 0;
};

// Splits path into the directory that holds the item and the item's name,
// and checks the top item. Returns 0 and fills the outputs, or an errno.
int resolveTop(const char* path, std::string& topPath, UniqueFd& parentFd, std::string& name, Kind& kind) {
  if (path == nullptr) return EINVAL;
  std::string p(path);
  if (p.empty()) return ENOENT;
  bool trailingSlash = false;
  while (p.size() > 1 && p.back() == '/') {
    p.pop_back();
    trailingSlash = true;
  }
  if (p == "/") return EBUSY;  // what rmdir answers for the root
  size_t slash = p.rfind('/');
  std::string parent = slash == std::string::npos ? "." : slash == 0 ? "/" : p.substr(0, slash);
  name = slash == std::string::npos ? p : p.substr(slash + 1);
  // "." and ".." name a directory by a path that cannot be removed; emptying
  // it first would be a surprise. Refused, as rmdir refuses ".".
  if (name == "." || name == "..") return EINVAL;

  // The prefix is the caller's and may be followed; the last name is not.
  parentFd = UniqueFd(open(parent.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!parentFd) return errno;
  struct stat st;
  if (fstatat(parentFd.get(), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) return errno;
  kind = S_ISDIR(st.st_mode) ? Kind::kDirectory : Kind::kOther;
  // "name/" asks for a directory. A link to one is not followed, so the
  // answer is the one the system gives for a non-directory with a slash.
  if (trailingSlash && kind != Kind::kDirectory) return ENOTDIR;
  topPath = std::move(p);
  return 0;
}

}  // namespace

removefile_state_t removefile_state_alloc() {
  auto* state = new (std::nothrow) removefile_state();
  if (state == nullptr) errno = ENOMEM;
  return state;
}

int removefile_state_free(removefile_state_t state) {
  delete state;
  return 0;
}

// The callback is passed as the function's own address converted to a data
// pointer (conditionally supported by the language, supported by every
// compiler this builds with); the context is kept as given.
int removefile_state_set(removefile_state_t state, uint32_t key, const void* value) {
  if (state == nullptr) {
    errno = EINVAL;
    return -1;
  }
  switch (key) {
    case REMOVEFILE_STATE_ERROR_CALLBACK:
      state->callback = reinterpret_cast<removefile_callback_t>(const_cast<void*>(value));
      return 0;
    case REMOVEFILE_STATE_ERROR_CONTEXT:
      state->context = const_cast<void*>(value);
      return 0;
    default:
      errno = EINVAL;
      return -1;
  }
}

int removefile_state_get(removefile_state_t state, uint32_t key, void* dst) {
  if (state == nullptr || dst == nullptr) {
    errno = EINVAL;
    return -1;
  }
  switch (key) {
    case REMOVEFILE_STATE_ERRNO:
      *static_cast<int*>(dst) = state->entryErrno;
      return 0;
    case REMOVEFILE_STATE_ERROR_CALLBACK:
      *static_cast<removefile_callback_t*>(dst) = state->callback;
      return 0;
    case REMOVEFILE_STATE_ERROR_CONTEXT:
      *static_cast<void**>(dst) = state->context;
      return 0;
    default:
      errno = EINVAL;
      return -1;
  }
}

int removefile(const char* path, removefile_state_t state, removefile_flags_t flags) {
  if (state != nullptr) state->entryErrno = 0;
  std::string topPath;
  std::string name;
  UniqueFd parentFd;
  Kind kind = Kind::kOther;
  if (int err = resolveTop(path, topPath, parentFd, name, kind); err != 0) {
    errno = err;
    return -1;
  }
  int result;
  int err;
  {
    Walk walk(state, std::move(topPath), std::move(parentFd), std::move(name), (flags & REMOVEFILE_RECURSIVE) != 0);
    result = walk.run(kind);
    err = errno;
  }
  // The walk's destructor closes descriptors and frees memory; the caller
  // reads the errno of the failure.
  errno = err;
  return result;
}

}  // namespace sl
