// The per-process temporary directory on Linux.

#include "Platform/TemporaryDirectory.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cstdlib>
#include <string>

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

}  // namespace sl
