#include "Registry/Moves.h"

#include <stdio.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include "FileManager/SLFileManager.h"
#include "Platform/AtomicFile.h"
#include "Platform/Copyfile.h"
#include "Platform/Mutations.h"
#include "Platform/URL.h"
#include "Registry/EmbeddedRegistry.h"
#include "Support/Errors.h"

namespace rg {

namespace {

constexpr char kFunctionName[] = "rg::moveIntoContainer";
constexpr sl::copyfile_flags_t kCopyFlags = sl::COPYFILE_ALL | sl::COPYFILE_RECURSIVE | sl::COPYFILE_NOFOLLOW;

std::string besideWithPrefix(const std::string& path, const std::string& directory, const char* suffix) {
  const sl::URL url = sl::URL::fileURLWithPath(path, false);
  return directory + "/." + url.lastPathComponent() + suffix;
}

std::string parentOf(const std::string& path) {
  return sl::URL::fileURLWithPath(path, false).URLByDeletingLastPathComponent().path();
}

bool present(const std::string& path) {
  struct stat st;
  return ::lstat(path.c_str(), &st) == 0;
}

bool renameItem(const std::string& from, const std::string& to, int* failedErrno) {
  if (sl::mut::rename(from.c_str(), to.c_str()) == 0) return true;
  *failedErrno = errno;
  return false;
}

bool posixFailure(sl::Error* error, int code, const char* call, const std::string& from, const std::string& to) {
  return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, code, "%s of %s to %s failed: %s",
                                      call, from, to, strerror(code)));
}

// Flushes the directories of both ends of a rename, so that it is on disk
// before anything that depends on it (the commit that records it, the
// removal of what it replaced).
bool syncRenamed(const std::string& from, const std::string& to, sl::Error* error) {
  sl::Error syncError;
  if (sl::syncParentDirectory(to, &syncError) && sl::syncParentDirectory(from, &syncError)) return true;
  return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, syncError.code(),
                                      "rename of %s to %s is not durable: %@", from, to,
                                      syncError.localizedDescription()));
}

// Copies `from` to a temporary name in `directory`, flushes the copy, then
// renames it to `to`.
bool copyThenRename(const std::string& from, const std::string& to, const char* suffix, sl::Error* error) {
  const std::string temporary = besideWithPrefix(to, parentOf(to), suffix);
  if (!removeTree(temporary, error)) return false;
  if (sl::copyfile(from.c_str(), temporary.c_str(), nullptr, kCopyFlags) != 0) {
    const int copyErrno = errno;
    return posixFailure(error, copyErrno, "copyfile", from, temporary);
  }
  sl::Error syncError;
  if (!sl::syncTree(temporary, &syncError)) {
    return posixFailure(error, static_cast<int>(syncError.code()), "fsync of the copy", from, temporary);
  }
  int renameErrno = 0;
  if (!renameItem(temporary, to, &renameErrno)) return posixFailure(error, renameErrno, "rename", temporary, to);
  return syncRenamed(temporary, to, error);
}

}  // namespace

std::string trashPathFor(const std::string& source) { return besideWithPrefix(source, parentOf(source), ".rgtrash"); }

bool removeTree(const std::string& path, sl::Error* error) {
  // A path below something that is not a directory is not there either.
  struct stat st;
  if (::lstat(path.c_str(), &st) != 0 && (errno == ENOENT || errno == ENOTDIR)) return true;
  return SLFileManager::defaultManager().removeItemAtURL(sl::URL::fileURLWithPath(path, false), error);
}

bool moveIntoContainer(const Move& move, sl::Error* error) {
  int renameErrno = 0;
  if (renameItem(move.source, move.destination, &renameErrno)) return syncRenamed(move.source, move.destination, error);
  if (renameErrno != EXDEV) return posixFailure(error, renameErrno, "rename", move.source, move.destination);
  if (!copyThenRename(move.source, move.destination, ".partial", error)) return false;
  // The source leaves whole or not at all: renamed away first, then removed.
  const std::string trash = trashPathFor(move.source);
  if (!removeTree(trash, error)) return false;
  if (!renameItem(move.source, trash, &renameErrno)) return posixFailure(error, renameErrno, "rename", move.source, trash);
  if (!syncRenamed(move.source, trash, error)) return false;
  return removeTree(trash, error);
}

bool undoMove(const Move& move, sl::Error* error) {
  // The package is its owner's to remove once the install call has returned,
  // whatever the outcome: after an undo that failed there, the owner may
  // have removed it before the next open finishes the undo. With nowhere
  // left to bring the item back to, it goes instead, as the package would
  // have.
  if (!present(parentOf(move.source))) {
    return removeTree(move.destination, error) && removeTree(trashPathFor(move.source), error);
  }
  if (!present(move.source) && present(move.destination)) {
    int renameErrno = 0;
    if (!renameItem(move.destination, move.source, &renameErrno)) {
      if (renameErrno != EXDEV) return posixFailure(error, renameErrno, "rename", move.destination, move.source);
      if (!copyThenRename(move.destination, move.source, ".rgrestore", error)) return false;
    } else if (!syncRenamed(move.destination, move.source, error)) {
      return false;
    }
  }
  return removeTree(trashPathFor(move.source), error);
}

}  // namespace rg
