#include "Support/Digest.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <string_view>

#include "Platform/UniqueFd.h"
#include "Support/Log.h"

namespace {

constexpr int64_t kMaxChunk = 65536;

struct FreeDeleter {
  void operator()(void* p) const { std::free(p); }
};

struct DigestContextFree {
  void operator()(EVP_MD_CTX* context) const { EVP_MD_CTX_free(context); }
};
using UniqueDigestContext = std::unique_ptr<EVP_MD_CTX, DigestContextFree>;

// Writes one error line and leaves errno as it was before, so that the
// caller still sees the error of the call that failed.
template <class... Args>
void logKeepingErrno(const char* function, sl::FormatString<std::type_identity_t<Args>...> format,
                     const Args&... args) {
  int saved = errno;
  SLLog(sl::kLogLevelError, function, format, args...);
  errno = saved;
}

}  // namespace

bool _ReadFile(const char* path, const std::function<bool(const uint8_t* chunk, size_t length)>& consumer) {
  static constexpr char kFunctionName[] = "_ReadFile";

  sl::UniqueFd fd(::open(path, O_RDONLY | O_CLOEXEC));
  if (!fd) {
    int openErrno = errno;
    logKeepingErrno(kFunctionName, "failed to open %s : %s", path, strerror(openErrno));
    return false;
  }

  struct stat status;
  if (::fstat(fd.get(), &status) != 0) {
    int statErrno = errno;
    logKeepingErrno(kFunctionName, "failed to stat %s : %s", path, strerror(statErrno));
    return false;
  }

  // Byte counts are 64-bit here, so a file of 2 GiB or more is read whole
  // like any other, in chunks of the same bounded size.
  const int64_t size = status.st_size;
  const int64_t bufferSize = std::min(size, kMaxChunk);
  std::unique_ptr<uint8_t, FreeDeleter> buffer(static_cast<uint8_t*>(std::malloc(static_cast<size_t>(bufferSize))));
  // malloc(0) may answer null; an empty file needs no buffer.
  if (!buffer && bufferSize > 0) {
    int mallocErrno = errno;
    logKeepingErrno(kFunctionName, "malloc failed for %ld bytes: %s", static_cast<long>(bufferSize),
                    strerror(mallocErrno));
    return false;
  }
  if (size == 0) return true;
  // The file is read once from start to end: a larger read-ahead keeps the
  // disk busy while the chunks are hashed. Only a hint; its failure is not
  // the read's.
  (void)::posix_fadvise(fd.get(), 0, 0, POSIX_FADV_SEQUENTIAL);

  // Only the first `size` bytes are read: a file that grows meanwhile is
  // hashed as far as its size at the fstat, one that shrinks ends early and
  // fails.
  int64_t total = 0;
  int64_t request = bufferSize;
  for (;;) {
    request = std::min(request, size - total);
    ssize_t count;
    do {
      count = ::read(fd.get(), buffer.get(), static_cast<size_t>(request));
    } while (count < 0 && errno == EINTR);  // a signal is not a read error: ask again
    if (count < 0) {
      int readErrno = errno;
      logKeepingErrno(kFunctionName, "read failed for %s : %s", path, strerror(readErrno));
      return false;
    }
    if (count == 0) {
      logKeepingErrno(kFunctionName, "read failed for %s, got %lld bytes", path, static_cast<long long>(count));
      return false;
    }
    if (!consumer(buffer.get(), static_cast<size_t>(count))) return false;
    total += count;
    if (total >= size) return true;
  }
}

sl::String SLCreateSHA256Digest(const sl::URL& path) {
  static constexpr char kFunctionName[] = "SLCreateSHA256Digest";

  UniqueDigestContext context(EVP_MD_CTX_new());
  if (!context || EVP_DigestInit_ex(context.get(), EVP_sha256(), nullptr) != 1) {
    SLLog(sl::kLogLevelError, kFunctionName, "Failed to start a SHA-256 digest for %@", path);
    return nullptr;
  }

  // The SHA-256 update of the library cannot fail for lack of anything but
  // a broken context; should it, the result is refused below, after the read
  // has run its course as usual.
  bool digestFailed = false;
  bool readOK = _ReadFile(path.fileSystemRepresentation(), [&](const uint8_t* chunk, size_t length) {
    if (EVP_DigestUpdate(context.get(), chunk, length) != 1) digestFailed = true;
    return true;
  });
  int readErrno = errno;

  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int digestLength = 0;
  if (EVP_DigestFinal_ex(context.get(), digest, &digestLength) != 1 || digestLength != 32) digestFailed = true;

  if (!readOK) {
    SLLog(sl::kLogLevelError, kFunctionName, "Failed to read %@ : %s", path, strerror(readErrno));
    return nullptr;
  }
  if (digestFailed) {
    SLLog(sl::kLogLevelError, kFunctionName, "Failed to compute the SHA-256 digest of %@", path);
    return nullptr;
  }

  static constexpr char kHexDigits[] = "0123456789abcdef";
  char hex[65] = {};
  for (unsigned int i = 0; i < 32; ++i) {
    hex[2 * i] = kHexDigits[digest[i] >> 4];
    hex[2 * i + 1] = kHexDigits[digest[i] & 0x0f];
  }
  return sl::String(std::string_view(hex, 64));
}
