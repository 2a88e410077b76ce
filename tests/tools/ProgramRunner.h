// Runs a program as a subprocess and collects its exit status, standard
// output and standard error, for the tests of the stowline program; and a
// listing of a tree to compare before and after a run.
#pragma once

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "TestSupport/TestSupport.h"

extern char** environ;

namespace sl::test {

struct ProgramResult {
  int status = -1;  // the exit status; 128 + N when killed by signal N; -1 when it could not start
  std::string out;
  std::string err;
};

// Runs `args` (args[0] is the program's path) with the environment of this
// process changed by `env`: "NAME=VALUE" sets a variable, "NAME" alone
// removes it. Standard input is /dev/null. Both outputs are read as they
// come, so a program that writes much to either never blocks.
inline ProgramResult runProgram(const std::vector<std::string>& args, const std::vector<std::string>& env = {}) {
  ProgramResult result;
  std::vector<std::string> environment;
  for (char** e = environ; *e; ++e) environment.emplace_back(*e);
  for (const std::string& change : env) {
    std::string name = change.substr(0, change.find('='));
    std::erase_if(environment, [&](const std::string& v) { return v.compare(0, name.size() + 1, name + "=") == 0; });
    if (change.find('=') != std::string::npos) environment.push_back(change);
  }
  std::vector<char*> argv, envp;
  for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
  argv.push_back(nullptr);
  for (const std::string& e : environment) envp.push_back(const_cast<char*>(e.c_str()));
  envp.push_back(nullptr);

  int outPipe[2], errPipe[2];
  if (pipe2(outPipe, O_CLOEXEC) != 0) return result;
  if (pipe2(errPipe, O_CLOEXEC) != 0) {
    close(outPipe[0]);
    close(outPipe[1]);
    return result;
  }
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_adddup2(&actions, outPipe[1], 1);
  posix_spawn_file_actions_adddup2(&actions, errPipe[1], 2);
  pid_t pid = -1;
  int spawned = posix_spawn(&pid, argv[0], &actions, nullptr, argv.data(), envp.data());
  posix_spawn_file_actions_destroy(&actions);
  close(outPipe[1]);
  close(errPipe[1]);
  if (spawned == 0) {
    pollfd fds[2] = {{outPipe[0], POLLIN, 0}, {errPipe[0], POLLIN, 0}};
    std::string* sinks[2] = {&result.out, &result.err};
    int open = 2;
    while (open > 0) {
      if (poll(fds, 2, -1) < 0) {
        if (errno == EINTR) continue;
        break;
      }
      for (int i = 0; i < 2; ++i) {
        if (fds[i].fd < 0 || fds[i].revents == 0) continue;
        char buffer[65536];
        ssize_t n = read(fds[i].fd, buffer, sizeof buffer);
        if (n > 0) {
          sinks[i]->append(buffer, static_cast<size_t>(n));
        } else if (n == 0 || errno != EINTR) {
          fds[i].fd = -1;
          --open;
        }
      }
    }
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    result.status = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }
  close(outPipe[0]);
  close(errPipe[0]);
  return result;
}

#ifdef SL_STOWLINE_PATH
// The stowline program with `args`, without NO_COLOR or STOWLINE_ROOT in its
// environment.
inline ProgramResult stowline(std::vector<std::string> args) {
  args.insert(args.begin(), SL_STOWLINE_PATH);
  return runProgram(args, {"NO_COLOR", "STOWLINE_ROOT"});
}
#endif

// Every item in the tree at `root` (itself as "."), by path relative to it:
// mode in octal, owner, size, modification time in nanoseconds, extended
// attributes with their values, then the link target or the contents (or
// `digest` of them). `withChangeTime` adds the change time.
inline std::map<std::string, std::string> listTree(const std::string& root,
                                                   std::string (*digest)(const std::string&) = nullptr,
                                                   bool withChangeTime = false) {
  std::map<std::string, std::string> tree;
  std::vector<std::filesystem::path> paths{root};
  for (const auto& entry : std::filesystem::recursive_directory_iterator(root)) paths.push_back(entry.path());
  for (const std::filesystem::path& path : paths) {
    struct stat st;
    EXPECT_EQ(::lstat(path.c_str(), &st), 0) << path;
    std::ostringstream line;
    line << std::oct << st.st_mode << std::dec << ' ' << st.st_uid << ':' << st.st_gid << ' ' << st.st_size << " m"
         << st.st_mtim.tv_sec << '.' << st.st_mtim.tv_nsec;
    if (withChangeTime) line << " c" << st.st_ctim.tv_sec << '.' << st.st_ctim.tv_nsec;
    char names[4096], value[4096];
    const ssize_t n = ::llistxattr(path.c_str(), names, sizeof names);
    for (ssize_t i = 0; i < n; i += static_cast<ssize_t>(std::strlen(names + i)) + 1) {
      const ssize_t size = ::lgetxattr(path.c_str(), names + i, value, sizeof value);
      line << " x:" << names + i << '=' << std::string(value, static_cast<size_t>(std::max<ssize_t>(size, 0)));
    }
    if (S_ISREG(st.st_mode)) {
      const std::string bytes = readFile(path);
      line << ' ' << (digest ? digest(bytes) : bytes);
    }
    if (S_ISLNK(st.st_mode)) line << " -> " << std::filesystem::read_symlink(path).string();
    tree[std::filesystem::relative(path, root).string()] = line.str();
  }
  return tree;
}

}  // namespace sl::test
