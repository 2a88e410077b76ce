#include "Platform/InstallerLog.h"

#include <string>

#include "Platform/LogSinkSlot.h"

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
detail::LogSinkSlot& slot() {
  static detail::LogSinkSlot* const instance = new detail::LogSinkSlot();  // outlives every logger
  return *instance;
}
}  // namespace

LogSink setInstallerLogSink(LogSink sink) { return slot().exchange(std::move(sink)); }

void installerLogWrite(const InstallerLogHandle* /*handle*/, int level, const char* function,
                       std::string_view message) {
  slot().write(LogRecord{level, "installer", function ? function : "", "", 0, message});
}

}  // namespace sl
