#include "Platform/AtomicFile.h"

#include <fcntl.h>
#include <limits.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include "Platform/Format.h"
#include "Platform/Mutations.h"
#include "Platform/UniqueFd.h"

namespace sl {

namespace {

std::string errnoText(int code) {
  char buf[256];
  return strerror_r(code, buf, sizeof buf);  // the GNU form answers the text
}

bool failStep(Error* error, int code, const char* step, const std::string& path) {
  if (error) *error = Error::posix(code, format("%s of %s failed: %s", step, path, errnoText(code)));
  return false;
}

// ".<name>.XXXXXX" with six random characters; the name part is cut so that
// the whole stays within NAME_MAX.
std::string temporaryName(const std::string& name) {
  static constexpr char kChars[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
  uint8_t random[6];
  if (getrandom(random, sizeof random, GRND_NONBLOCK) != static_cast<ssize_t>(sizeof random)) {
    // Only uniqueness matters here, not secrecy: O_EXCL catches collisions.
    static thread_local uint64_t counter = static_cast<uint64_t>(getpid()) << 20;
    uint64_t v = ++counter * 0x9E3779B97F4A7C15ull;
    std::memcpy(random, &v, sizeof random);
  }
  std::string out = ".";
  out += name.substr(0, NAME_MAX - 8);
  out += '.';
  for (uint8_t r : random) out += kChars[r % (sizeof kChars - 1)];
  return out;
}

// Removes the temporary file unless disarmed: every way out before the
// rename succeeds goes through here.
class TemporaryFile {
 public:
  TemporaryFile(int dirFd, std::string name) : dirFd_(dirFd), name_(std::move(name)) {}
  ~TemporaryFile() {
    if (dirFd_ < 0) return;
    int saved = errno;
    mut::unlinkat(dirFd_, name_.c_str(), 0);
    errno = saved;
  }
  TemporaryFile(const TemporaryFile&) = delete;
  TemporaryFile& operator=(const TemporaryFile&) = delete;
  void disarm() { dirFd_ = -1; }

 private:
  int dirFd_;
  std::string name_;
};

// Temporary files of earlier writes of `name` that never reached their
// rename (the process was killed between open and rename): ".<name>.XXXXXX"
// regular files. They are removed once the new content is in place, so
// that a file rewritten after a crash leaves nothing beside it. Failures
// are ignored: the write itself has succeeded.
void removeStaleTemporaries(int dirFd, const std::string& name) {
  const std::string prefix = "." + name.substr(0, NAME_MAX - 8) + ".";
  std::vector<std::string> stale;
  {
    UniqueFd copy(::openat(dirFd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    UniqueDir listing = copy ? fdopendir(copy) : UniqueDir();
    if (!listing) return;
    while (const struct dirent* entry = ::readdir(listing.get())) {
      const std::string entryName = entry->d_name;
      if (entryName.size() == prefix.size() + 6 && entryName.compare(0, prefix.size(), prefix) == 0) {
        stale.push_back(entryName);
      }
    }
  }
  for (const std::string& entryName : stale) {
    struct stat st;
    if (::fstatat(dirFd, entryName.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(st.st_mode)) {
      (void)mut::unlinkat(dirFd, entryName.c_str(), 0);
    }
  }
}

// Flushes the open `fd` (a file or a directory); EINVAL, a file system that
// cannot flush it, is no failure.
bool syncDescriptor(int fd, const std::string& path, Error* error) {
  if (mut::fsync(fd) != 0) {
    const int syncErrno = errno;
    if (syncErrno != EINVAL) return failStep(error, syncErrno, "fsync", path);
  }
  return true;
}

// What this thread has deferred: one open directory on each file system
// that a deferred flush noted, and how deep the DeferredSyncs objects nest.
struct Deferred {
  struct FileSystem {
    dev_t device;
    UniqueFd fd;
    std::string path;
    bool onlyRemovals;  // nothing noted here but syncDirectoryAfterRemoval
  };
  int depth = 0;
  int contentDepth = 0;  // scopes that defer the content of scratch files too
  std::vector<FileSystem> pending;
};
thread_local Deferred tDeferred;

// Flushes the directory open as `fd`, or notes its file system while
// flushes are deferred.
bool syncOpenDirectory(int fd, const std::string& path, Error* error, bool afterRemoval = false) {
  if (tDeferred.depth == 0) return syncDescriptor(fd, path, error);
  struct stat st;
  if (::fstat(fd, &st) != 0) return failStep(error, errno, "fstat", path);
  for (Deferred::FileSystem& noted : tDeferred.pending) {
    if (noted.device != st.st_dev) continue;
    noted.onlyRemovals = noted.onlyRemovals && afterRemoval;
    return true;
  }
  UniqueFd copy(::fcntl(fd, F_DUPFD_CLOEXEC, 0));
  if (!copy) return failStep(error, errno, "dup", path);
  tDeferred.pending.push_back({st.st_dev, std::move(copy), path, afterRemoval});
  return true;
}

}  // namespace

DeferredSyncs::DeferredSyncs(What what) : what_(what) {
  ++tDeferred.depth;
  if (what_ == What::kDirectoriesAndContent) ++tDeferred.contentDepth;
}

DeferredSyncs::~DeferredSyncs() {
  if (what_ == What::kDirectoriesAndContent) --tDeferred.contentDepth;
  if (--tDeferred.depth > 0) return;
  (void)flushDeferredSyncs();
  tDeferred.pending.clear();
}

bool flushDeferredSyncs(Error* error) {
  std::vector<Deferred::FileSystem>& pending = tDeferred.pending;
  while (!pending.empty()) {
    const Deferred::FileSystem& noted = pending.back();
    if (mut::syncfs(noted.fd.get()) != 0) return failStep(error, errno, "syncfs", noted.path);
    pending.pop_back();
  }
  return true;
}

bool deferredSyncsPending(Pending which) {
  for (const Deferred::FileSystem& noted : tDeferred.pending) {
    if (which == Pending::kAny || !noted.onlyRemovals) return true;
  }
  return false;
}

bool writeFileAtomically(const URL& url, std::span<const uint8_t> bytes, mode_t mode, Error* error) {
  const std::string& path = url.path();
  size_t slash = path.rfind('/');
  std::string dirPath = slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
  std::string name = slash == std::string::npos ? path : path.substr(slash + 1);
  if (name.empty() || name == "." || name == "..") {
    if (error) *error = Error::posix(EINVAL, format("atomic write needs a file path, not \"%s\"", path));
    return false;
  }

  UniqueFd dir(::open(dirPath.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dir) return failStep(error, errno, "open", dirPath);

  std::string tempName;
  UniqueFd fd;
  int openErrno = 0;
  for (int attempt = 0; attempt < 100 && !fd; ++attempt) {
    tempName = temporaryName(name);
    fd = UniqueFd(mut::openat(dir.get(), tempName.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
    openErrno = errno;
    if (!fd && openErrno != EEXIST) break;
  }
  std::string tempPath = (dirPath == "/" ? "" : dirPath) + "/" + tempName;
  if (!fd) return failStep(error, openErrno, "open", tempPath);
  TemporaryFile guard(dir.get(), tempName);

  size_t done = 0;
  while (done < bytes.size()) {
    ssize_t n = mut::write(fd.get(), bytes.data() + done, bytes.size() - done);
    if (n < 0) {
      int e = errno;
      if (e == EINTR) continue;
      return failStep(error, e, "write", tempPath);
    }
    if (n == 0) return failStep(error, EIO, "write", tempPath);
    done += static_cast<size_t>(n);
  }
  // fchmod is not subject to the umask, so the file gets exactly `mode`.
  if (mut::fchmod(fd.get(), mode) != 0) return failStep(error, errno, "fchmod", tempPath);
  // The content is on disk before the name: whatever makes the name durable
  // (this call's flush, a later one, the file system's own commit), the
  // file is then whole. A scratch file's waits for its scope's flush.
  if (tDeferred.contentDepth == 0 && mut::fsync(fd.get()) != 0) return failStep(error, errno, "fsync", tempPath);
  if (::close(fd.release()) != 0) return failStep(error, errno, "close", tempPath);

  // rename replaces a symbolic link at the destination with the file; it
  // never writes through it.
  if (mut::renameat(dir.get(), tempName.c_str(), dir.get(), name.c_str()) != 0) {
    int e = errno;
    if (error) *error = Error::posix(e, format("rename of %s to %s failed: %s", tempPath, path, errnoText(e)));
    return false;
  }
  guard.disarm();

  // Makes the rename durable. Some file systems cannot flush a directory
  // (EINVAL): the rename then stands as the file system keeps it.
  if (!syncOpenDirectory(dir.get(), dirPath, error)) return false;
  removeStaleTemporaries(dir.get(), name);
  return true;
}

bool syncDirectory(const std::string& path, Error* error) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd) return failStep(error, errno, "open", path);
  return syncOpenDirectory(fd.get(), path, error);
}

bool syncDirectoryAfterRemoval(int directoryFd, const std::string& path, Error* error) {
  return syncOpenDirectory(directoryFd, path, error, true);
}

bool syncParentDirectory(const std::string& path, Error* error) {
  std::string parent = path;
  while (parent.size() > 1 && parent.back() == '/') parent.pop_back();
  const size_t slash = parent.rfind('/');
  if (slash == std::string::npos) return true;
  parent.resize(slash == 0 ? 1 : slash);
  return syncDirectory(parent, error);
}

bool syncTree(const std::string& path, Error* error) {
  // The item itself, or for one that cannot be opened so (a link, a socket)
  // the directory that holds it: either is on the tree's file system.
  std::string opened = path;
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (!fd) {
    const size_t slash = path.find_last_of('/');
    opened = slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
    fd = UniqueFd(::open(opened.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!fd) return failStep(error, errno, "open", opened);
  }
  if (mut::syncfs(fd.get()) != 0) return failStep(error, errno, "syncfs", path);
  return true;
}

}  // namespace sl
