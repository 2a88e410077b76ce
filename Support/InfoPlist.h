// Loading a bundle's info dictionary, whole or only a few of its keys.
#pragma once

#include <cstdint>

#include "Platform/URL.h"
#include "Platform/Value.h"

// The info dictionary of the bundle directory at `bundle`, as a new
// dictionary that the caller may change freely.
//
// `keys` is the key set: an array of strings naming the top-level keys to
// keep. With it, the result holds those of them that the bundle's
// "Info.plist" has, and nothing else ("PBBundleInfoPlistURL" only when the
// file itself holds it). A null `keys` means no key set: the result is the
// whole info dictionary without "PBBundleInfoPlistURL", the entry that the
// bundle facility adds. (An empty, non-null array is a key set that keeps
// nothing.)
//
// Null on any failure; failures go to the installer log under
// "SLLoadInfoPlist": a missing "Info.plist" as a debug line, everything else
// as an error line. There is no error out-slot.
//
// Threads and locks: the existence test of "Info.plist" runs unlocked; the
// bundle work after it (opening the bundle, reading, releasing it) runs under
// one private process-wide lock, so loads happen one at a time. That lock is
// the innermost of the system: while it is held nothing calls back into the
// configuration or the file manager (only the log writer's own serialisation
// runs under it). A caller may hold its locks around this call (the
// configuration's catalogue scans hold the configuration's lock), and this
// lock is never held while one of those is taken.
sl::Dictionary SLLoadInfoPlist(const sl::URL& bundle, const sl::Array& keys);

namespace sl::infoplist_detail {

// How many times SLLoadInfoPlist has taken its lock in this process. For
// tests that must see a load end before the lock.
uint64_t lockAcquisitionCount();

}  // namespace sl::infoplist_detail
