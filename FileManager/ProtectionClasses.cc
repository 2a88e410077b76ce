// SLFileManager: reading and setting an item's data-protection class.
//
// Both operations work on a descriptor of the item itself, never through a
// link, and report failures only through the error slot (nothing is logged).

#include <fcntl.h>

#include <cerrno>
#include <cstring>

#include "FileManager/SLFileManager.h"
#include "Platform/DataProtection.h"
#include "Platform/UniqueFd.h"
#include "Support/Errors.h"

namespace {

// Files and directories open alike. O_NOFOLLOW refuses a link (ELOOP). The
// descriptor only ever carries the class calls, never a read, so two flags
// keep the open itself free of side effects: O_NONBLOCK, without which
// opening a fifo would wait for a writer, and O_NOCTTY, so that a terminal
// device never becomes the controlling terminal.
sl::UniqueFd openItem(const char* path) {
  return sl::UniqueFd(::open(path, O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
}

}  // namespace

bool SLFileManager::dataProtectionClassOfItemAtURL(const sl::URL& url, int32_t* protectionClass, sl::Error* error) {
  static constexpr char kFunctionName[] = "-[SLFileManager dataProtectionClassOfItemAtURL:class:error:]";
  const char* path = url.fileSystemRepresentation();
  sl::UniqueFd fd = openItem(path);
  if (!fd) {
    const int openErrno = errno;
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, openErrno,
                                        "Failed to open %s : %s", path, strerror(openErrno)));
  }
  const int current = sl::protectionClassFcntl(fd.get(), sl::F_GETPROTECTIONCLASS);
  if (current < 0) {
    const int getErrno = errno;
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, getErrno,
                                        "Failed to getclass of file %s: %s", path, strerror(getErrno)));
  }
  if (protectionClass != nullptr) *protectionClass = current;
  return true;
}

bool SLFileManager::setDataProtectionClassOfItemAtURL(const sl::URL& url, int32_t toClass,
                                                      const ProtectionClassPredicate& ifPredicate, sl::Error* error) {
  static constexpr char kFunctionName[] =
      "-[SLFileManager setDataProtectionClassOfItemAtURL:toClass:ifPredicate:error:]";
  const char* path = url.fileSystemRepresentation();
  sl::UniqueFd fd = openItem(path);
  if (!fd) {
    const int openErrno = errno;
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, openErrno,
                                        "Failed to open %s : %s", path, strerror(openErrno)));
  }
  if (ifPredicate) {
    // The class is read on the same descriptor that is set below, and the
    // predicate sees it exactly once.
    const int current = sl::protectionClassFcntl(fd.get(), sl::F_GETPROTECTIONCLASS);
    if (current < 0) {
      const int getErrno = errno;
      return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, getErrno,
                                          "Failed to getclass of file %s: %s", path, strerror(getErrno)));
    }
    if (!ifPredicate(current)) return true;  // declined: nothing to change
  }
  if (sl::protectionClassFcntl(fd.get(), sl::F_SETPROTECTIONCLASS, toClass) != 0) {
    const int setErrno = errno;
    return sl::fail(error, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, setErrno,
                                        "Failed to setclass(%d) on file %s: %s", toClass, path, strerror(setErrno)));
  }
  return true;
}
