#include "Registry/Moves.h"

#include <fcntl.h>
#include <stdio.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include "FileManager/SLFileManager.h"
#include "Platform/AtomicFile.h"
#include "Platform/Copyfile.h"
#include "Platform/Mutations.h"
#include "Platform/Removefile.h"
#include "Platform/URL.h"
#include "Platform/UniqueFd.h"
#include "Registry/EmbeddedRegistry.h"
#include "Support/Errors.h"
#include "Support/Log.h"

namespace rg {

namespace {

constexpr char kFunctionName[] = "rg::moveIntoContainer";
constexpr char kUndoFunctionName[] = "rg::undoMove";
constexpr sl::copyfile_flags_t kCopyFlags = sl::COPYFILE_ALL | sl::COPYFILE_RECURSIVE | sl::COPYFILE_NOFOLLOW;

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

bool posixFailure(sl::Error* error, int code, const char* call, const std::string& from, const std::string& to,
                  const char* function = kFunctionName) {
  return sl::fail(error, _CreateError(function, __LINE__, sl::kPOSIXErrorDomain, code, "%s of %s to %s failed: %s",
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

// The last component of a path recorded by the registry (absolute, no
// trailing slash).
std::string nameOf(const std::string& path) { return path.substr(path.rfind('/') + 1); }

// The name a source is renamed to on its way out, beside it.
std::string trashNameOf(const std::string& source) { return "." + nameOf(source) + ".rgtrash"; }

// A directory held by a descriptor (O_PATH), with the path it was opened
// by, for records. at(name) reaches an entry of it through the descriptor's
// entry in /proc: the directory held, whatever its path names by now, with
// the name resolved there only (removefile and copyfile never follow a link
// at it).
struct PinnedDirectory {
  sl::UniqueFd fd;
  std::string path;

  std::string self() const { return "/proc/self/fd/" + std::to_string(fd.get()); }
  std::string at(const std::string& name) const { return self() + "/" + name; }
  std::string shown(const std::string& name) const { return path + "/" + name; }
};

// Opens the directory that holds a move's source without following a link
// at the package directory or anywhere below it: the package directory
// with O_NOFOLLOW, then each further component relative to the one before,
// with O_NOFOLLOW too (one openat per component works on every kernel, and
// a package is rarely more than one level deep). A source that is not below
// the package (a placeholder's source is the package itself) has its own
// directory opened so, without following a link at that directory's name.
// On failure the descriptor is invalid and *failedErrno says why.
PinnedDirectory openSourceDirectory(const std::string& source, const std::string& packagePath, int* failedErrno) {
  const size_t slash = source.rfind('/');
  PinnedDirectory directory{sl::UniqueFd(), slash == 0 ? "/" : source.substr(0, slash)};
  std::string anchor = directory.path;
  std::string below;  // the components between the package and the source's name
  if (!packagePath.empty() && slash > packagePath.size() && source.compare(0, packagePath.size(), packagePath) == 0 &&
      source[packagePath.size()] == '/') {
    anchor = packagePath;
    below = source.substr(packagePath.size() + 1, slash - packagePath.size() - 1);
  }
  sl::UniqueFd fd(::open(anchor.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) {
    *failedErrno = errno;
    return directory;
  }
  size_t start = 0;
  while (start < below.size()) {
    const size_t end = std::min(below.find('/', start), below.size());
    const std::string component = below.substr(start, end - start);
    start = end + 1;
    if (component.empty()) continue;
    if (component == "." || component == "..") {  // not below the package
      *failedErrno = EXDEV;
      return directory;
    }
    sl::UniqueFd next(::openat(fd.get(), component.c_str(), O_PATH | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!next) {
      *failedErrno = errno;
      return directory;
    }
    fd = std::move(next);
  }
  directory.fd = std::move(fd);
  return directory;
}

// The errnos of openSourceDirectory that mean the source's place is gone:
// removed, replaced by something that is not a directory or by a link
// (O_PATH | O_DIRECTORY | O_NOFOLLOW gives ENOTDIR for one), or outside the
// package.
bool placeIsGone(int code) { return code == ENOENT || code == ENOTDIR || code == ELOOP || code == EXDEV; }

bool openFailure(sl::Error* error, int code, const std::string& path, const char* function = kUndoFunctionName) {
  return sl::fail(error, _CreateError(function, __LINE__, sl::kPOSIXErrorDomain, code, "open of %s failed: %s",
                                      path, strerror(code)));
}

// Removes `name` in `directory` (a tree; no link followed); absent is
// success.
bool removeIn(const PinnedDirectory& directory, const std::string& name, sl::Error* error) {
  struct stat st;
  if (::fstatat(directory.fd.get(), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 && errno == ENOENT) return true;
  if (sl::removefile(directory.at(name).c_str(), nullptr, sl::REMOVEFILE_RECURSIVE) == 0) return true;
  const int removeErrno = errno;
  if (removeErrno == ENOENT) return true;
  return sl::fail(error, _CreateError(kUndoFunctionName, __LINE__, sl::kPOSIXErrorDomain, removeErrno,
                                      "removal of %s failed: %s", directory.shown(name), strerror(removeErrno)));
}

// Flushes a rename of `from` into `directory`: that directory, and the one
// `from` left when it is another.
bool syncRenamedInto(const PinnedDirectory& directory, const std::string& from, const std::string& to,
                     const char* function, sl::Error* error) {
  sl::Error syncError;
  if (sl::syncDirectory(directory.self(), &syncError) &&
      (parentOf(from) == directory.path || sl::syncParentDirectory(from, &syncError))) {
    return true;
  }
  const int code = static_cast<int>(syncError.code());
  return sl::fail(error, _CreateError(function, __LINE__, sl::kPOSIXErrorDomain, code,
                                      "rename of %s to %s is not durable: %s", from, to, strerror(code)));
}

// Copies `from` to ".NAME<suffix>" in `directory`, flushes the copy, then
// renames it to NAME there; records name `function`. A copy that fails on
// the way is removed again (as far as the failure allows: what stays is
// removed by the next attempt, before it copies), so that a failed call
// leaves `directory` as it found it.
bool copyThenRename(const std::string& from, const PinnedDirectory& directory, const std::string& name,
                    const char* suffix, const char* function, sl::Error* error) {
  const std::string temporaryName = "." + name + suffix;
  const std::string temporary = directory.shown(temporaryName);
  if (!removeIn(directory, temporaryName, error)) return false;
  auto failed = [&](int code, const char* call, const std::string& source, const std::string& target) {
    sl::Error ignored;  // the failure reported is the one that matters
    removeIn(directory, temporaryName, &ignored);
    return posixFailure(error, code, call, source, target, function);
  };
  if (sl::copyfile(from.c_str(), directory.at(temporaryName).c_str(), nullptr, kCopyFlags) != 0) {
    const int copyErrno = errno;
    return failed(copyErrno, "copyfile", from, temporary);
  }
  sl::Error syncError;
  if (!sl::syncTree(directory.at(temporaryName), &syncError)) {
    return failed(static_cast<int>(syncError.code()), "fsync of the copy", from, temporary);
  }
  if (sl::mut::renameat(directory.fd.get(), temporaryName.c_str(), directory.fd.get(), name.c_str()) != 0) {
    const int renameErrno = errno;
    return failed(renameErrno, "rename", temporary, directory.shown(name));
  }
  return syncRenamedInto(directory, temporary, directory.shown(name), function, error);
}

}  // namespace

std::string trashPathFor(const std::string& source) { return parentOf(source) + "/" + trashNameOf(source); }

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
  const std::string containerPath = parentOf(move.destination);
  sl::UniqueFd containerFd(::open(containerPath.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  if (!containerFd) {
    const int openErrno = errno;
    return openFailure(error, openErrno, containerPath, kFunctionName);
  }
  const PinnedDirectory container{std::move(containerFd), containerPath};
  if (!copyThenRename(move.source, container, nameOf(move.destination), ".partial", kFunctionName, error)) return false;
  // The source leaves whole or not at all: renamed away first, then removed.
  const std::string trash = trashPathFor(move.source);
  if (!removeTree(trash, error)) return false;
  if (!renameItem(move.source, trash, &renameErrno)) return posixFailure(error, renameErrno, "rename", move.source, trash);
  if (!syncRenamed(move.source, trash, error)) return false;
  return removeTree(trash, error);
}

bool undoMove(const Move& move, const std::string& packagePath, sl::Error* error) {
  int openErrno = 0;
  const PinnedDirectory directory = openSourceDirectory(move.source, packagePath, &openErrno);
  if (!directory.fd) {
    if (!placeIsGone(openErrno)) return openFailure(error, openErrno, directory.path);
    // The package is its owner's to remove once the install call has
    // returned, whatever the outcome: after an undo that failed there, the
    // owner may have removed it before the next open finishes the undo, or
    // put a link in the way, which leads out of the package. With nowhere
    // safe to bring the item back to, it goes instead, as the package would
    // have. No trash is left to remove: the directory that would hold it is
    // gone, or is not the package's.
    if (present(move.destination)) {
      SLLog(sl::kLogLevelNotice, kUndoFunctionName,
            "Undo of the move of %s: its directory is gone or reached through a link; removing %s", move.source,
            move.destination);
    }
    return removeTree(move.destination, error);
  }
  const std::string name = nameOf(move.source);
  struct stat st;
  const bool sourcePresent = ::fstatat(directory.fd.get(), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0;
  if (!sourcePresent && present(move.destination)) {
    if (sl::mut::renameat(AT_FDCWD, move.destination.c_str(), directory.fd.get(), name.c_str()) == 0) {
      if (!syncRenamedInto(directory, move.destination, move.source, kUndoFunctionName, error)) return false;
    } else {
      const int renameErrno = errno;
      if (renameErrno != EXDEV) {
        return posixFailure(error, renameErrno, "rename", move.destination, move.source, kUndoFunctionName);
      }
      if (!copyThenRename(move.destination, directory, name, ".rgrestore", kUndoFunctionName, error)) return false;
    }
  }
  return removeIn(directory, trashNameOf(move.source), error);
}

bool removeTrash(const Move& move, const std::string& packagePath, sl::Error* error) {
  int openErrno = 0;
  const PinnedDirectory directory = openSourceDirectory(move.source, packagePath, &openErrno);
  if (directory.fd) return removeIn(directory, trashNameOf(move.source), error);
  return placeIsGone(openErrno) || openFailure(error, openErrno, directory.path);
}

}  // namespace rg
