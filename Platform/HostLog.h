// The migration host's log call.
//
// It belongs to the host-interface library that the host program and the
// plug-in both link: the host sets the sink, the plug-in writes. There is no
// threshold at the call sites; the host filters.
#pragma once

#include <string_view>

#include "Platform/Format.h"
#include "Platform/Log.h"

namespace sl {

// Replaces the sink of the host log and returns the previous one. An empty
// sink restores the default, a line on standard error.
LogSink setHostLogSink(LogSink sink);

void hostLogWrite(const char* file, const char* function, int line, const char* category, int level,
                  std::string_view message);

template <class... Args>
void hostLog(const char* file, const char* function, int line, const char* category, int level,
             FormatString<std::type_identity_t<Args>...> format, const Args&... args) {
  hostLogWrite(file, function, line, category, level, sl::format(format, args...));
}

}  // namespace sl
