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
// is not a failure. Inside a DeferredSyncs scope (below) the directory's
// flush waits for the scope's; the file's own waits only in a scope made
// for scratch files, so that a name, whenever it reaches the disk, names
// the whole content.
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
// syncTree: everything of the tree at `path`, whatever its depth and kinds
// of files, with one syncfs of its file system ("syncfs of <path> failed");
// for a copy that must be whole on disk before its source is removed.
bool syncDirectory(const std::string& path, Error* error = nullptr);
bool syncParentDirectory(const std::string& path, Error* error = nullptr);
bool syncTree(const std::string& path, Error* error = nullptr);

// Deferred flushing, for a run of changes that all become durable at one
// later point (the commit that records them, the removal of what they
// emptied). While a DeferredSyncs object is alive on a thread, the calls
// above that flush a directory (syncDirectory, syncParentDirectory, the
// directory step of writeFileAtomically) only note the directory's file
// system, and flushDeferredSyncs then makes all of it durable with one
// syncfs per noted file system, which writes back every change made there
// so far: data, names and attributes.
//
// What depends on a deferred change flushes first: removefile before it
// removes anything but an empty directory (earlier removals excepted), the
// registry before it commits.
// A failed flush keeps its file systems noted, so whatever depends on it
// fails too, and reports "syncfs of <path> failed: <strerror>" (the first
// directory noted on that file system). syncTree is never deferred.
//
// Objects nest; the outermost one flushes what is still pending when it
// ends, ignoring failure, so an owner on its way to success calls
// flushDeferredSyncs itself.
//
// A scope made with kDirectoriesAndContent also defers the flush of the
// content that writeFileAtomically makes, for scratch files only: after a
// crash before the scope's flush such a file may stand whole, empty or
// partly written, so nothing may read it back then (it is made again).
class DeferredSyncs {
 public:
  enum class What { kDirectories, kDirectoriesAndContent };
  explicit DeferredSyncs(What what = What::kDirectories);
  ~DeferredSyncs();
  DeferredSyncs(const DeferredSyncs&) = delete;
  DeferredSyncs& operator=(const DeferredSyncs&) = delete;

 private:
  What what_;
};

// syncDirectory for the directory open for reading as `directoryFd`
// (`path` names it in records), after names were removed from it and
// nothing else changed there. Deferred, it is what no removal waits for:
// removals may reach the disk in any order among themselves.
bool syncDirectoryAfterRemoval(int directoryFd, const std::string& path, Error* error = nullptr);

// Flushes what this thread has deferred; true when nothing was.
bool flushDeferredSyncs(Error* error = nullptr);
// True when this thread has deferred a flush that has not been made yet:
// any, or one of a change besides the removals (what a removal waits for).
enum class Pending { kAny, kBesidesRemovals };
bool deferredSyncsPending(Pending which = Pending::kAny);

}  // namespace sl
