// Copying files, links and whole trees with their metadata.
//
// The flag values are those of the interface the file-system layer is
// written against; it always passes COPYFILE_ALL | COPYFILE_RECURSIVE |
// COPYFILE_NOFOLLOW_SRC | COPYFILE_NOFOLLOW_DST (0xC800F).
#pragma once

#include <cstdint>

namespace sl {

using copyfile_flags_t = uint32_t;
struct copyfile_state;
using copyfile_state_t = copyfile_state*;

inline constexpr copyfile_flags_t COPYFILE_ACL = 1u << 0;
inline constexpr copyfile_flags_t COPYFILE_STAT = 1u << 1;
inline constexpr copyfile_flags_t COPYFILE_XATTR = 1u << 2;
inline constexpr copyfile_flags_t COPYFILE_DATA = 1u << 3;
inline constexpr copyfile_flags_t COPYFILE_SECURITY = COPYFILE_STAT | COPYFILE_ACL;
inline constexpr copyfile_flags_t COPYFILE_METADATA = COPYFILE_SECURITY | COPYFILE_XATTR;
inline constexpr copyfile_flags_t COPYFILE_ALL = COPYFILE_METADATA | COPYFILE_DATA;
inline constexpr copyfile_flags_t COPYFILE_RECURSIVE = 1u << 15;
inline constexpr copyfile_flags_t COPYFILE_NOFOLLOW_SRC = 1u << 18;
inline constexpr copyfile_flags_t COPYFILE_NOFOLLOW_DST = 1u << 19;
inline constexpr copyfile_flags_t COPYFILE_NOFOLLOW = COPYFILE_NOFOLLOW_SRC | COPYFILE_NOFOLLOW_DST;

// Copies the item at `from` to `to`. Returns 0, or -1 with errno of the
// first failure; a partial copy is left in place. `state` must be null (no
// copy state is kept here): a state, a null path or a flag not declared
// above fails with EINVAL. The behaviour in full (kinds, links, metadata,
// what happens to what stands at `to`) is described in Copyfile.cc.
int copyfile(const char* from, const char* to, copyfile_state_t state, copyfile_flags_t flags);

}  // namespace sl
