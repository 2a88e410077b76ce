// The installer log as the system's code writes to it: the exported handle
// and the threshold rule applied at every call site.
#pragma once

#include "Platform/Format.h"
#include "Platform/InstallerLog.h"
#include "Platform/Log.h"

// The current installer-log handle, initially null. The system reads it at
// every installer-log call and never assigns it; whoever sets it does so
// before other threads start to log.
extern "C" sl::InstallerLogHandle* gLogHandle;

// The threshold rule: error and notice lines are wanted when no handle is
// set or the handle's threshold is at least the level; debug lines only when
// a handle is set and its threshold is at least 7.
inline bool SLLogWanted(int level) {
  const sl::InstallerLogHandle* h = gLogHandle;
  if (level >= sl::kLogLevelDebug) return h != nullptr && h->threshold >= level;
  return h == nullptr || h->threshold >= level;
}

// Formats and writes one installer-log line under `function` when the
// threshold rule wants it; the arguments are not formatted otherwise.
template <class... Args>
void SLLog(int level, const char* function, sl::FormatString<std::type_identity_t<Args>...> format,
           const Args&... args) {
  if (!SLLogWanted(level)) return;
  sl::installerLogWrite(gLogHandle, level, function, sl::format(format, args...));
}
