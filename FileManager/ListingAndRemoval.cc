// SLFileManager: the shared instance, recursive removal, one-level listing and
// the two existence tests.

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <memory>
#include <string_view>

#include "FileManager/SLFileManager.h"
#include "Platform/Removefile.h"
#include "Platform/UniqueFd.h"
#include "Support/Errors.h"
#include "Support/Log.h"

namespace {

struct RemovefileStateFree {
  void operator()(sl::removefile_state_t state) const { sl::removefile_state_free(state); }
};
using UniqueRemovefileState = std::unique_ptr<sl::removefile_state, RemovefileStateFree>;

// Called by removefile for each entry it could not remove or read. The
// policy: log the failure (an entry that vanished meanwhile is not worth a
// line), remember the first error number seen in the removal's context, and
// always proceed, so that as much of the tree as possible goes.
int _removefile_error_callback(sl::removefile_state_t state, const char* path, void* context) {
  static constexpr char kFunctionName[] = "_removefile_error_callback";
  int entryErrno = 0;
  if (sl::removefile_state_get(state, sl::REMOVEFILE_STATE_ERRNO, &entryErrno) != 0) {
    SLLog(sl::kLogLevelError, kFunctionName, "removefile hit error for %s but we failed to get the error number",
          path);
    entryErrno = ENOENT;
  } else if (entryErrno != ENOENT) {
    SLLog(sl::kLogLevelError, kFunctionName, "removefile hit error for %s : %s", path, strerror(entryErrno));
  }
  // The first number wins, ENOENT included: a removal whose first failing
  // entry had merely vanished counts as a success, whatever came after.
  auto* firstErrno = static_cast<int32_t*>(context);
  if (firstErrno != nullptr && *firstErrno == 0) *firstErrno = entryErrno;
  return sl::REMOVEFILE_PROCEED;
}

uint8_t directoryEntryTypeOfMode(mode_t mode) {
  if (S_ISDIR(mode)) return DT_DIR;
  if (S_ISLNK(mode)) return DT_LNK;
  if (S_ISREG(mode)) return DT_REG;
  return DT_UNKNOWN;
}

}  // namespace

SLFileManager& SLFileManager::defaultManager() {
  // Made once (the initialisation of a function-local static is thread-safe)
  // and never destroyed, so that it outlives every other static that uses it.
  static SLFileManager* const instance = new SLFileManager();
  return *instance;
}

bool SLFileManager::removeItemAtURL(const sl::URL& url, sl::Error* error) {
  static constexpr char kFunctionName[] = "-[SLFileManager removeItemAtURL:error:]";
  // Freed on every path below. A failed allocation leaves a null state,
  // which removefile accepts: the removal then runs without the callback.
  UniqueRemovefileState state(sl::removefile_state_alloc());

  if (url.isNull()) {
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, EFAULT,
                                        "nil url passed to -removeItemAtURL:error:"));
  }

  // Failing to install the callback or the context is logged and survived:
  // the removal itself can still succeed.
  if (sl::removefile_state_set(state.get(), sl::REMOVEFILE_STATE_ERROR_CALLBACK,
                               reinterpret_cast<const void*>(&_removefile_error_callback)) != 0) {
    int setErrno = errno;
    SLLog(sl::kLogLevelError, kFunctionName, "removefile_state_set REMOVEFILE_STATE_ERROR_CALLBACK failed: %s",
          strerror(setErrno));
  }
  // The first error number that the callback sees; lives for this call only.
  int32_t firstEntryErrno = 0;
  if (sl::removefile_state_set(state.get(), sl::REMOVEFILE_STATE_ERROR_CONTEXT, &firstEntryErrno) != 0) {
    int setErrno = errno;
    SLLog(sl::kLogLevelError, kFunctionName, "removefile_state_set REMOVEFILE_STATE_ERROR_CONTEXT failed: %s",
          strerror(setErrno));
  }

  if (sl::removefile(url.fileSystemRepresentation(), state.get(), sl::REMOVEFILE_RECURSIVE) != 0) {
    int removeErrno = errno;
    // Nothing standing at the path is what the caller wanted.
    if (removeErrno != ENOENT) {
      return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, removeErrno,
                                          "removefile of %@ failed: %s", url, strerror(removeErrno)));
    }
  }
  if (firstEntryErrno != 0 && firstEntryErrno != ENOENT) {
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, firstEntryErrno,
                                        "removefile of %@ failed: %s", url, strerror(firstEntryErrno)));
  }
  return true;
}

int SLFileManager::_IterateDirectory(const char* path, const DirectoryEntryCallback& body) {
  sl::UniqueFd fd(::open(path, O_RDONLY | O_NOFOLLOW | O_DIRECTORY | O_CLOEXEC));
  if (!fd) return errno;
  sl::UniqueDir dir = sl::fdopendir(fd);  // takes the descriptor on success only
  if (!dir) return errno;

  for (;;) {
    // readdir answers null both at the end and on failure; only errno tells
    // them apart.
    errno = 0;
    const struct dirent* d = ::readdir(dir.get());
    if (d == nullptr) return errno;

    // Every value made for this entry lives in this iteration only.
    DirectoryEntry entry{d->d_name, static_cast<uint16_t>(strlen(d->d_name)), d->d_type};
    if (entry.type == DT_UNKNOWN) {
      // Relative to the stream's own descriptor, so a directory renamed
      // meanwhile cannot point the lstat elsewhere.
      struct stat st;
      if (::fstatat(::dirfd(dir.get()), d->d_name, &st, AT_SYMLINK_NOFOLLOW) == 0) {
        entry.type = directoryEntryTypeOfMode(st.st_mode);
      }
    }
    if (!body(entry)) return 0;
  }
}

std::optional<std::vector<sl::URL>> SLFileManager::urlsForItemsInDirectoryAtURL(const sl::URL& url,
                                                                                bool ignoringSymlinks,
                                                                                sl::Error* error) {
  static constexpr char kFunctionName[] = "-[SLFileManager urlsForItemsInDirectoryAtURL:ignoringSymlinks:error:]";
  const char* directoryPath = url.fileSystemRepresentation();
  std::vector<sl::URL> urls;

  int result = _IterateDirectory(directoryPath, [&](const DirectoryEntry& entry) {
    std::string_view name(entry.name, entry.nameLength);
    if (name == "." || name == "..") return true;
    if (entry.type == DT_LNK && ignoringSymlinks) {
      SLLog(sl::kLogLevelNotice, kFunctionName, "Ignoring symlink at %s/%s", directoryPath, name);
      return true;
    }
    urls.push_back(url.URLByAppendingPathComponent(name, entry.type == DT_DIR));
    return true;
  });

  if (result != 0) {
    // What was collected before the failure is dropped with `urls`.
    sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, result,
                                 "_IterateDirectory for %s returned %s", directoryPath, strerror(result)));
    return std::nullopt;
  }
  return urls;
}

bool SLFileManager::itemExistsAtURL(const sl::URL& url) {
  static constexpr char kFunctionName[] = "-[SLFileManager itemExistsAtURL:]";
  struct stat st;
  if (::lstat(url.fileSystemRepresentation(), &st) == 0) return true;
  int statErrno = errno;
  if (statErrno != ENOENT) {
    SLLog(sl::kLogLevelError, kFunctionName, "Failed to determine if %@ exists: %s", url, strerror(statErrno));
  }
  return false;
}

bool SLFileManager::itemDoesNotExistAtURL(const sl::URL& url) {
  static constexpr char kFunctionName[] = "-[SLFileManager itemDoesNotExistAtURL:]";
  struct stat st;
  if (::lstat(url.fileSystemRepresentation(), &st) == 0) return false;
  int statErrno = errno;
  if (statErrno == ENOENT) return true;
  SLLog(sl::kLogLevelError, kFunctionName, "Failed to determine if %@ exists: %s", url, strerror(statErrno));
  return false;
}
