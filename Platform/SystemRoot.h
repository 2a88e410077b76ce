// The system root: the directory below which every absolute path of the
// system hangs ("/" by default).
//
// It is fixed once per process, before the configuration is first made: by
// the host's --root option (setSystemRoot) or, when nothing set it, by the
// environment variable STOWLINE_ROOT. The configuration's three bases, the
// registry, the preferences store, the system-version source and the
// temporary directory all live below it; with the default root the paths are
// exactly the system's own.
#pragma once

#include <string>
#include <string_view>

#include "Platform/URL.h"

namespace sl {

// Sets the root for this process: an absolute path of an existing directory,
// or "" to fall back to STOWLINE_ROOT and then "/". Takes effect for
// whoever asks systemRoot() next; callers set it before anything reads it.
void setSystemRoot(std::string_view path);

// The root as an absolute path without a trailing separator, except "/"
// itself.
const std::string& systemRoot();

// The root as a directory URL.
URL systemRootURL();

// `absolute` (a path that begins with "/") placed below the root:
// pathBelowSystemRoot("/private/var/stowd/") is "ROOT/private/var/stowd/",
// and exactly the argument when the root is "/". A trailing separator is
// kept.
std::string pathBelowSystemRoot(std::string_view absolute);

}  // namespace sl
