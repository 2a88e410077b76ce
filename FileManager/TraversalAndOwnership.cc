// SLFileManager: a physical walk over a directory tree, and the
// standardisation of owners and modes built on it.

#include <fcntl.h>
#include <fts.h>
#include <linux/openat2.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <algorithm>
#include <cstring>
#include <memory>

#include "FileManager/SLFileManager.h"
#include "Platform/Mutations.h"
#include "Platform/UniqueFd.h"
#include "Support/Errors.h"
#include "Support/Log.h"

namespace {

// Closes a walk on the early exits; the normal exit closes it itself to see
// whether fts_close failed.
struct FtsCloser {
  void operator()(FTS* fts) const {
    int saved = errno;
    ::fts_close(fts);
    errno = saved;
  }
};
using UniqueFts = std::unique_ptr<FTS, FtsCloser>;

constexpr mode_t kStandardDirectoryMode = 0755;
constexpr mode_t kStandardMode = 0644;
// Permissions with the set-user-ID, set-group-ID and sticky bits.
constexpr mode_t kPermissionBits = 07777;

// fchmodat2 (Linux 6.6), the only chmod that takes an O_PATH descriptor with
// AT_EMPTY_PATH; glibc 2.36 has neither a wrapper nor a number for it.
constexpr long kSysFchmodat2 = 452;

// One entry of the walk, changed only through a descriptor pinned to the
// item that the walk examined. Between the walk's lstat and the change the
// path may have been swapped for a link, or a directory above it for a link
// to elsewhere; a change by path would then land on whatever the path names
// by now. The pin is opened on first use, without following a final link,
// and must have the device and inode of the walk's status; otherwise the
// change fails with ESTALE and nothing is touched.
//
// The walk itself reads directories by path (fts without chdir), so a
// directory swapped for a link between its lstat and its reading is read
// through the link, and its entries arrive with paths that lead outside the
// tree. Entries below the root are therefore pinned relative to a descriptor
// of the root with openat2, refusing every link on the way
// (RESOLVE_NO_SYMLINKS; a trailing link is pinned as the link). A link met
// on the way is reported as ESTALE, like any other entry that changed.
//
// A regular file with more than one link is not changed (EMLINK): its other
// names may lie outside the tree, and the tree has no say over them.
class WalkedItem {
 public:
  // `rootFd` is a descriptor of the walk's root, or -1 to pin by path.
  WalkedItem(const FTSENT* entry, int rootFd, size_t rootPathLength)
      : entry_(entry), rootFd_(rootFd), rootPathLength_(rootPathLength) {}

  // 0, or the errno of the pin or of the change.
  int changeOwner(uid_t uid, gid_t gid) {
    if (int pinErrno = pin(); pinErrno != 0) return pinErrno;
    // On a pinned link this changes the link itself.
    if (sl::mut::fchownat(fd_.get(), "", uid, gid, AT_EMPTY_PATH) != 0) return errno;
    return 0;
  }

  int changeMode(mode_t mode) {
    // Linux links have no mode of their own: nothing to change, as lchmod.
    if (S_ISLNK(entry_->fts_statp->st_mode)) return 0;
    if (int pinErrno = pin(); pinErrno != 0) return pinErrno;
    // One change, counted once, whichever of the two calls below makes it.
    if (const int refused = sl::mut::admit(sl::mut::Kind::kMode, entry_->fts_path)) return refused;
    if (::syscall(kSysFchmodat2, fd_.get(), "", mode, AT_EMPTY_PATH) == 0) return 0;  // not counted: admitted above
    int chmodErrno = errno;
    if (chmodErrno != ENOSYS) return chmodErrno;
    // Kernels before 6.6: through the descriptor's entry in /proc, which
    // leads to the pinned inode, not to whatever the path names now. The item
    // is no link (see above), so following the entry is what is wanted.
    char procPath[32];
    snprintf(procPath, sizeof procPath, "/proc/self/fd/%d", fd_.get());
    if (::chmod(procPath, mode) != 0) return errno;  // not counted: admitted above
    return 0;
  }

 private:
  int pin() {
    if (pinErrno_ >= 0) return pinErrno_;
    if (int openErrno = open(); openErrno != 0) return pinErrno_ = openErrno;
    struct stat pinned;
    if (::fstat(fd_.get(), &pinned) != 0) return pinErrno_ = errno;
    const struct stat& walked = *entry_->fts_statp;
    if (pinned.st_dev != walked.st_dev || pinned.st_ino != walked.st_ino) return pinErrno_ = ESTALE;
    if (S_ISREG(pinned.st_mode) && pinned.st_nlink > 1) return pinErrno_ = EMLINK;
    return pinErrno_ = 0;
  }

  // Opens fd_ on the entry; 0 or the errno.
  int open() {
    const char* relative = entry_->fts_path + std::min(rootPathLength_, static_cast<size_t>(entry_->fts_pathlen));
    while (*relative == '/') ++relative;
    if (entry_->fts_level > FTS_ROOTLEVEL && rootFd_ >= 0 && *relative != '\0') {
      struct open_how how {};
      how.flags = O_PATH | O_NOFOLLOW | O_CLOEXEC;
      how.resolve = RESOLVE_BENEATH | RESOLVE_NO_SYMLINKS;
      const long opened = ::syscall(SYS_openat2, rootFd_, relative, &how, sizeof how);  // not counted: O_PATH
      fd_ = sl::UniqueFd(static_cast<int>(opened));
      if (fd_) return 0;
      const int openErrno = errno;
      if (openErrno != ENOSYS) return openErrno == ELOOP ? ESTALE : openErrno;
      // Kernels before 5.6 have no openat2: the identity check alone.
    }
    fd_ = sl::UniqueFd(::open(entry_->fts_accpath, O_PATH | O_NOFOLLOW | O_CLOEXEC));
    return fd_ ? 0 : errno;
  }

  const FTSENT* entry_;
  int rootFd_;
  size_t rootPathLength_;
  sl::UniqueFd fd_;
  int pinErrno_ = -1;  // not pinned yet
};

}  // namespace

bool SLFileManager::_traverseDirectory(const sl::URL& url, sl::Error* error, const TraversalCallback& withBlock) {
  static constexpr char kFunctionName[] = "-[SLFileManager _traverseDirectory:error:withBlock:]";
  const char* rootPath = url.fileSystemRepresentation();
  // fts_open does not write to the paths it is given.
  char* const roots[] = {const_cast<char*>(rootPath), nullptr};
  UniqueFts fts(::fts_open(roots, FTS_PHYSICAL | FTS_NOCHDIR | FTS_XDEV, nullptr));
  if (!fts) {
    int openErrno = errno;
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, openErrno,
                                        "fts_open failed for %s with error %s", rootPath, strerror(openErrno)));
  }

  // Policy: the first entry whose status cannot be read, or the first NO of
  // the callback, stops the walk; everything else goes to the callback,
  // unreadable directories and links included. A null from fts_read ends the
  // walk with the last answer; a failure of fts_read itself (null with errno
  // set) is not told apart from the end. A mount point arrives, but the walk
  // does not enter it.
  sl::Error walkError;
  bool answer = true;
  while (FTSENT* entry = ::fts_read(fts.get())) {
    if (entry->fts_info == FTS_ERR || entry->fts_info == FTS_NS) {
      const int entryErrno = entry->fts_errno;
      walkError = _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, entryErrno, "Error for path %s: %s",
                               rootPath, strerror(entryErrno));
      answer = false;
      break;
    }
    if (!withBlock(entry, &walkError)) {
      answer = false;
      break;
    }
  }

  if (::fts_close(fts.release()) != 0) {
    int closeErrno = errno;
    answer = false;
    if (walkError.isNull()) {
      walkError = _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, closeErrno,
                               "fts_close failed for %s with error %s", rootPath, strerror(closeErrno));
    }
  }
  // A callback may stop the walk without a record: the slot is then left
  // as the caller set it.
  if (!answer && !walkError.isNull()) sl::fail(error, walkError);
  return answer;
}

bool SLFileManager::standardizeOwnershipAtURL(const sl::URL& url, uid_t toUID, gid_t GID, bool validateSymlinks,
                                              sl::Error* error) {
  static constexpr char kFunctionName[] = "-[SLFileManager standardizeOwnershipAtURL:toUID:GID:validateSymlinks:error:]";
  // Policy: a change that fails is logged and the walk goes on; a link that
  // leads out of the tree stops it. What was changed before a stop stays.
  // Directories arrive twice with the status the walk read the first time,
  // so a directory that needed a change is changed on both arrivals.
  // The root is the caller's and is reached by path; what lies below it is
  // pinned relative to it. Without a descriptor (the root is no directory,
  // and so has nothing below it) entries are pinned by path.
  const sl::UniqueFd rootFd(::open(url.fileSystemRepresentation(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  const size_t rootPathLength = strlen(url.fileSystemRepresentation());
  return _traverseDirectory(url, error, [&](FTSENT* entry, sl::Error* entryError) {
    const struct stat& status = *entry->fts_statp;
    const char* path = entry->fts_path;
    WalkedItem item(entry, rootFd.get(), rootPathLength);

    if (status.st_uid != toUID || status.st_gid != GID) {
      if (int chownErrno = item.changeOwner(toUID, GID); chownErrno != 0) {
        SLLog(sl::kLogLevelError, kFunctionName, "Could not chown %s: %s", path, strerror(chownErrno));
      }
    }

    if (validateSymlinks && S_ISLNK(status.st_mode)) {
      const sl::URL link = sl::URL::fileURLWithFileSystemRepresentation(path, false);
      if (realPathForURL(link, url).isNull()) {
        return sl::fail(entryError, _CreateAndLogError(kFunctionName, __LINE__, SLInstallerErrorDomain,
                                                       kSLInstallerInvalidSymlinkError, nullptr,
                                                       sl::Dictionary{{"LegacyErrorString",
                                                                       sl::Number(kSLInstallerInvalidSymlinkError)}},
                                                       "invalid symlink at %s", path));
      }
    }

    const mode_t standardMode = S_ISDIR(status.st_mode) ? kStandardDirectoryMode : kStandardMode;
    if ((status.st_mode & kPermissionBits) != standardMode) {
      if (int chmodErrno = item.changeMode(standardMode); chmodErrno != 0) {
        SLLog(sl::kLogLevelError, kFunctionName, "Could not chmod %s: %s", path, strerror(chmodErrno));
      }
    }
    return true;
  });
}
