// Atomic replacement of a file's content.
//
// The bytes go to a new temporary file in the destination's directory,
// which is written whole, flushed with fsync, given the mode, and renamed
// over the destination; then the directory is flushed so that the rename
// itself is durable. A failure at any step removes the temporary file and
// leaves the destination as it was: never half-written, never missing when
// it existed before.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <span>

#include "Platform/Error.h"
#include "Platform/URL.h"

namespace sl {

// Returns false with a POSIX record naming the failed step
// ("write of %s failed: %s") on failure. A destination that is a symbolic
// link is replaced by a file, not written through.
bool writeFileAtomically(const URL& url, std::span<const uint8_t> bytes, mode_t mode = 0644,
                         Error* error = nullptr);

}  // namespace sl
