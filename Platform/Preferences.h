// The preferences store: one property-list dictionary per domain.
//
// A domain "com.vantor.stowline" lives in
// ROOT/private/var/mobile/Library/Preferences/com.vantor.stowline.plist
// (ROOT being the system root). Values are read as they are on disk unless
// this process has changes to the domain that it has not synchronised yet,
// in which case those win. An absent key reads as null, distinguishable from
// any stored value (a stored false included). Writes are kept in memory
// until preferencesSynchronize writes the whole domain atomically. The
// store is safe to use from several threads.
//
// The store has one user and one host: the current user's values on any
// host, which is what the system asks for.
#pragma once

#include <string>
#include <string_view>

#include "Platform/Error.h"
#include "Platform/URL.h"
#include "Platform/Value.h"

namespace sl {

// The file that holds a domain (a plain name, no separators), below the
// system root as it is when this is called.
URL preferencesFileURL(std::string_view domain);

// The value stored under key, or null when absent (or the domain's file is
// missing or unreadable).
Value preferencesCopyValue(std::string_view key, std::string_view domain);

// Stores (or with a null value removes) a value; it reaches the disk with
// the next preferencesSynchronize of the domain.
void preferencesSetValue(std::string_view key, const Value& value, std::string_view domain);

// Writes the domain's pending changes atomically (XML), merged over what the
// file holds now; a file that is missing or not a readable dictionary is
// replaced. The Preferences directory is made (mode 0755, with its parents)
// when missing. With nothing pending it writes nothing and succeeds. Returns
// false with a POSIX record when the directory cannot be made
// ("mkpath_np of <dir> failed: <strerror>") or the write fails (the record
// of writePropertyListToURL); the changes then stay pending.
bool preferencesSynchronize(std::string_view domain, Error* error = nullptr);

// Forgets every pending change (the store caches nothing else), for tests
// that must not see another test's unsynchronised writes.
void preferencesResetForTesting();

}  // namespace sl
