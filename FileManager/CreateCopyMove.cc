// SLFileManager: directory creation (optionally with a protection class),
// copy and move of whole items, and uniquely named temporary directories.

#include <dirent.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "FileManager/SLFileManager.h"
#include "Platform/AtomicFile.h"
#include "Platform/Copyfile.h"
#include "Platform/DataProtection.h"
#include "Platform/Mkpath.h"
#include "Platform/Mutations.h"
#include "Platform/UniqueFd.h"
#include "Support/Errors.h"
#include "Support/Log.h"

namespace {

// Every copy takes the whole item with all of its metadata, and never goes
// through a symbolic link, at the top or anywhere inside the tree.
constexpr sl::copyfile_flags_t kCopyFlags =
    sl::COPYFILE_ALL | sl::COPYFILE_RECURSIVE | sl::COPYFILE_NOFOLLOW_SRC | sl::COPYFILE_NOFOLLOW_DST;
static_assert(kCopyFlags == 0xC800F);

constexpr int32_t kNoProtectionClass = -1;

}  // namespace

bool SLFileManager::createDirectoryAtURL(const sl::URL& url, bool withIntermediateDirectories, mode_t mode,
                                         sl::Error* error) {
  // The work, and so every record, is the class form's.
  return createDirectoryAtURL(url, withIntermediateDirectories, mode, kNoProtectionClass, error);
}

bool SLFileManager::createDirectoryAtURL(const sl::URL& url, bool withIntermediateDirectories, mode_t mode,
                                         int32_t protectionClass, sl::Error* error) {
  static constexpr char kFunctionName[] =
      "-[SLFileManager createDirectoryAtURL:withIntermediateDirectories:mode:class:error:]";
  const char* path = url.fileSystemRepresentation();
  // Messages of this operation print the plain path, not the URL string.
  const sl::String pathString(path);

  if (withIntermediateDirectories) {
    // mkpath_np returns its error number rather than setting errno.
    int result = sl::mkpath_np(path, mode);
    if (result != 0 && result != EEXIST) {
      return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, result,
                                          "mkpath_np of %@ failed: %s", pathString, strerror(result)));
    }
  } else if (sl::mut::mkdir(path, mode) != 0) {
    int mkdirErrno = errno;
    // Whatever already stands at the path, directory or not, is accepted
    // here; a non-directory is only caught below, when a class is to be set.
    if (mkdirErrno != EEXIST) {
      return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, mkdirErrno,
                                          "mkdir of %@ failed: %s", pathString, strerror(mkdirErrno)));
    }
  }

  if (protectionClass == kNoProtectionClass) return true;

  // The class goes on the directory whether it was made now or stood there
  // already. The stream is closed on every path by its owner.
  sl::UniqueDir dir(::opendir(path));
  if (!dir) {
    int openErrno = errno;
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, openErrno,
                                        "opendir of %@ failed: %s", pathString, strerror(openErrno)));
  }
  if (sl::protectionClassFcntl(::dirfd(dir.get()), sl::F_SETPROTECTIONCLASS, protectionClass) != 0) {
    int classErrno = errno;
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, classErrno,
                                        "Failed to setclass(%d) on directory %@: %s", protectionClass, pathString,
                                        strerror(classErrno)));
  }
  return true;
}

bool SLFileManager::copyItemIfExistsAtURL(const sl::URL& source, const sl::URL& destination, sl::Error* error) {
  return _copyItemAtURL(source, destination, false, error);
}

bool SLFileManager::moveItemIfExistsAtURL(const sl::URL& source, const sl::URL& destination, sl::Error* error) {
  return _moveItemAtURL(source, destination, false, error);
}

bool SLFileManager::copyItemAtURL(const sl::URL& source, const sl::URL& destination, sl::Error* error) {
  return _copyItemAtURL(source, destination, true, error);
}

bool SLFileManager::moveItemAtURL(const sl::URL& source, const sl::URL& destination, sl::Error* error) {
  return _moveItemAtURL(source, destination, true, error);
}

bool SLFileManager::_copyItemAtURL(const sl::URL& source, const sl::URL& destination, bool failIfSrcMissing,
                                   sl::Error* error) {
  static constexpr char kFunctionName[] = "-[SLFileManager _copyItemAtURL:toURL:failIfSrcMissing:error:]";
  if (!failIfSrcMissing) {
    struct stat st;
    if (::lstat(source.fileSystemRepresentation(), &st) != 0) {
      int statErrno = errno;
      if (statErrno == ENOENT) return true;  // nothing to copy
      return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, statErrno,
                                          "stat of %@ failed: %s", source, strerror(statErrno)));
    }
  }
  // Without the lstat above, a missing source is copyfile's ENOENT. A
  // partly made destination is left as it is.
  if (sl::copyfile(source.fileSystemRepresentation(), destination.fileSystemRepresentation(), nullptr, kCopyFlags) !=
      0) {
    int copyErrno = errno;
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, copyErrno,
                                        "copyfile of %@ to %@ failed: %s", source, destination,
                                        strerror(copyErrno)));
  }
  return true;
}

bool SLFileManager::_moveItemAtURL(const sl::URL& source, const sl::URL& destination, bool failIfSrcMissing,
                                   sl::Error* error) {
  static constexpr char kFunctionName[] = "-[SLFileManager _moveItemAtURL:toURL:failIfSrcMissing:error:]";
  if (!failIfSrcMissing) {
    struct stat st;
    if (::lstat(source.fileSystemRepresentation(), &st) != 0) {
      int statErrno = errno;
      if (statErrno == ENOENT) return true;  // nothing to move
      return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, statErrno,
                                          "stat of %@ failed: %s", source, strerror(statErrno)));
    }
  }

  // On one volume a move is this one rename, whatever the size of the tree.
  // It is durable once both directories are flushed: what the caller does
  // next (delete the old container, record the move) may depend on it.
  if (sl::mut::rename(source.fileSystemRepresentation(), destination.fileSystemRepresentation()) == 0) {
    sl::Error syncError;
    if (!sl::syncParentDirectory(destination.path(), &syncError) ||
        !sl::syncParentDirectory(source.path(), &syncError)) {
      return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, syncError.code(),
                                          "rename of %@ to %@ is not durable: %@", source, destination,
                                          syncError.localizedDescription()));
    }
    return true;
  }
  int renameErrno = errno;
  // Only a different volume falls back to copying; every other refusal is
  // the move's failure.
  if (renameErrno != EXDEV) {
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, renameErrno,
                                        "rename of %@ to %@ failed: %s", source, destination,
                                        strerror(renameErrno)));
  }

  // The source was there a moment ago: a source gone now is a failure.
  // The copy's own record is the move's.
  if (!_copyItemAtURL(source, destination, true, error)) return false;
  // The copy must be whole on disk before its source goes.
  sl::Error syncError;
  if (!sl::syncTree(destination.path(), &syncError) || !sl::syncParentDirectory(destination.path(), &syncError)) {
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, syncError.code(),
                                        "copy of %@ to %@ is not durable: %@", source, destination,
                                        syncError.localizedDescription()));
  }

  // The item is at the destination, so the move has succeeded; a source
  // that cannot be removed stays behind and is only logged.
  sl::Error removalError;
  if (!removeItemAtURL(source, &removalError)) {
    SLLog(sl::kLogLevelError, kFunctionName, "Failed to remove move source after copy at %@ : %@",
          sl::String(source.path()), removalError);
  }
  return true;
}

sl::URL SLFileManager::createTemporaryDirectoryInDirectoryURL(const sl::URL& parent, sl::Error* error) {
  static constexpr char kFunctionName[] = "-[SLFileManager createTemporaryDirectoryInDirectoryURL:error:]";
  // Unlike the other operations, this one resets the slot on entry.
  if (error != nullptr) *error = nullptr;

  const sl::URL templateURL = parent.URLByAppendingPathComponent("temp.XXXXXX", true);
  // mkdtemp fills the six X's in place, so it gets a private, writable copy
  // of the path (which carries no trailing separator).
  std::string path = templateURL.path();
  if (sl::mut::mkdtemp(path.data()) == nullptr) {
    int tempErrno = errno;
    const sl::Dictionary userInfo{{SLPathArgumentErrorKey, templateURL}};
    // Made (and so logged) whether or not the caller wants the record.
    sl::Error record = _CreateAndLogError(kFunctionName, __LINE__, SLInstallerErrorDomain,
                                          kSLInstallerFileSystemError, sl::Error::posix(tempErrno), userInfo,
                                          "Failed to create temp dir at path %s", path);
    sl::fail(error, std::move(record));
    return nullptr;
  }
  return sl::URL::fileURLWithPath(path, true);
}
