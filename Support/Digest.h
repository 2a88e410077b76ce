// The SHA-256 digest of a file's content, read in bounded chunks.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>

#include "Platform/URL.h"
#include "Platform/Value.h"

// The digest of the file at `path` as 64 lowercase hexadecimal digits, or
// null on failure. Every failure writes two installer-log lines at level
// error: the reader's own (none when the reader was stopped by its consumer)
// and then "Failed to read %@ : %s" under "SLCreateSHA256Digest". At most
// 64 KiB of the file are held in memory at a time.
sl::String SLCreateSHA256Digest(const sl::URL& path);

// Internal to the support functions.
//
// Streams the first S bytes of the file at `path` (S = its size when it was
// opened) through `consumer`, in chunks of at most min(S, 65536) bytes, and
// returns true when all of them were consumed; an empty file succeeds without
// a call. `consumer` returns false to stop the read, which then fails without
// a message. Other failures are logged under "_ReadFile" and leave errno as
// the failing call set it (for a file that ended early, as it was).
bool _ReadFile(const char* path, const std::function<bool(const uint8_t* chunk, size_t length)>& consumer);
