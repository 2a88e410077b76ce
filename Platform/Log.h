// What both logs hand to their sink: one record per message.
//
// The installer log and the host log are separate services (InstallerLog.h,
// HostLog.h) but deliver the same record, so that a host writes both into
// one file in one layout. Until a sink is set, each writes one line per
// message to standard error.
#pragma once

#include <functional>
#include <string_view>

namespace sl {

// The levels that occur; both logs use the same numbers.
enum LogLevel : int {
  kLogLevelError = 3,
  kLogLevelNotice = 5,
  kLogLevelDebug = 7,
};

// "error", "notice", "debug", or "level N" for any other number.
std::string_view logLevelName(int level);

struct LogRecord {
  int level;
  std::string_view category;  // "Movanta" for the host log, "installer" for the installer log
  std::string_view function;  // the documented name of the calling function
  std::string_view file;      // source file; empty for the installer log
  int line;                   // source line; 0 for the installer log
  std::string_view message;
};

// A sink must not log itself. It is called from whichever thread logs, one
// record at a time (the services serialise their calls).
using LogSink = std::function<void(const LogRecord&)>;

}  // namespace sl
