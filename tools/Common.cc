#include <sys/stat.h>

#include <cstdio>
#include <string>

#include "Platform/SystemRoot.h"
#include "tools/Commands.h"

namespace stowline {

int usageError(std::string_view command, std::string_view message) {
  std::fprintf(stderr, "stowline %.*s: %.*s\nTry 'stowline %.*s --help'.\n", static_cast<int>(command.size()),
               command.data(), static_cast<int>(message.size()), message.data(), static_cast<int>(command.size()),
               command.data());
  return 2;
}

int setupError(std::string_view command, std::string_view message) {
  std::fprintf(stderr, "stowline %.*s: %.*s\n", static_cast<int>(command.size()), command.data(),
               static_cast<int>(message.size()), message.data());
  return 2;
}

bool applyRoot(std::string_view command, const std::string& root) {
  // Without --root, STOWLINE_ROOT or "/": checked all the same, so that
  // nothing is made below a root that is not there.
  const std::string effective = root.empty() ? sl::systemRoot() : root;
  struct stat st;
  if (::stat(effective.c_str(), &st) != 0) {
    setupError(command, "root " + effective + " does not exist");
    return false;
  }
  if (!S_ISDIR(st.st_mode)) {
    setupError(command, "root " + effective + " is not a directory");
    return false;
  }
  if (!root.empty()) sl::setSystemRoot(root);
  return true;
}

}  // namespace stowline
