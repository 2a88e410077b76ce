// Creation of a directory together with its missing parents.
#pragma once

#include <sys/types.h>

namespace sl {

// Creates the directory at path and every missing directory above it, each
// with `mode` (as mkdir applies it, under the umask). Returns an error
// number, not -1: 0 when the directory was made, EEXIST when a directory
// already stands at path, ENOTDIR when a non-directory stands at path or in
// the way of a component, and otherwise the errno of the mkdir or stat that
// failed. A component that is a symbolic link to a directory is passed
// through, as the system's own path resolution does; the last component is
// never a link that gets followed to "succeed". Directories made before a
// failure stay.
int mkpath_np(const char* path, mode_t mode);

}  // namespace sl
