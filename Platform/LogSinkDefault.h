// The default destination of both logs: one line per record on standard
// error, "<level name> <category> <function>: <message>". Private to the two
// log services.
#pragma once

#include <cstdio>
#include <string>

#include "Platform/Log.h"

namespace sl::detail {

inline void writeRecordToStandardError(const LogRecord& r) {
  std::string line;
  line.reserve(r.message.size() + r.function.size() + 32);
  line.append(logLevelName(r.level)).append(" ").append(r.category).append(" ");
  line.append(r.function).append(": ").append(r.message).append("\n");
  std::fwrite(line.data(), 1, line.size(), stderr);
}

}  // namespace sl::detail
