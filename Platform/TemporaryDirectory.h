// The per-process temporary directory.
#pragma once

#include <string_view>

#include "Platform/Error.h"
#include "Platform/URL.h"

namespace sl {

// A directory URL for scratch files of this process:
//   - $TMPDIR, when it is set to an absolute path that is an existing
//     directory (links followed), taken as it is, not below the system root;
//   - otherwise ROOT/tmp/ (below the system root). When nothing stands
//     there it is made, with the mode of a shared temporary directory
//     (01777, world-writable and sticky, set explicitly so the umask does
//     not narrow it); the root itself is not made.
// The answer is worked out afresh on every call, so a change of TMPDIR or
// of the system root shows at once. The URL is returned even when ROOT/tmp
// could not be made: whoever then creates something in it meets the
// failure with an error record of its own.
URL perProcessTemporaryDirectory();

// The directory `name` in the temporary directory above, made when missing
// (mode 0700), for scratch work that nobody else may reach: it must be a
// real directory (not a link) owned by the effective user, and it is made
// unwritable by group and others when it was not. Anything else standing
// there (another user's directory or link, made ahead of us in a shared
// directory) is refused with a POSIX record: EEXIST "<path> is not a
// private directory of this user", or "<step> of <path> failed: <strerror>".
// The name must be a single path component.
URL privateTemporarySubdirectory(std::string_view name, Error* error = nullptr);

}  // namespace sl
