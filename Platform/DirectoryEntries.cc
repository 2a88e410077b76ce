#include "Platform/DirectoryEntries.h"

#include <dirent.h>
#include <fcntl.h>

#include <cerrno>

#include "Platform/UniqueFd.h"

namespace sl {

int readDirectoryEntries(int fd, std::vector<DirectoryEntry>& entries) {
  // A duplicate shares the file offset, so the stream is rewound first: the
  // listing starts at the beginning whatever was read before.
  UniqueFd dup(fcntl(fd, F_DUPFD_CLOEXEC, 0));
  if (!dup) return errno;
  UniqueDir dir = sl::fdopendir(dup);  // owns the duplicate from here on
  if (!dir) return errno;
  rewinddir(dir.get());
  for (;;) {
    errno = 0;
    const dirent* entry = readdir(dir.get());
    if (entry == nullptr) return errno;  // 0 at the end of the stream
    const char* name = entry->d_name;
    if (name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'))) continue;
    entries.push_back(DirectoryEntry{name, entry->d_type});
  }
}

}  // namespace sl
