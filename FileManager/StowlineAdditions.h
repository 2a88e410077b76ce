// String additions for file-system representations and ".." components.
#pragma once

#include <cstddef>

#include "Platform/Value.h"

namespace StowlineAdditions {

// The string for `length` bytes of a file-system representation. The bytes
// are kept exactly as they are; null bytes give a null string.
sl::String stringWithFileSystemRepresentation(const char* bytes, size_t length);
// The same for zero-terminated bytes.
sl::String stringWithFileSystemRepresentation(const char* bytes);

// True when a path component equals ".." ("a/../b", ".."); "a/..b" and
// "a/.../b" do not count.
bool containsDotDotPathComponents(const sl::String& path);

}  // namespace StowlineAdditions
