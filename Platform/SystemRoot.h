// The system root: the directory below which every absolute path of the
// system hangs ("/" by default).
//
// It is set once per process, before the configuration is first made: by
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

// Sets the root for this process: the path of a directory, or "" to fall
// back to STOWLINE_ROOT (when set and not empty) and then "/". The path is
// normalised: a relative one is taken from the working directory, runs of
// separators are folded, "." components and a trailing separator dropped
// (".." stays). Nothing checks that the directory exists.
//
// It may be called again (tests switch roots): a change affects only what
// is computed afterwards. Whatever already derived its paths from the old
// root keeps them; an SLGlobalConfiguration fixes its bases when it is made.
void setSystemRoot(std::string_view path);

// The root as an absolute path without a trailing separator, except "/"
// itself. Decided on the first call when setSystemRoot did not decide it.
// The reference stays valid for the life of the process, also after a
// later setSystemRoot. Safe to call from any thread.
const std::string& systemRoot();

// The root as a directory URL.
URL systemRootURL();

// `absolute` (a path that begins with "/") placed below the root:
// pathBelowSystemRoot("/private/var/stowd/") is "ROOT/private/var/stowd/",
// and exactly the argument when the root is "/". A trailing separator is
// kept; an argument without a leading separator is given one.
std::string pathBelowSystemRoot(std::string_view absolute);

}  // namespace sl
