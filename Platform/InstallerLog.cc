#include "Platform/InstallerLog.h"

#include <mutex>
#include <string>

#include "Platform/LogSinkDefault.h"

namespace sl {

std::string_view logLevelName(int level) {
  switch (level) {
    case kLogLevelError: return "error";
    case kLogLevelNotice: return "notice";
    case kLogLevelDebug: return "debug";
    default: {
      static thread_local std::string other;
      other = "level " + std::to_string(level);
      return other;
    }
  }
}

namespace {
std::mutex gSinkMutex;
LogSink gSink;  // guarded by gSinkMutex; empty means standard error
}  // namespace

LogSink setInstallerLogSink(LogSink sink) {
  std::lock_guard lock(gSinkMutex);
  return std::exchange(gSink, std::move(sink));
}

void installerLogWrite(const InstallerLogHandle* /*handle*/, int level, const char* function,
                       std::string_view message) {
  LogRecord record{level, "installer", function ? function : "", "", 0, message};
  std::lock_guard lock(gSinkMutex);
  if (gSink)
    gSink(record);
  else
    detail::writeRecordToStandardError(record);
}

}  // namespace sl
