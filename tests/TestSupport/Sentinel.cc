#include "TestSupport/Sentinel.h"

#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <functional>

#include <gtest/gtest.h>

#include "tools/ProgramRunner.h"

namespace sl::test {

namespace {

// The tree's listing, each item's inode added so that a look-alike put in
// an item's place shows.
std::map<std::string, std::string> stateOf(const std::string& top) {
  auto tree = listTree(top, [](const std::string& bytes) { return std::to_string(std::hash<std::string>{}(bytes)); });
  for (auto& [relative, state] : tree) {
    struct stat st {};
    ::lstat((relative == "." ? top : top + "/" + relative).c_str(), &st);
    state += " i" + std::to_string(st.st_ino);
  }
  return tree;
}

void setAttribute(const std::string& path, const char* name, const std::string& value) {
  if (::lsetxattr(path.c_str(), name, value.data(), value.size(), 0) != 0)
    ADD_FAILURE() << "setxattr " << path << " " << name << ": " << strerror(errno);
}

}  // namespace

Sentinel::Sentinel(const char* parent) : dir_(parent) {
  writeFile(dir_ / "secret.txt", "the sentinel's secret\n", 0600);
  setAttribute(dir_ / "secret.txt", "user.sentinel.a", "alpha");
  setAttribute(dir_ / "secret.txt", "user.sentinel.b", std::string("\0\1\2", 3));
  makeDirs(dir_ / "nested", 0700);
  setAttribute(dir_ / "nested", "user.sentinel.dir", "nested");
  writeFile(dir_ / "nested/deep.txt", std::string(100000, 'x'), 0600);
  makeSymlink("secret.txt", dir_ / "link-to-secret");
  for (const char* p : {".", "secret.txt", "nested", "nested/deep.txt", "link-to-secret"}) {
    if (::lchown((dir_ / p).c_str(), 0, 0) != 0) ADD_FAILURE() << "chown " << p << ": " << strerror(errno);
  }
  recorded_ = stateOf(dir_.path());
}

std::vector<std::string> Sentinel::changes() const {
  const auto now = stateOf(dir_.path());
  std::vector<std::string> out;
  for (const auto& [path, state] : recorded_) {
    const auto it = now.find(path);
    if (it == now.end()) out.push_back(path + ": missing");
    else if (it->second != state) out.push_back(path + ": was " + state + ", now " + it->second);
  }
  for (const auto& [path, state] : now)
    if (!recorded_.contains(path)) out.push_back(path + ": added");
  return out;
}

}  // namespace sl::test
