// Shared pieces of the tests: throwaway directories, tree builders, a
// capture of both logs, and a scope that drops root's file-system powers.
#pragma once

#include <sys/stat.h>
#include <sys/types.h>

#include <ostream>
#include <string>
#include <vector>

#include "Platform/Error.h"
#include "Platform/Log.h"
#include "Platform/URL.h"

namespace sl::test {

// A fresh directory under `parent` (default: $TMPDIR or /tmp), removed with
// everything in it when the scope ends. When it cannot be made the
// constructor throws, which fails the test before it can touch any path. Trees that are large or short-lived
// belong under /dev/shm: pass kShm.
class TempDir {
 public:
  static constexpr const char* kShm = "/dev/shm";
  explicit TempDir(const char* parent = nullptr);
  ~TempDir();
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::string& path() const { return path_; }
  // path() + "/" + relative
  std::string operator/(const std::string& relative) const { return path_ + "/" + relative; }

 private:
  std::string path_;
};

// Tree builders: each fails the current test (ADD_FAILURE) when the call
// fails, and makes missing parent directories.
void makeDirs(const std::string& path, mode_t mode = 0755);
void writeFile(const std::string& path, const std::string& content = "", mode_t mode = 0644);
void makeSymlink(const std::string& target, const std::string& linkPath);
std::string readFile(const std::string& path);

// True when something (a dangling link included) stands at path.
bool exists(const std::string& path);

// Removes a tree whatever its modes, for cleanup.
void forceRemove(const std::string& path);

// Collects the lines of the installer log and of the host log while it
// lives; the previous sinks come back when it ends.
class LogCapture {
 public:
  LogCapture();
  ~LogCapture();
  LogCapture(const LogCapture&) = delete;
  LogCapture& operator=(const LogCapture&) = delete;

  struct Line {
    int level;
    std::string category;
    std::string function;
    std::string message;
    bool operator==(const Line&) const = default;
    friend void PrintTo(const Line& l, std::ostream* os) {
      *os << "{" << l.level << ", " << l.category << ", " << l.function << ", \"" << l.message << "\"}";
    }
  };
  // Installer-log lines, then host-log lines, each in the order written.
  const std::vector<Line>& installer() const { return installer_; }
  const std::vector<Line>& host() const { return host_; }
  // Just the messages of the installer log.
  std::vector<std::string> installerMessages() const;
  void clear();

 private:
  std::vector<Line> installer_;
  std::vector<Line> host_;
};

// A file URL of a path.
inline URL fileURL(const std::string& path, bool isDirectory = false) {
  return URL::fileURLWithPath(path, isDirectory);
}

// One installer-log line as LogCapture records it.
inline LogCapture::Line installerLine(int level, const char* function, const std::string& message) {
  return {level, "installer", function, message};
}

// Checks a record made by the error constructors: domain, code, message,
// "FunctionName" and that "SourceFileLine" is present. `function` may be
// null to skip the function check (records made by platform code carry
// none).
void expectRecord(const Error& record, std::string_view domain, int64_t code, const std::string& message,
                  const char* function);
inline void expectPOSIXRecord(const Error& record, int code, const std::string& message, const char* function) {
  expectRecord(record, kPOSIXErrorDomain, code, message, function);
}

// While it lives, the calling thread's file-system identity is the
// unprivileged user nobody (65534), so permission checks apply to it even
// when the tests run as root. Only the calling thread is affected.
class ScopedUnprivileged {
 public:
  ScopedUnprivileged();
  ~ScopedUnprivileged();
  ScopedUnprivileged(const ScopedUnprivileged&) = delete;
  ScopedUnprivileged& operator=(const ScopedUnprivileged&) = delete;
  static constexpr uid_t kUid = 65534;
  static constexpr gid_t kGid = 65534;

 private:
  uid_t oldUid_;
  gid_t oldGid_;
};

// A small tmpfs mounted on the existing directory `at` while it lives, and
// lazily detached when it ends. Where this process may not mount,
// mounted() is false and error() says why (the test then skips).
class ScopedTmpfs {
 public:
  explicit ScopedTmpfs(std::string at);
  ~ScopedTmpfs();
  ScopedTmpfs(const ScopedTmpfs&) = delete;
  ScopedTmpfs& operator=(const ScopedTmpfs&) = delete;
  bool mounted() const { return error_ == 0; }
  const char* error() const;

 private:
  std::string at_;
  int error_ = 0;
};

}  // namespace sl::test
