// Copying files, links and whole trees: an iterative walk over directory
// descriptors.
//
// Contract. copyfile() copies the item at `from` to `to`:
//  - Kinds: directories (their contents too with COPYFILE_RECURSIVE; without
//    it only the directory itself and its metadata), regular files (their
//    data with COPYFILE_DATA), symbolic links (as links: the target text is
//    copied, never what it points to), fifos, character and block devices
//    and sockets (made again with mkfifoat or mknodat; a socket becomes a
//    socket node with no one listening, which is all a socket on disk is).
//  - Links: with COPYFILE_NOFOLLOW_SRC a link at `from` is copied as a link;
//    without it that one link is followed. Inside the tree no link is ever
//    followed, whatever the flags.
//  - Metadata with COPYFILE_STAT: owner and group where the caller may give
//    them, all twelve mode bits, access and modification times to the
//    nanosecond. With COPYFILE_XATTR every extended attribute, and with
//    COPYFILE_ACL the POSIX ACLs, which are the attributes
//    "system.posix_acl_access" and "system.posix_acl_default".
//  - Destination, as rename treats it: nothing there, and the item is made;
//    a non-directory there (a link included, never followed), and it is
//    replaced; a directory there, and a directory source merges into it
//    (entries of the same name are replaced, or merged when both are
//    directories) while any other source fails with EISDIR; a non-directory
//    there and a directory source fails with ENOTDIR. A missing parent of
//    `to` fails with ENOENT. Without COPYFILE_NOFOLLOW_DST a link at `to`
//    that leads to a directory is taken as that directory; any other link
//    there is replaced as always. When `from` and `to` name the same item
//    the call does nothing and succeeds, as rename does.
//  - Failure: -1 with the errno of the first failure; the walk stops there.
//    What was made by then stays (the caller decides whether to remove a
//    partial copy); only a temporary item of a replacement is taken away.
//    Directories that the failure left unfinished keep the working mode
//    0700 and the caller as owner.
//    Trailing slashes ask for a directory, as for rename: "x/" where x is a
//    non-directory, a link included, fails with ENOTDIR.
//  - Hard links inside the tree become separate files. Times of change and
//    birth cannot be set and are the copy's own.
//
// Threat model. Sources are trees left by applications: links point
// anywhere, and things may change while the walk runs. Destinations may be
// shared directories. So:
//  - The prefixes of `from` and `to` are the caller's and are resolved
//    normally; below them every call is relative to a directory descriptor:
//    openat with O_NOFOLLOW, fstatat and utimensat with AT_SYMLINK_NOFOLLOW,
//    readlinkat, mkdirat, symlinkat, mknodat, fchownat, renameat.
//  - The kind of a source entry comes from its open descriptor (fstat), not
//    from the listing: a file swapped for a link fails O_NOFOLLOW (ELOOP) and
//    is then copied as the link it now is. Entries that are not files or
//    directories are never opened (opening a device can have effects of its
//    own); files are opened with O_NONBLOCK, so an entry swapped for a fifo
//    between listing and open does not block, and it is then made again,
//    not read.
//  - Items are created exclusively (O_CREAT|O_EXCL, mkdirat, symlinkat and
//    mknodat fail on anything in the way) and never through a link; a
//    directory that stands in the way is opened with O_NOFOLLOW|O_DIRECTORY.
//  - Attributes of items that are not opened (links, fifos, devices,
//    sockets) are read and written through "/proc/self/fd/DIR/NAME" with the
//    l-variants of the calls: the directory is pinned by its descriptor and
//    the name is not followed. The walk therefore needs /proc.
//  - New items start with only the owner's permissions (0600, directories
//    0700); their own mode is set last, after the owner: fchown clears the
//    set-id bits. When the owner cannot be given (EPERM: the caller is not
//    privileged), the group alone is tried, and a set-user-id or
//    set-group-id bit whose owner or group was not carried over is dropped,
//    so a copy never becomes set-id for the one who made it.
//
// Replacement. A non-directory in the way is not unlinked first: the new
// item is made whole (data and metadata) under a temporary name
// ".sl-copy-XXXXXXXX" in the same directory and renamed over it, so a
// failure leaves the old item in place and the temporary one is removed.
//
// Data. copy_file_range moves the data in the kernel, in calls of at most
// 1 GiB, with explicit offsets, until the size that fstat gave is copied (a
// file that shrinks meanwhile is copied to its end). Where it cannot be used
// (between most pairs of different file systems, so on every move across
// volumes) the copy goes on from the same offset with sendfile, which also
// stays in the kernel and is markedly faster than a copy through user
// memory (measured: a 1 GiB file from disk to /dev/shm); where that cannot
// be used either, with pread and pwrite through one 256 KiB buffer. A
// refusal of copy_file_range is remembered for the pair of volumes, so a
// tree copied across volumes pays for it once, not once per file. copyFileRangeRefused and sendfileRefused list the
// errnos that step down; any other errno fails the copy. A file with fewer
// blocks than its size has holes: only its data segments (SEEK_DATA,
// SEEK_HOLE) are copied and the holes stay holes. No file is ever read into
// memory whole.
//
// Extended attributes. Listing and reading use a size probe and retry on
// ERANGE a bounded number of times (the attribute can grow in between). A
// source file system without attributes (ENOTSUP) has none to copy. Setting
// one on the destination that is refused fails the copy, with one
// exception: a "security." attribute (a label of a security module) that
// the destination's file system does not support (ENOTSUP) is passed over,
// since such a label describes the source's volume. A "user." or "trusted."
// attribute that cannot be set would be data lost, and an ACL that cannot
// be set would leave the copy more open than its source, so those fail.
// A directory's attributes are set when its contents are done, after its
// owner and before its mode.
//
// Inherited ACLs. An item made in a directory that has a default ACL is
// given an ACL by the system. With COPYFILE_ACL the source's ACLs win: an
// inherited ACL that the source item does not have is removed. New
// directories lose their inherited ACLs at once and get the source's when
// their contents are done, so entries made in them inherit nothing.
//
// Directories. Each directory's entries are read into memory when it is
// entered; its mode, owner, attributes and times are set when all of them
// are copied, so making the entries does not disturb the times and a
// directory without write permission can still be filled. A directory
// source merged into an existing directory gives it its metadata as well;
// attributes the existing directory has beyond the source's stay.
//
// Copy into itself. Every directory that the walk makes is recorded (st_dev,
// st_ino), and a source directory so recorded is not entered: a destination
// inside the source gets the source as it was, without a copy of the copy.
// Listings are taken when a directory is entered and each source directory
// is entered once, so the walk always ends.
//
// Descriptor budget. The walk is iterative: depth costs heap, one Level per
// directory on the way down, and no paths are built, so there is no limit on
// depth or path length. Each level holds two descriptors (source and
// destination directory); at most kMaxOpenLevels levels keep theirs, plus
// the two parents of the top items and, for a moment, the item being copied
// and a duplicate for listing. The shallowest open levels are closed as the
// walk goes deeper and opened again through ".." of the child on the way
// back up, and each must then be the very directory (st_dev, st_ino) that
// was entered; if not, the tree was moved during the walk and it stops with
// ESTALE. A reopened source directory is an O_PATH descriptor (its entries
// and metadata are already in memory).

#include "Platform/Copyfile.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <set>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Platform/DirectoryEntries.h"
#include "Platform/Mutations.h"
#include "Platform/UniqueFd.h"

struct sl::copyfile_state {};

namespace sl {

// Test hook: when set, file data goes through the buffer, the last of the
// three ways, which the file systems of the tests never make the copy take.
// False outside tests; it is not declared in the header.
extern bool copyfile_test_buffered_data;
bool copyfile_test_buffered_data = false;

namespace {

constexpr copyfile_flags_t kKnownFlags = COPYFILE_ALL | COPYFILE_RECURSIVE | COPYFILE_NOFOLLOW;
constexpr size_t kMaxOpenLevels = 32;
constexpr int kSizeProbeAttempts = 4;
constexpr int kTemporaryNameAttempts = 16;
constexpr size_t kKernelChunk = size_t{1} << 30;
constexpr size_t kBufferSize = size_t{256} << 10;
constexpr mode_t kWorkingFileMode = S_IRUSR | S_IWUSR;
constexpr mode_t kWorkingDirectoryMode = S_IRWXU;
constexpr char kAclAccess[] = "system.posix_acl_access";
constexpr char kAclDefault[] = "system.posix_acl_default";

struct Attribute {
  std::string name;
  std::string value;
};
using Attributes = std::vector<Attribute>;

using Entry = DirectoryEntry;

struct Identity {
  dev_t dev;
  ino_t ino;
  auto operator<=>(const Identity&) const = default;
};

Identity identityOf(const struct stat& st) { return Identity{st.st_dev, st.st_ino}; }

bool isAcl(const std::string& name) { return name == kAclAccess || name == kAclDefault; }

bool hasAttribute(const Attributes& attributes, const char* name) {
  return std::any_of(attributes.begin(), attributes.end(), [&](const Attribute& a) { return a.name == name; });
}

// copy_file_range refused the work and another way can do it:
//  EXDEV       the file systems differ and the kernel copies across only
//              some of them;
//  EINVAL      the file system or the file does not support it;
//  ENOSYS      a kernel without the call;
//  EOPNOTSUPP  the file system refuses it (ENOTSUP is the same number);
//  EPERM       some file systems refuse it so; a real refusal to write is
//              then reported by the write itself.
// Every other errno (EIO, ENOSPC, EBADF, EFBIG, ...) is the copy's failure.
bool copyFileRangeRefused(int err) {
  return err == EXDEV || err == EINVAL || err == ENOSYS || err == EOPNOTSUPP || err == EPERM;
}

// sendfile refused and read and write can do it: EINVAL (a file that cannot
// be spliced), ENOSYS, EOPNOTSUPP. Every other errno is the copy's failure.
bool sendfileRefused(int err) { return err == EINVAL || err == ENOSYS || err == EOPNOTSUPP; }

// Where extended attributes are read or written: an open descriptor, or
// "/proc/self/fd/DIR/NAME" for an item that is not opened, whose last
// component is followed only when `follow` (the top source without
// COPYFILE_NOFOLLOW_SRC).
struct AttributePlace {
  int fd = -1;
  std::string path;
  bool follow = false;

  static AttributePlace of(int fd) {
    AttributePlace place;
    place.fd = fd;
    return place;
  }
  static AttributePlace at(int dirFd, const std::string& name, bool follow) {
    AttributePlace place;
    place.path = "/proc/self/fd/" + std::to_string(dirFd) + "/" + name;
    place.follow = follow;
    return place;
  }

  ssize_t list(char* buffer, size_t size) const {
    if (fd >= 0) return ::flistxattr(fd, buffer, size);
    return follow ? ::listxattr(path.c_str(), buffer, size) : ::llistxattr(path.c_str(), buffer, size);
  }
  ssize_t get(const char* name, void* buffer, size_t size) const {
    if (fd >= 0) return ::fgetxattr(fd, name, buffer, size);
    return follow ? ::getxattr(path.c_str(), name, buffer, size) : ::lgetxattr(path.c_str(), name, buffer, size);
  }
  int set(const char* name, const void* value, size_t size) const {
    if (fd >= 0) return mut::fsetxattr(fd, name, value, size, 0);
    return mut::lsetxattr(path.c_str(), name, value, size, 0);
  }
  int remove(const char* name) const {
    if (fd >= 0) return mut::fremovexattr(fd, name);
    return mut::lremovexattr(path.c_str(), name);
  }
};

// Fills `out` by `call(buffer, size)` (a listxattr or getxattr): one try into
// what `out` can hold, then on ERANGE a size probe and another try, a bounded
// number of times. Returns 0 or the errno.
template <typename Call>
int readSized(std::string& out, Call call) {
  if (out.size() < 256) out.resize(256);
  for (int attempt = 0; attempt < kSizeProbeAttempts; ++attempt) {
    ssize_t got = call(out.data(), out.size());
    if (got >= 0) {
      out.resize(static_cast<size_t>(got));
      return 0;
    }
    if (errno != ERANGE) return errno;
    ssize_t wanted = call(nullptr, 0);
    if (wanted < 0) return errno;
    out.resize(static_cast<size_t>(wanted) + 1);
  }
  return ERANGE;
}

// A refusal to set `name` on the destination that is passed over: a
// security module's label on a file system that keeps no such labels.
bool mayPassOver(const std::string& name, int err) { return err == ENOTSUP && name.starts_with("security."); }

// Sets `attributes` at `place`. Returns 0 or the errno of the first refusal
// that may not be passed over.
int writeAttributes(const AttributePlace& place, const Attributes& attributes) {
  for (const Attribute& attribute : attributes) {
    if (place.set(attribute.name.c_str(), attribute.value.data(), attribute.value.size()) == 0) continue;
    int err = errno;
    if (!mayPassOver(attribute.name, err)) return err;
  }
  return 0;
}

// Removes the ACLs that a new item inherited and its source does not have.
int dropInheritedAcls(const AttributePlace& place, const Attributes& source, bool directory) {
  for (const char* name : {kAclAccess, kAclDefault}) {
    if ((name == kAclDefault && !directory) || hasAttribute(source, name)) continue;
    if (place.remove(name) != 0 && errno != ENODATA) return errno;
  }
  return 0;
}

// Whether items made at `place` (a directory) inherit a default ACL. A
// failing probe counts as no: it only decides whether to look for inherited
// ACLs on what is made there.
bool hasDefaultAcl(const AttributePlace& place) { return place.get(kAclDefault, nullptr, 0) > 0; }

// Reads the target of the link `name` in dirFd; `sizeHint` is its lstat size.
int readLink(int dirFd, const std::string& name, off_t sizeHint, std::string& target) {
  size_t size = sizeHint > 0 ? static_cast<size_t>(sizeHint) + 1 : PATH_MAX;
  for (int attempt = 0; attempt < kSizeProbeAttempts; ++attempt) {
    target.resize(size);
    ssize_t got = readlinkat(dirFd, name.c_str(), target.data(), size);
    if (got < 0) return errno;
    if (static_cast<size_t>(got) < size) {
      target.resize(static_cast<size_t>(got));
      return 0;
    }
    size *= 2;  // the link grew since lstat
  }
  return ENAMETOOLONG;
}

// The destination item whose metadata is set: an open descriptor, or a name
// in a directory for an item that is not opened (never followed).
struct Target {
  int fd = -1;
  int dirFd = -1;
  const std::string* name = nullptr;
  bool isLink = false;

  int chown(uid_t uid, gid_t gid) const {
    return fd >= 0 ? mut::fchown(fd, uid, gid) : mut::fchownat(dirFd, name->c_str(), uid, gid, AT_SYMLINK_NOFOLLOW);
  }
  // A link has no mode of its own on Linux.
  int chmod(mode_t mode) const {
    if (isLink) return 0;
    return fd >= 0 ? mut::fchmod(fd, mode) : mut::fchmodat(dirFd, name->c_str(), mode, AT_SYMLINK_NOFOLLOW);
  }
  int setTimes(const timespec times[2]) const {
    return fd >= 0 ? mut::futimens(fd, times) : mut::utimensat(dirFd, name->c_str(), times, AT_SYMLINK_NOFOLLOW);
  }
  AttributePlace attributes() const {
    return fd >= 0 ? AttributePlace::of(fd) : AttributePlace::at(dirFd, *name, false);
  }
};

// Gives the target the source's owner where permitted. The set-id bits of
// `mode` whose owner or group could not be given are cleared.
int setOwner(const Target& target, const struct stat& st, mode_t& mode) {
  if (target.chown(st.st_uid, st.st_gid) == 0) return 0;
  int err = errno;
  if (err != EPERM) return err;
  mode &= ~S_ISUID;
  if (target.chown(static_cast<uid_t>(-1), st.st_gid) == 0) return 0;
  err = errno;
  if (err != EPERM) return err;
  mode &= ~S_ISGID;
  return 0;
}

// A temporary item made to replace a non-directory: renamed over the
// destination by commit(), removed when the copy fails before that.
class PendingReplacement {
 public:
  PendingReplacement(int dirFd, std::string name) : dirFd_(dirFd), name_(std::move(name)) {}
  PendingReplacement(const PendingReplacement&) = delete;
  PendingReplacement& operator=(const PendingReplacement&) = delete;
  ~PendingReplacement() {
    if (name_.empty()) return;
    int saved = errno;
    mut::unlinkat(dirFd_, name_.c_str(), 0);
    errno = saved;
  }

  // Puts the item in place (nothing to do when it was made there).
  int commit(const std::string& finalName) {
    if (name_.empty()) return 0;
    if (mut::renameat(dirFd_, name_.c_str(), dirFd_, finalName.c_str()) != 0) return errno;
    name_.clear();
    return 0;
  }

 private:
  int dirFd_;
  std::string name_;
};

std::string temporaryName() {
  char name[32];
  snprintf(name, sizeof name, ".sl-copy-%08x", arc4random());
  return name;
}

// Makes a non-directory item called `name` in dirFd with `make(name)`, which
// creates exclusively and fails with EEXIST when something stands there.
// When a non-directory stands at `name`, the item is made under a temporary
// name instead and `temporary` holds it; a directory there gives EISDIR.
template <typename Make>
int makeNonDirectory(int dirFd, const std::string& name, std::string& temporary, Make make) {
  int err = make(name.c_str());
  if (err != EEXIST) return err;
  struct stat st;
  if (fstatat(dirFd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(st.st_mode)) return EISDIR;
  for (int attempt = 0; attempt < kTemporaryNameAttempts; ++attempt) {
    std::string candidate = temporaryName();
    err = make(candidate.c_str());
    if (err == 0) temporary = std::move(candidate);
    if (err != EEXIST) return err;
  }
  return EEXIST;
}

// One directory on the way down.
struct Level {
  UniqueFd src;  // the source directory; O_PATH once reopened
  UniqueFd dst;  // the destination directory, open for reading
  Identity srcId;
  Identity dstId;
  struct stat st;         // the source directory's status when entered,
  Attributes attributes;  // and its attributes: both are set on dst at the end
  std::vector<Entry> entries;
  size_t next = 0;        // first entry not yet copied
  bool inherits = false;  // items made in dst inherit a default ACL
};

// Splits a path given by the caller into the directory that holds the item
// and the item's name. A path whose last component is "." or "..", or the
// root, names a directory by itself: the item is then "." of that path.
struct TopPath {
  std::string parent;
  std::string name;
  bool trailingSlash = false;
};

int splitTop(const char* path, TopPath& out) {
  std::string_view p(path);
  if (p.empty()) return ENOENT;
  while (p.size() > 1 && p.back() == '/') {
    p.remove_suffix(1);
    out.trailingSlash = true;
  }
  const size_t slash = p.rfind('/');
  const std::string_view name = slash == std::string_view::npos ? p : p.substr(slash + 1);
  if (p == "/" || name == "." || name == "..") {
    out.parent.assign(p);
    out.name.assign(".");
    return 0;
  }
  out.parent.assign(slash == std::string_view::npos ? std::string_view(".")
                    : slash == 0                    ? std::string_view("/")
                                                    : p.substr(0, slash));
  out.name.assign(name);
  return 0;
}

class Copier {
 public:
  explicit Copier(copyfile_flags_t flags) : flags_(flags) {}

  // Returns 0 or the errno of the first failure.
  int copy(const char* from, const char* to) {
    TopPath src;
    TopPath dst;
    if (int err = splitTop(from, src); err != 0) return err;
    if (int err = splitTop(to, dst); err != 0) return err;

    // The prefixes are the caller's and are followed.
    UniqueFd srcParent(open(src.parent.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!srcParent) return errno;
    const bool follow = (flags_ & COPYFILE_NOFOLLOW_SRC) == 0;
    struct stat st;
    if (fstatat(srcParent.get(), src.name.c_str(), &st, follow ? 0 : AT_SYMLINK_NOFOLLOW) != 0) return errno;
    if ((src.trailingSlash || dst.trailingSlash) && !S_ISDIR(st.st_mode)) return ENOTDIR;

    UniqueFd dstParent(open(dst.parent.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!dstParent) return errno;
    struct stat dstSt;
    if (fstatat(dstParent.get(), dst.name.c_str(), &dstSt, AT_SYMLINK_NOFOLLOW) == 0) {
      if (S_ISLNK(dstSt.st_mode) && (flags_ & COPYFILE_NOFOLLOW_DST) == 0) {
        // Without NOFOLLOW_DST a link to a directory stands for the
        // directory: it becomes the parent, and "." in it the destination.
        struct stat linked;
        if (fstatat(dstParent.get(), dst.name.c_str(), &linked, 0) == 0 && S_ISDIR(linked.st_mode)) {
          UniqueFd directory(openat(dstParent.get(), dst.name.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
          if (!directory) return errno;
          dstParent = std::move(directory);
          dst.name = ".";
          dstSt = linked;
        }
      }
      if (identityOf(dstSt) == identityOf(st)) return 0;  // the same item
    } else if (errno != ENOENT) {
      return errno;
    }

    struct stat parentSt;
    if (fstat(dstParent.get(), &parentSt) != 0) return errno;
    dstDev_ = parentSt.st_dev;
    const bool inherits =
        (flags_ & COPYFILE_ACL) != 0 && hasDefaultAcl(AttributePlace::at(dstParent.get(), ".", false));
    unsigned char type = S_ISDIR(st.st_mode) ? DT_DIR : S_ISREG(st.st_mode) ? DT_REG : DT_UNKNOWN;
    if (int err = copyEntry(srcParent.get(), src.name, type, follow, dstParent.get(), dst.name, inherits); err != 0)
      return err;
    return walk();
  }

 private:
  // Copies the entries of the directories entered, depth first.
  int walk() {
    while (!stack_.empty()) {
      Level& level = stack_.back();
      if (level.next < level.entries.size()) {
        // copyEntry may push a level: work on a copy of what it needs.
        Entry entry = std::move(level.entries[level.next++]);
        dstDev_ = level.dstId.dev;
        const int err =
            copyEntry(level.src.get(), entry.name, entry.type, false, level.dst.get(), entry.name, level.inherits);
        if (err != 0) return err;
        continue;
      }
      if (int err = finishLevel(); err != 0) return err;
    }
    return 0;
  }

  // Copies the entry `name` of srcDir to `dstName` in dstDir; a directory is
  // entered (pushed) and finished later by the walk. `type` is the
  // listing's hint; what the item is comes from fstat.
  int copyEntry(int srcDir, const std::string& name, unsigned char type, bool follow, int dstDir,
                const std::string& dstName, bool inherits) {
    const int openFlags = O_RDONLY | O_NONBLOCK | O_CLOEXEC | (follow ? 0 : O_NOFOLLOW);
    struct stat st;
    UniqueFd fd;
    if (type == DT_REG || type == DT_DIR) {
      fd = UniqueFd(openat(srcDir, name.c_str(), openFlags));
      if (!fd) {
        int err = errno;
        // ELOOP: a link stands there now; ENXIO: a socket. Looked at below.
        if (err != ELOOP && err != ENXIO) return err;
      }
    }
    if (fd) {
      if (fstat(fd.get(), &st) != 0) return errno;
    } else {
      if (fstatat(srcDir, name.c_str(), &st, follow ? 0 : AT_SYMLINK_NOFOLLOW) != 0) return errno;
      if (S_ISREG(st.st_mode) || S_ISDIR(st.st_mode)) {
        fd = UniqueFd(openat(srcDir, name.c_str(), openFlags));
        if (!fd) return errno;
        if (fstat(fd.get(), &st) != 0) return errno;
      }
    }
    if (S_ISDIR(st.st_mode)) return enterDirectory(std::move(fd), st, dstDir, dstName, inherits);
    if (S_ISREG(st.st_mode)) return copyRegular(fd.get(), st, dstDir, dstName, inherits);
    return copyNode(srcDir, name, follow, st, dstDir, dstName, inherits);
  }

  int copyRegular(int in, const struct stat& st, int dstDir, const std::string& dstName, bool inherits) {
    Attributes attributes;
    if (int err = readAttributes(AttributePlace::of(in), attributes); err != 0) return err;
    const mode_t createMode = (flags_ & COPYFILE_STAT) != 0 ? kWorkingFileMode : (st.st_mode & 0777);
    UniqueFd out;
    std::string temporary;
    int err = makeNonDirectory(dstDir, dstName, temporary, [&](const char* name) {
      out = UniqueFd(mut::openat(dstDir, name, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, createMode));
      return out ? 0 : errno;
    });
    if (err != 0) return err;
    PendingReplacement pending(dstDir, temporary);
    if ((flags_ & COPYFILE_DATA) != 0) {
      if (err = copyData(in, out.get(), st); err != 0) return err;
    }
    if (err = setMetadata(Target{out.get()}, st, attributes, inherits, false); err != 0) return err;
    return pending.commit(dstName);
  }

  // Links, fifos, devices and sockets: made again, never opened.
  int copyNode(int srcDir, const std::string& name, bool follow, const struct stat& st, int dstDir,
               const std::string& dstName, bool inherits) {
    const bool link = S_ISLNK(st.st_mode);
    std::string linkTarget;
    if (link) {
      if (int err = readLink(srcDir, name, st.st_size, linkTarget); err != 0) return err;
    }
    Attributes attributes;
    if (int err = readAttributes(AttributePlace::at(srcDir, name, follow), attributes); err != 0) return err;
    const mode_t createMode = (flags_ & COPYFILE_STAT) != 0 ? kWorkingFileMode : (st.st_mode & 0777);
    std::string temporary;
    int err = makeNonDirectory(dstDir, dstName, temporary, [&](const char* made) {
      int result;
      if (link) {
        result = mut::symlinkat(linkTarget.c_str(), dstDir, made);
      } else if (S_ISFIFO(st.st_mode)) {
        result = mut::mkfifoat(dstDir, made, createMode);
      } else {
        result = mut::mknodat(dstDir, made, (st.st_mode & S_IFMT) | createMode, st.st_rdev);
      }
      return result == 0 ? 0 : errno;
    });
    if (err != 0) return err;
    PendingReplacement pending(dstDir, temporary);
    const std::string& made = temporary.empty() ? dstName : temporary;
    Target target{-1, dstDir, &made, link};
    // Links do not inherit ACLs.
    if (err = setMetadata(target, st, attributes, inherits && !link, false); err != 0) return err;
    return pending.commit(dstName);
  }

  // Makes the destination directory (or opens the one in the way) and
  // pushes a level for it. A source directory that this copy made is
  // passed over.
  int enterDirectory(UniqueFd src, const struct stat& st, int dstDir, const std::string& dstName, bool inherits) {
    if (made_.count(identityOf(st)) != 0) return 0;
    Level level;
    const mode_t createMode =
        (flags_ & COPYFILE_STAT) != 0 ? kWorkingDirectoryMode : ((st.st_mode & 0777) | S_IRWXU);
    const int openFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
    bool made = false;
    if (mut::mkdirat(dstDir, dstName.c_str(), createMode) == 0) {
      made = true;
      level.dst = UniqueFd(openat(dstDir, dstName.c_str(), openFlags));
      if (!level.dst) return errno;
    } else {
      int err = errno;
      if (err != EEXIST) return err;
      level.dst = UniqueFd(openat(dstDir, dstName.c_str(), openFlags));
      if (!level.dst) {
        err = errno;
        // A non-directory is in the way: ENOTDIR, also for a link, which
        // O_DIRECTORY|O_NOFOLLOW refuses so (ELOOP is mapped for safety).
        return err == ELOOP ? ENOTDIR : err;
      }
    }
    struct stat dstSt;
    if (fstat(level.dst.get(), &dstSt) != 0) return errno;
    if (made) {
      made_.insert(identityOf(dstSt));
      if (inherits && (flags_ & COPYFILE_ACL) != 0) {
        if (int err = dropInheritedAcls(AttributePlace::of(level.dst.get()), {}, true); err != 0) return err;
      }
    } else {
      level.inherits = (flags_ & COPYFILE_ACL) != 0 && hasDefaultAcl(AttributePlace::of(level.dst.get()));
    }
    if (int err = readAttributes(AttributePlace::of(src.get()), level.attributes); err != 0) return err;
    if ((flags_ & COPYFILE_RECURSIVE) != 0) {
      if (int err = readDirectoryEntries(src.get(), level.entries); err != 0) return err;
    }
    level.src = std::move(src);
    level.srcId = identityOf(st);
    level.dstId = identityOf(dstSt);
    level.st = st;
    stack_.push_back(std::move(level));
    if (stack_.size() - lowestOpen_ > kMaxOpenLevels) {
      stack_[lowestOpen_].src.reset();
      stack_[lowestOpen_].dst.reset();
      ++lowestOpen_;
    }
    return 0;
  }

  // All entries of the deepest level are copied: give its directory the
  // source's metadata and leave it, opening the parent level again first if
  // it was closed (the child's own mode may forbid the way up afterwards).
  int finishLevel() {
    const size_t depth = stack_.size() - 1;
    if (depth > 0 && !stack_[depth - 1].dst) {
      if (int err = reopenParent(depth); err != 0) return err;
    }
    Level& level = stack_.back();
    int err = setMetadata(Target{level.dst.get()}, level.st, level.attributes, false, true);
    stack_.pop_back();
    return err;
  }

  // Opens stack_[depth - 1] again through ".." of stack_[depth]; both must
  // be the directories recorded on the way down, or the tree was moved.
  int reopenParent(size_t depth) {
    Level& parent = stack_[depth - 1];
    Level& child = stack_[depth];
    UniqueFd src(openat(child.src.get(), "..", O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!src) return errno;
    UniqueFd dst(openat(child.dst.get(), "..", O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!dst) return errno;
    struct stat srcSt;
    struct stat dstSt;
    if (fstat(src.get(), &srcSt) != 0 || fstat(dst.get(), &dstSt) != 0) return errno;
    if (identityOf(srcSt) != parent.srcId || identityOf(dstSt) != parent.dstId) return ESTALE;
    parent.src = std::move(src);
    parent.dst = std::move(dst);
    lowestOpen_ = depth - 1;
    return 0;
  }

  // Owner, attributes, mode, times: in this order, since fchown clears the
  // set-id bits and the ACLs set some mode bits.
  int setMetadata(const Target& target, const struct stat& st, const Attributes& attributes, bool inherits,
                  bool directory) {
    mode_t mode = st.st_mode & 07777;
    const bool stat = (flags_ & COPYFILE_STAT) != 0;
    if (stat) {
      if (int err = setOwner(target, st, mode); err != 0) return err;
    }
    if (!attributes.empty() || (inherits && (flags_ & COPYFILE_ACL) != 0)) {
      AttributePlace place = target.attributes();
      if (int err = writeAttributes(place, attributes); err != 0) return err;
      if (inherits && (flags_ & COPYFILE_ACL) != 0) {
        if (int err = dropInheritedAcls(place, attributes, directory); err != 0) return err;
      }
    }
    if (!stat) return 0;
    if (target.chmod(mode) != 0) return errno;
    const timespec times[2] = {st.st_atim, st.st_mtim};
    if (target.setTimes(times) != 0) return errno;
    return 0;
  }

  // Reads the attributes that the flags ask for.
  int readAttributes(const AttributePlace& place, Attributes& out) {
    const bool acls = (flags_ & COPYFILE_ACL) != 0;
    const bool others = (flags_ & COPYFILE_XATTR) != 0;
    if (!acls && !others) return 0;
    int err = readSized(names_, [&](char* buffer, size_t size) { return place.list(buffer, size); });
    if (err == ENOTSUP) return 0;  // a file system without attributes
    if (err != 0) return err;
    const char* end = names_.data() + names_.size();
    for (const char* p = names_.data(); p < end;) {
      size_t length = strnlen(p, static_cast<size_t>(end - p));
      Attribute attribute{std::string(p, length), {}};
      p += length + 1;
      if (isAcl(attribute.name) ? !acls : !others) continue;
      err = readSized(attribute.value,
                      [&](char* buffer, size_t size) { return place.get(attribute.name.c_str(), buffer, size); });
      if (err == ENODATA) continue;  // removed since the listing
      if (err != 0) return err;
      out.push_back(std::move(attribute));
    }
    return 0;
  }

  int copyData(int in, int out, const struct stat& st) {
    if (st.st_size == 0) return 0;
    if (st.st_blocks * 512 >= st.st_size) return copyRange(in, out, 0, st.st_size, st.st_dev);
    // Holes: copy the data segments, then set the size (the file may end in
    // a hole).
    off_t position = 0;
    while (position < st.st_size) {
      off_t data = lseek(in, position, SEEK_DATA);
      if (data < 0) {
        int err = errno;
        if (err == ENXIO) break;  // only a hole from here on
        // A file system that cannot tell: copy everything.
        if (position == 0 && (err == EINVAL || err == EOPNOTSUPP)) return copyRange(in, out, 0, st.st_size, st.st_dev);
        return err;
      }
      if (data >= st.st_size) break;
      off_t hole = lseek(in, data, SEEK_HOLE);
      if (hole < 0) return errno;
      hole = std::min(hole, st.st_size);
      if (int err = copyRange(in, out, data, hole, st.st_dev); err != 0) return err;
      position = hole;
    }
    if (mut::ftruncate(out, st.st_size) != 0) return errno;
    return 0;
  }

  // Copies bytes [begin, end) of in to the same offsets of out: by
  // copy_file_range, else by sendfile, else through the buffer. A call that
  // refuses (see the errno lists) or copies nothing hands the rest of the
  // range to the next way; pread finding the end means that the file
  // shrank, and the copy stops there. A refusal of copy_file_range is
  // remembered for the pair of volumes, so the files after the first one
  // between them go straight to the next way.
  int copyRange(int in, int out, off_t begin, off_t end, dev_t srcDev) {
    enum class Way { kCopyFileRange, kSendfile, kBuffer };
    const std::pair<dev_t, dev_t> volumes(srcDev, dstDev_);
    Way way = copyfile_test_buffered_data                     ? Way::kBuffer
              : kernelCopyRefused_ && refusedVolumes_ == volumes ? Way::kSendfile
                                                              : Way::kCopyFileRange;
    off64_t inOffset = begin;
    off64_t outOffset = begin;
    // sendfile writes at the file position of out, which is 0 until a
    // sendfile or write moves it (out is a new file).
    bool positioned = begin == 0;
    while (inOffset < end) {
      const size_t wanted = static_cast<size_t>(std::min<off64_t>(end - inOffset, kKernelChunk));
      if (way == Way::kCopyFileRange) {
        ssize_t copied = mut::copy_file_range(in, &inOffset, out, &outOffset, wanted, 0);
        if (copied > 0) continue;
        int err = errno;
        if (copied < 0 && err == EINTR) continue;
        if (copied < 0 && !copyFileRangeRefused(err)) return err;
        if (copied < 0) {
          kernelCopyRefused_ = true;
          refusedVolumes_ = volumes;
        }
        way = Way::kSendfile;
        positioned = positioned && outOffset == 0;
        continue;
      }
      if (way == Way::kSendfile) {
        if (!positioned) {
          if (lseek(out, outOffset, SEEK_SET) < 0) return errno;
          positioned = true;
        }
        off_t offset = inOffset;
        ssize_t sent = mut::sendfile(out, in, &offset, wanted);
        if (sent > 0) {
          inOffset += sent;
          outOffset += sent;
          continue;
        }
        int err = errno;
        if (sent < 0 && err == EINTR) continue;
        if (sent < 0 && !sendfileRefused(err)) return err;
        way = Way::kBuffer;
        continue;
      }
      if (!buffer_) buffer_ = std::make_unique_for_overwrite<char[]>(kBufferSize);
      ssize_t got = pread(in, buffer_.get(), std::min(wanted, kBufferSize), inOffset);
      if (got < 0) {
        if (errno == EINTR) continue;
        return errno;
      }
      if (got == 0) break;
      for (ssize_t written = 0; written < got;) {
        ssize_t put = mut::pwrite(out, buffer_.get() + written, static_cast<size_t>(got - written), outOffset);
        if (put < 0) {
          if (errno == EINTR) continue;
          return errno;
        }
        written += put;
        outOffset += put;
      }
      inOffset += got;
    }
    return 0;
  }

  copyfile_flags_t flags_;
  std::vector<Level> stack_;
  // Levels [lowestOpen_, stack_.size()) hold open descriptors; those below
  // were closed.
  size_t lowestOpen_ = 0;
  std::set<Identity> made_;  // directories this copy made
  std::unique_ptr<char[]> buffer_;
  dev_t dstDev_ = 0;  // volume of the destination directory at hand
  bool kernelCopyRefused_ = false;  // copy_file_range refused between
  std::pair<dev_t, dev_t> refusedVolumes_;  // these volumes (source, destination)
  std::string names_;  // scratch for attribute lists
};

}  // namespace

int copyfile(const char* from, const char* to, copyfile_state_t state, copyfile_flags_t flags) {
  if (state != nullptr || from == nullptr || to == nullptr || (flags & ~kKnownFlags) != 0) {
    errno = EINVAL;
    return -1;
  }
  int err;
  {
    Copier copier(flags);
    err = copier.copy(from, to);
  }
  // The copier's destructor closes descriptors; the caller reads the errno
  // of the failure.
  if (err == 0) return 0;
  errno = err;
  return -1;
}

}  // namespace sl
