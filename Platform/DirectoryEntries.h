// Reading a whole directory listing from a descriptor, for the tree walks
// (removal, copy) that must not keep a stream open while they descend.
#pragma once

#include <string>
#include <vector>

namespace sl {

struct DirectoryEntry {
  std::string name;
  unsigned char type;  // d_type of the listing (DT_UNKNOWN included): a hint only
};

// Appends the entries of the directory open at fd, "." and ".." left out.
// Returns 0, or the errno of the failure. fd itself stays open and keeps its
// offset: the stream works on a duplicate descriptor.
int readDirectoryEntries(int fd, std::vector<DirectoryEntry>& entries);

}  // namespace sl
