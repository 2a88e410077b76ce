#include "Platform/HostLog.h"

#include <mutex>

#include "Platform/LogSinkDefault.h"

namespace sl {

namespace {
std::mutex gSinkMutex;
LogSink gSink;  // guarded by gSinkMutex; empty means standard error
}  // namespace

LogSink setHostLogSink(LogSink sink) {
  std::lock_guard lock(gSinkMutex);
  return std::exchange(gSink, std::move(sink));
}

void hostLogWrite(const char* file, const char* function, int line, const char* category, int level,
                  std::string_view message) {
  LogRecord record{level, category ? category : "", function ? function : "", file ? file : "", line, message};
  std::lock_guard lock(gSinkMutex);
  if (gSink)
    gSink(record);
  else
    detail::writeRecordToStandardError(record);
}

}  // namespace sl
