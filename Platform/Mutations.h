// The one layer through which every call that changes a file system passes.
//
// Code above this floor never calls rename(2), unlinkat(2), write(2) and
// their kin directly: it calls the wrappers below, which ask admit() first.
// In a build with STOWLINE_FAULT_INJECTION, admit() counts the operation and
// can, at the Nth one, kill the process or make the call fail with a chosen
// errno, once or from then on; elsewhere it is an inline `return 0`.
//
// The plan comes from the environment, read once:
//
//   STOWLINE_FAULT=<action>@<n>[+][:<kind>[,<kind>...]]
//     action  "kill" (SIGKILL) or an errno name ("EIO", "ENOSPC", ...)
//     n       the ordinal, from 1, of the operation to act on; with "+" it
//             and every later one
//     kinds   count only operations of these kinds ("rename", "write", ...)
//   STOWLINE_FAULT_TRACE=<file>
//     appends "<ordinal> <kind> <what>" for every operation admitted
//
// A release build compiles the checks out and ignores both variables.
//
// The registry's database passes through here too: it is opened with a VFS
// that admits its writes, truncations, syncs, deletions and creations
// (Registry/CountedVfs.h). The MutationsLint test keeps direct calls out of
// the library floors; a genuine exception says "// not counted: <reason>"
// on its line.
#pragma once

#include <fcntl.h>
#include <stdio.h>
#include <sys/sendfile.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <string_view>

namespace sl::mut {

enum class Kind : uint8_t {
  kCreate,         // a new file, or an existing one truncated on open
  kWrite,          // bytes into a file
  kTruncate,       // a file's length
  kSync,           // fsync, fdatasync, syncfs
  kRename,         // rename, renameat, renameat2
  kRemove,         // unlink, rmdir
  kMakeDirectory,  // mkdir, mkdtemp
  kLink,           // symlink, link
  kAttribute,      // extended attributes, set or removed
  kOwner,          // chown
  kMode,           // chmod
  kTimes,          // utimensat, futimens
};

// The kind's name in plans and traces ("create", "write", ...).
std::string_view kindName(Kind kind);

#ifdef STOWLINE_FAULT_INJECTION
// Admits one mutating operation. Returns 0 when the call may go ahead, or the
// errno it must fail with instead; does not return when the plan kills.
// `what` names the object (a path or a name), for the trace only.
int admit(Kind kind, const char* what) noexcept;

// Replaces the plan with `spec` (the grammar of STOWLINE_FAULT; empty for
// none) and restarts the count. Returns false, changing nothing, when the
// spec does not parse. For tests that drive the seam in-process.
bool setPlanForTesting(std::string_view spec);

// Operations admitted since the start (or the last setPlanForTesting), and
// those of them of the plan's kinds (all kinds when it names none).
uint64_t admittedCount();
uint64_t matchedCount();
#else
inline int admit(Kind, const char*) noexcept { return 0; }
inline bool setPlanForTesting(std::string_view) { return false; }
inline uint64_t admittedCount() { return 0; }
inline uint64_t matchedCount() { return 0; }
#endif

// True when this build honours fault plans.
constexpr bool kFaultInjectionBuilt =
#ifdef STOWLINE_FAULT_INJECTION
    true;
#else
    false;
#endif

#define SL_MUT_ADMIT(kind, what, failValue)                  \
  do {                                                        \
    if (const int code_ = ::sl::mut::admit((kind), (what))) { \
      errno = code_;                                          \
      return (failValue);                                     \
    }                                                         \
  } while (0)

// ---- Names --------------------------------------------------------------

inline int rename(const char* from, const char* to) {
  SL_MUT_ADMIT(Kind::kRename, to, -1);
  return ::rename(from, to);
}
inline int renameat(int fromDir, const char* from, int toDir, const char* to) {
  SL_MUT_ADMIT(Kind::kRename, to, -1);
  return ::renameat(fromDir, from, toDir, to);
}
inline int renameat2(int fromDir, const char* from, int toDir, const char* to, unsigned flags) {
  SL_MUT_ADMIT(Kind::kRename, to, -1);
  return ::renameat2(fromDir, from, toDir, to, flags);
}
inline int unlinkat(int dir, const char* name, int flags) {
  SL_MUT_ADMIT(Kind::kRemove, name, -1);
  return ::unlinkat(dir, name, flags);
}
inline int unlink(const char* path) {
  SL_MUT_ADMIT(Kind::kRemove, path, -1);
  return ::unlink(path);
}
inline int rmdir(const char* path) {
  SL_MUT_ADMIT(Kind::kRemove, path, -1);
  return ::rmdir(path);
}
inline int mkdir(const char* path, mode_t mode) {
  SL_MUT_ADMIT(Kind::kMakeDirectory, path, -1);
  return ::mkdir(path, mode);
}
inline int mkdirat(int dir, const char* name, mode_t mode) {
  SL_MUT_ADMIT(Kind::kMakeDirectory, name, -1);
  return ::mkdirat(dir, name, mode);
}
inline char* mkdtemp(char* pattern) {
  SL_MUT_ADMIT(Kind::kMakeDirectory, pattern, nullptr);
  return ::mkdtemp(pattern);
}
inline int symlink(const char* target, const char* path) {
  SL_MUT_ADMIT(Kind::kLink, path, -1);
  return ::symlink(target, path);
}
inline int symlinkat(const char* target, int dir, const char* name) {
  SL_MUT_ADMIT(Kind::kLink, name, -1);
  return ::symlinkat(target, dir, name);
}
inline int linkat(int fromDir, const char* from, int toDir, const char* to, int flags) {
  SL_MUT_ADMIT(Kind::kLink, to, -1);
  return ::linkat(fromDir, from, toDir, to, flags);
}

// ---- Contents -----------------------------------------------------------

// Only an open that can create or truncate counts; a plain open does not
// change anything.
inline int openat(int dir, const char* name, int flags, mode_t mode = 0) {
  if (flags & (O_CREAT | O_TRUNC)) SL_MUT_ADMIT(Kind::kCreate, name, -1);
  return ::openat(dir, name, flags, mode);
}
inline int open(const char* path, int flags, mode_t mode = 0) {
  if (flags & (O_CREAT | O_TRUNC)) SL_MUT_ADMIT(Kind::kCreate, path, -1);
  return ::open(path, flags, mode);
}
inline int mkfifoat(int dir, const char* name, mode_t mode) {
  SL_MUT_ADMIT(Kind::kCreate, name, -1);
  return ::mkfifoat(dir, name, mode);
}
inline int mknodat(int dir, const char* name, mode_t mode, dev_t device) {
  SL_MUT_ADMIT(Kind::kCreate, name, -1);
  return ::mknodat(dir, name, mode, device);
}
inline ssize_t write(int fd, const void* bytes, size_t size) {
  SL_MUT_ADMIT(Kind::kWrite, nullptr, -1);
  return ::write(fd, bytes, size);
}
inline ssize_t pwrite(int fd, const void* bytes, size_t size, off_t offset) {
  SL_MUT_ADMIT(Kind::kWrite, nullptr, -1);
  return ::pwrite(fd, bytes, size, offset);
}
inline ssize_t copy_file_range(int in, off_t* inOffset, int out, off_t* outOffset, size_t size, unsigned flags) {
  SL_MUT_ADMIT(Kind::kWrite, nullptr, -1);
  return ::copy_file_range(in, inOffset, out, outOffset, size, flags);
}
inline ssize_t sendfile(int out, int in, off_t* offset, size_t size) {
  SL_MUT_ADMIT(Kind::kWrite, nullptr, -1);
  return ::sendfile(out, in, offset, size);
}
inline int ftruncate(int fd, off_t length) {
  SL_MUT_ADMIT(Kind::kTruncate, nullptr, -1);
  return ::ftruncate(fd, length);
}
inline int fsync(int fd) {
  SL_MUT_ADMIT(Kind::kSync, nullptr, -1);
  return ::fsync(fd);
}
inline int fdatasync(int fd) {
  SL_MUT_ADMIT(Kind::kSync, nullptr, -1);
  return ::fdatasync(fd);
}
inline int syncfs(int fd) {
  SL_MUT_ADMIT(Kind::kSync, nullptr, -1);
  return ::syncfs(fd);
}

// ---- Metadata -----------------------------------------------------------

inline int fchmod(int fd, mode_t mode) {
  SL_MUT_ADMIT(Kind::kMode, nullptr, -1);
  return ::fchmod(fd, mode);
}
inline int fchmodat(int dir, const char* name, mode_t mode, int flags) {
  SL_MUT_ADMIT(Kind::kMode, name, -1);
  return ::fchmodat(dir, name, mode, flags);
}
inline int chmod(const char* path, mode_t mode) {
  SL_MUT_ADMIT(Kind::kMode, path, -1);
  return ::chmod(path, mode);
}
inline int fchown(int fd, uid_t uid, gid_t gid) {
  SL_MUT_ADMIT(Kind::kOwner, nullptr, -1);
  return ::fchown(fd, uid, gid);
}
inline int fchownat(int dir, const char* name, uid_t uid, gid_t gid, int flags) {
  SL_MUT_ADMIT(Kind::kOwner, name, -1);
  return ::fchownat(dir, name, uid, gid, flags);
}
inline int utimensat(int dir, const char* name, const struct timespec times[2], int flags) {
  SL_MUT_ADMIT(Kind::kTimes, name, -1);
  return ::utimensat(dir, name, times, flags);
}
inline int futimens(int fd, const struct timespec times[2]) {
  SL_MUT_ADMIT(Kind::kTimes, nullptr, -1);
  return ::futimens(fd, times);
}
inline int setxattr(const char* path, const char* name, const void* value, size_t size, int flags) {
  SL_MUT_ADMIT(Kind::kAttribute, path, -1);
  return ::setxattr(path, name, value, size, flags);
}
inline int lsetxattr(const char* path, const char* name, const void* value, size_t size, int flags) {
  SL_MUT_ADMIT(Kind::kAttribute, path, -1);
  return ::lsetxattr(path, name, value, size, flags);
}
inline int fsetxattr(int fd, const char* name, const void* value, size_t size, int flags) {
  SL_MUT_ADMIT(Kind::kAttribute, name, -1);
  return ::fsetxattr(fd, name, value, size, flags);
}
inline int removexattr(const char* path, const char* name) {
  SL_MUT_ADMIT(Kind::kAttribute, path, -1);
  return ::removexattr(path, name);
}
inline int lremovexattr(const char* path, const char* name) {
  SL_MUT_ADMIT(Kind::kAttribute, path, -1);
  return ::lremovexattr(path, name);
}
inline int fremovexattr(int fd, const char* name) {
  SL_MUT_ADMIT(Kind::kAttribute, name, -1);
  return ::fremovexattr(fd, name);
}

#undef SL_MUT_ADMIT

}  // namespace sl::mut
