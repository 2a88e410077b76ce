// sl-filelayer: one file-system operation per process, through the same
// calls the system makes, so that whole-process timings can be put beside
// the standard tools on the same inputs.
//
//   sl-filelayer remove PATH        SLFileManager::removeItemAtURL (removefile)
//   sl-filelayer copy SRC DST       SLFileManager::copyItemAtURL (copyfile,
//                                   COPYFILE_ALL | RECURSIVE | NOFOLLOW)
//   sl-filelayer digest FILE...     SLCreateSHA256Digest, printed like sha256sum
//   sl-filelayer list DIR           SLFileManager::urlsForItemsInDirectoryAtURL
//   sl-filelayer readdir DIR        the baseline of list: opendir/readdir,
//                                   each name kept in a vector
//
// list and readdir print the number of entries, so that the work cannot be
// optimised away and a wrong count is seen. Exit status 0 on success, 1 on
// a failure (the error record on standard error), 2 for a usage error.

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "FileManager/SLFileManager.h"
#include "Platform/UniqueFd.h"
#include "Platform/URL.h"
#include "Support/Digest.h"

namespace {

constexpr char kUsage[] =
    "usage: sl-filelayer remove PATH | copy SRC DST | digest FILE... | list DIR | readdir DIR\n";

int usage() {
  std::fputs(kUsage, stderr);
  return 2;
}

bool isDirectory(const char* path) {
  struct stat st;
  return ::lstat(path, &st) == 0 && S_ISDIR(st.st_mode);
}

sl::URL urlFor(const char* path) { return sl::URL::fileURLWithPath(path, isDirectory(path)); }

int failed(const char* what, const sl::Error& error) {
  std::fprintf(stderr, "sl-filelayer: %s failed: %s\n", what, error.description().c_str());
  return 1;
}

int removeCommand(const char* path) {
  sl::Error error;
  if (!SLFileManager::defaultManager().removeItemAtURL(urlFor(path), &error)) return failed("remove", error);
  return 0;
}

int copyCommand(const char* from, const char* to) {
  sl::Error error;
  const bool directory = isDirectory(from);
  if (!SLFileManager::defaultManager().copyItemAtURL(sl::URL::fileURLWithPath(from, directory),
                                                     sl::URL::fileURLWithPath(to, directory), &error)) {
    return failed("copy", error);
  }
  return 0;
}

int digestCommand(int count, char** paths) {
  int status = 0;
  for (int i = 0; i < count; ++i) {
    const sl::String digest = SLCreateSHA256Digest(sl::URL::fileURLWithPath(paths[i], false));
    if (digest.isNull()) {
      std::fprintf(stderr, "sl-filelayer: cannot digest %s\n", paths[i]);
      status = 1;
      continue;
    }
    std::printf("%s  %s\n", digest.str().c_str(), paths[i]);
  }
  return status;
}

int listCommand(const char* path) {
  sl::Error error;
  const auto urls =
      SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(sl::URL::fileURLWithPath(path, true), false, &error);
  if (!urls) return failed("list", error);
  std::printf("%zu\n", urls->size());
  return 0;
}

int readdirCommand(const char* path) {
  sl::UniqueFd fd(::open(path, O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) {
    const int openErrno = errno;
    std::fprintf(stderr, "sl-filelayer: open of %s failed: %s\n", path, std::strerror(openErrno));
    return 1;
  }
  sl::UniqueDir dir = sl::fdopendir(fd);
  if (!dir) {
    const int dirErrno = errno;
    std::fprintf(stderr, "sl-filelayer: fdopendir of %s failed: %s\n", path, std::strerror(dirErrno));
    return 1;
  }
  std::vector<std::string> names;
  errno = 0;
  while (const struct dirent* entry = ::readdir(dir.get())) {
    const char* name = entry->d_name;
    if (name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'))) continue;
    names.emplace_back(name);
  }
  if (errno != 0) {
    const int readErrno = errno;
    std::fprintf(stderr, "sl-filelayer: readdir of %s failed: %s\n", path, std::strerror(readErrno));
    return 1;
  }
  std::printf("%zu\n", names.size());
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 2) return usage();
  const std::string_view command = argv[1];
  if (command == "remove" && argc == 3) return removeCommand(argv[2]);
  if (command == "copy" && argc == 4) return copyCommand(argv[2], argv[3]);
  if (command == "digest" && argc >= 3) return digestCommand(argc - 2, argv + 2);
  if (command == "list" && argc == 3) return listCommand(argv[2]);
  if (command == "readdir" && argc == 3) return readdirCommand(argv[2]);
  return usage();
}
