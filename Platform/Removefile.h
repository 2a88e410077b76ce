// Recursive removal with a caller-supplied error policy.
//
// The interface keeps the shape that the file-system layer is written
// against: an opaque state that carries an error callback, a context pointer
// and the errno of the entry at hand, and one call that removes a file, a
// link or a whole tree.
//
// Contract of removefile():
//  - No symbolic link is ever followed: a link, at the top or inside the
//    tree, is removed as the link itself.
//  - The walk works on directory descriptors (openat/unlinkat with
//    O_NOFOLLOW), never on rebuilt paths, so a directory swapped for a link
//    while the walk runs is not entered.
//  - It is iterative: the depth of a tree costs heap, not stack, and only a
//    bounded number of descriptors is held open at once, so a tree many
//    thousands of levels deep is removed.
//  - Each entry that cannot be removed (or whose directory cannot be read) is
//    reported to the error callback with its path; REMOVEFILE_STATE_ERRNO then
//    reads that entry's errno. REMOVEFILE_PROCEED goes on with the rest of
//    the tree, REMOVEFILE_STOP ends the walk with -1 and that errno. Without a
//    callback the first error ends the walk the same way.
//  - A path where nothing stands fails with -1 and ENOENT, without a
//    callback. Otherwise the result is 0 when the walk reached its end.
//  - Flushes this thread has deferred (DeferredSyncs, AtomicFile.h) are made
//    before anything but an empty directory is removed, unless they are
//    only those of earlier removals; when that fails,
//    nothing is removed and the call fails with -1 and the flush's errno,
//    without a callback.
//  - What it removed is made durable before it returns, so that nothing
//    reuses the freed inodes first: the parent of a removed item is flushed
//    (only noted while flushes are deferred), the file system of a tree
//    removed in part is flushed. A flush that fails after a whole removal
//    fails the call with -1 and its errno, without a callback; a parent the
//    caller cannot read is not flushed.
#pragma once

#include <cstdint>

namespace sl {

struct removefile_state;
using removefile_state_t = removefile_state*;
using removefile_flags_t = uint32_t;
using removefile_callback_t = int (*)(removefile_state_t state, const char* path, void* context);

inline constexpr removefile_flags_t REMOVEFILE_RECURSIVE = 1u << 0;

inline constexpr uint32_t REMOVEFILE_STATE_ERROR_CALLBACK = 3;
inline constexpr uint32_t REMOVEFILE_STATE_ERROR_CONTEXT = 4;
inline constexpr uint32_t REMOVEFILE_STATE_ERRNO = 5;

inline constexpr int REMOVEFILE_PROCEED = 0;
inline constexpr int REMOVEFILE_SKIP = 1;
inline constexpr int REMOVEFILE_STOP = 2;

// Returns a new state, or null with errno ENOMEM.
removefile_state_t removefile_state_alloc();
// Frees a state made by removefile_state_alloc; null is accepted. Returns 0.
int removefile_state_free(removefile_state_t state);

// Sets a key of the state: the callback (a removefile_callback_t passed as
// its address) or the context (any pointer, handed to the callback as is).
// Returns 0, or -1 with EINVAL for an unknown key or a null state.
int removefile_state_set(removefile_state_t state, uint32_t key, const void* value);
// Reads a key into *dst: REMOVEFILE_STATE_ERRNO into an int, the callback
// into a removefile_callback_t, the context into a void*. Returns 0, or -1
// with EINVAL.
int removefile_state_get(removefile_state_t state, uint32_t key, void* dst);

// Removes the item at path. Without REMOVEFILE_RECURSIVE a directory is
// removed only when it is empty. state may be null.
int removefile(const char* path, removefile_state_t state, removefile_flags_t flags);

}  // namespace sl
