// The per-process temporary directory on Linux.

#include "Platform/TemporaryDirectory.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>

#include "Platform/Format.h"
#include "Platform/Mutations.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"

namespace sl {

namespace {

constexpr mode_t kSharedTemporaryMode = 01777;

bool isDirectory(const char* path) {
  struct stat st;
  return ::stat(path, &st) == 0 && S_ISDIR(st.st_mode);
}

}  // namespace

URL perProcessTemporaryDirectory() {
  const char* fromEnvironment = ::getenv("TMPDIR");
  if (fromEnvironment != nullptr && fromEnvironment[0] == '/' && isDirectory(fromEnvironment))
    return URL::fileURLWithPath(fromEnvironment, true);

  const std::string path = pathBelowSystemRoot("/tmp");
  UniqueFd root(::open(systemRoot().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (root && mut::mkdirat(root.get(), "tmp", kSharedTemporaryMode) == 0) {
    // mkdir applied the umask: the full mode is set on the new directory
    // itself, through a descriptor, never through a link put in its place.
    UniqueFd made(::openat(root.get(), "tmp", O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (made) (void)mut::fchmod(made.get(), kSharedTemporaryMode);
  }
  // EEXIST: whatever stands there already is used as it is.
  return URL::fileURLWithPath(path, true);
}

URL privateTemporarySubdirectory(std::string_view name, Error* error) {
  const URL parent = perProcessTemporaryDirectory();
  const URL url = parent.URLByAppendingPathComponent(name, true);
  const std::string path = url.path();
  const auto failed = [&](int code, const char* step) {
    if (error) *error = Error::posix(code, format("%s of %s failed: %s", step, path, std::strerror(code)));
    return URL();
  };

  UniqueFd parentFd(::open(parent.fileSystemRepresentation(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!parentFd) return failed(errno, "open");
  const std::string component(name);
  if (mut::mkdirat(parentFd.get(), component.c_str(), 0700) != 0 && errno != EEXIST) return failed(errno, "mkdir");
  const auto notPrivate = [&] {
    if (error) *error = Error::posix(EEXIST, format("%s is not a private directory of this user", path));
    return URL();
  };
  // Opened without following a link; what is checked is what is then used.
  UniqueFd fd(::openat(parentFd.get(), component.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) {
    const int openErrno = errno;
    return openErrno == ELOOP || openErrno == ENOTDIR ? notPrivate() : failed(openErrno, "open");
  }
  struct stat st;
  if (::fstat(fd.get(), &st) != 0) return failed(errno, "fstat");
  if (st.st_uid != ::geteuid()) return notPrivate();
  if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0 && mut::fchmod(fd.get(), st.st_mode & 0755) != 0)
    return failed(errno, "fchmod");
  return url;
}

}  // namespace sl
