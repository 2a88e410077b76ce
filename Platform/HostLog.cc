#include "Platform/HostLog.h"

#include "Platform/LogSinkSlot.h"

namespace sl {

namespace {
detail::LogSinkSlot& slot() {
  static detail::LogSinkSlot* const instance = new detail::LogSinkSlot();  // outlives every logger
  return *instance;
}
}  // namespace

LogSink setHostLogSink(LogSink sink) { return slot().exchange(std::move(sink)); }

void hostLogWrite(const char* file, const char* function, int line, const char* category, int level,
                  std::string_view message) {
  slot().write(LogRecord{level, category ? category : "", function ? function : "", file ? file : "", line, message});
}

}  // namespace sl
