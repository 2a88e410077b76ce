// The registry's database file operations under the mutation layer.
//
// In a build with fault plans (STOWLINE_FAULT_INJECTION), the database is
// opened through a VFS that wraps SQLite's default one and asks
// sl::mut::admit before every write, truncation and sync of a named file,
// every deletion, and the open that creates a file: a plan can then kill
// the process or fail the call in the middle of a commit, exactly as it
// does for the file operations of the rest of the system. A refused call
// fails with the I/O error SQLite would report for that errno (SQLITE_FULL
// for ENOSPC and EDQUOT), and the VFS's xGetLastError answers its errno.
// Elsewhere the default VFS is used as it is.
#pragma once

namespace rg {

#ifdef STOWLINE_FAULT_INJECTION
// The name to open the database with: the counted VFS, registered (not as
// the default) on the first call.
const char* countedVfsName();
#else
inline const char* countedVfsName() { return nullptr; }
#endif

}  // namespace rg
