// Where one log's records go: a sink that the host may replace, standard
// error until it does. Private to the two log services.
#pragma once

#include <cstdio>
#include <mutex>
#include <string>
#include <utility>

#include "Platform/Log.h"

namespace sl::detail {

class LogSinkSlot {
 public:
  LogSink exchange(LogSink sink) {
    std::lock_guard lock(mutex_);
    return std::exchange(sink_, std::move(sink));
  }

  // One record at a time, so lines of different threads never interleave.
  void write(const LogRecord& record) {
    std::lock_guard lock(mutex_);
    if (sink_) {
      sink_(record);
      return;
    }
    std::string line;
    line.reserve(record.message.size() + record.function.size() + 32);
    line.append(logLevelName(record.level)).append(" ").append(record.category).append(" ");
    line.append(record.function).append(": ").append(record.message).append("\n");
    std::fwrite(line.data(), 1, line.size(), stderr);
  }

 private:
  std::mutex mutex_;
  LogSink sink_;  // empty: standard error
};

}  // namespace sl::detail
