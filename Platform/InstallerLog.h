// The installer log writer.
//
// Call sites apply the threshold rule of their handle before they call the
// writer (Support/Log.h does that); the writer itself writes every record it
// is given. The handle is the writer's own object: the only field the
// system reads is its threshold.
#pragma once

#include <cstdint>
#include <string_view>

#include "Platform/Format.h"
#include "Platform/Log.h"

namespace sl {

struct InstallerLogHandle {
  // Messages of a level at or below the threshold are wanted.
  int32_t threshold = kLogLevelNotice;
};

// Replaces the sink of the installer log and returns the previous one. An
// empty sink restores the default, a line on standard error.
LogSink setInstallerLogSink(LogSink sink);

// Writes one message. `handle` may be null; `function` names the caller in
// its documented form ("-[SLGlobalConfiguration init]").
void installerLogWrite(const InstallerLogHandle* handle, int level, const char* function,
                       std::string_view message);

template <class... Args>
void installerLog(const InstallerLogHandle* handle, int level, const char* function,
                  FormatString<std::type_identity_t<Args>...> format, const Args&... args) {
  installerLogWrite(handle, level, function, sl::format(format, args...));
}

}  // namespace sl
