#include "Platform/AtomicFile.h"

#include <fcntl.h>
#include <limits.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>

#include "Platform/Format.h"
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
    ::unlinkat(dirFd_, name_.c_str(), 0);
    errno = saved;
  }
  TemporaryFile(const TemporaryFile&) = delete;
  TemporaryFile& operator=(const TemporaryFile&) = delete;
  void disarm() { dirFd_ = -1; }

 private:
  int dirFd_;
  std::string name_;
};

}  // namespace

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
    fd = UniqueFd(::openat(dir.get(), tempName.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
    openErrno = errno;
    if (!fd && openErrno != EEXIST) break;
  }
  std::string tempPath = (dirPath == "/" ? "" : dirPath) + "/" + tempName;
  if (!fd) return failStep(error, openErrno, "open", tempPath);
  TemporaryFile guard(dir.get(), tempName);

  size_t done = 0;
  while (done < bytes.size()) {
    ssize_t n = ::write(fd.get(), bytes.data() + done, bytes.size() - done);
    if (n < 0) {
      int e = errno;
      if (e == EINTR) continue;
      return failStep(error, e, "write", tempPath);
    }
    if (n == 0) return failStep(error, EIO, "write", tempPath);
    done += static_cast<size_t>(n);
  }
  // fchmod is not subject to the umask, so the file gets exactly `mode`.
  if (::fchmod(fd.get(), mode) != 0) return failStep(error, errno, "fchmod", tempPath);
  if (::fsync(fd.get()) != 0) return failStep(error, errno, "fsync", tempPath);
  if (::close(fd.release()) != 0) return failStep(error, errno, "close", tempPath);

  // rename replaces a symbolic link at the destination with the file; it
  // never writes through it.
  if (::renameat(dir.get(), tempName.c_str(), dir.get(), name.c_str()) != 0) {
    int e = errno;
    if (error) *error = Error::posix(e, format("rename of %s to %s failed: %s", tempPath, path, errnoText(e)));
    return false;
  }
  guard.disarm();

  // Makes the rename durable. Some file systems cannot flush a directory
  // (EINVAL): the rename then stands as the file system keeps it.
  if (::fsync(dir.get()) != 0 && errno != EINVAL) return failStep(error, errno, "fsync", dirPath);
  return true;
}

}  // namespace sl
