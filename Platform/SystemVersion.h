// The system-version dictionary: what the running system says it is.
//
// Its source is the os-release file below the system root
// (ROOT/etc/os-release), read afresh on every call:
//
//   kSystemProductNameKey     NAME
//   kSystemProductVersionKey  VERSION_ID
//   kSystemBuildVersionKey    BUILD_ID, else VERSION_ID
//
// The file is read as the os-release format has it: one KEY=value
// assignment per line; blank lines and lines whose first non-blank
// character is '#' are comments. A value is either bare (taken to the end
// of the line, trailing blanks dropped), in single quotes (taken literally)
// or in double quotes, where a backslash before '"', '\\', '$' or '`' stands
// for that character and any other backslash is kept. Text after the
// closing quote is ignored. A line that is not an assignment, or whose
// quote is never closed, is skipped; a later assignment of a key replaces
// an earlier one. An empty value counts as absent.
#pragma once

#include <string_view>

#include "Platform/Value.h"

namespace sl {

inline constexpr char kSystemProductNameKey[] = "ProductName";
inline constexpr char kSystemProductVersionKey[] = "ProductVersion";
inline constexpr char kSystemBuildVersionKey[] = "SystemBuildVersion";

// A new dictionary of string values; a key whose source is absent is left
// out (so the dictionary may be empty). Null when the file is missing or
// cannot be read.
Dictionary copySystemVersionDictionary();

// The dictionary that os-release text describes, as above; never null.
Dictionary parseOSRelease(std::string_view text);

}  // namespace sl
