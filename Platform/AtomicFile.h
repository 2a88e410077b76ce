// Atomic replacement of a file's content.
//
// The bytes go to a new temporary file in the destination's directory,
// which is written whole, flushed with fsync, given the mode, and renamed
// over the destination; then the directory is flushed so that the rename
// itself is durable. A failure at any step up to the rename removes the
// temporary file and leaves the destination as it was: never half-written,
// never missing when it existed before. A failure to flush the directory
// after the rename is reported too (the new content is then in place, its
// durability unknown); a file system that cannot flush directories (EINVAL)
// is not a failure.
//
// The temporary file is ".<name>.XXXXXX" (six random characters) and is
// made with O_EXCL and O_NOFOLLOW relative to the open directory. The new
// file belongs to the caller, not to the old file's owner.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <span>
#include <string>

#include "Platform/Error.h"
#include "Platform/URL.h"

namespace sl {

// Returns false with a POSIX record naming the failed step on failure:
// "<step> of <path> failed: <strerror>" where the step is open, write,
// fchmod, fsync or close (of the temporary file, or open and fsync of the
// directory), and "rename of <temporary> to <path> failed: <strerror>"; the
// code is the errno. A path without a last component gives EINVAL. A
// destination that is a symbolic link is replaced by a file, not written
// through.
bool writeFileAtomically(const URL& url, std::span<const uint8_t> bytes, mode_t mode = 0644,
                         Error* error = nullptr);

// Durability of changes made by other means (renames, new directories,
// copies). Each flushes with fsync and treats a file system that cannot
// flush a directory (EINVAL) as success; on failure it returns false with a
// POSIX record "<step> of <path> failed: <strerror>" (step open or fsync).
//
// syncDirectory: the entries of the directory at `path` (names made,
// renamed or removed in it). syncParentDirectory: those of the directory
// that holds `path` (nothing is done for a path without a parent).
// syncTree: every file and directory of the tree at `path`, deepest first,
// links neither followed nor flushed; for a copy that must be whole on disk
// before it is renamed into place or its source is removed.
bool syncDirectory(const std::string& path, Error* error = nullptr);
bool syncParentDirectory(const std::string& path, Error* error = nullptr);
bool syncTree(const std::string& path, Error* error = nullptr);

}  // namespace sl
