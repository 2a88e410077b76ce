// Shared pieces of the benchmarks: the scale knob, scratch directories on
// the disk and under /dev/shm, and tree and file builders.
//
// BENCH_SCALE=full selects the full sizes; anything else (or nothing) the
// small defaults, which keep each benchmark program well under a minute.
// BENCH_DIR names the directory on the disk under which scratch trees are
// made (default /var/tmp); BENCH_SHM the one on the second volume (default
// /dev/shm).
#pragma once

#include <benchmark/benchmark.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <string>
#include <vector>

#include "FileManager/SLFileManager.h"
#include "Platform/URL.h"

namespace slbench {

inline bool fullScale() {
  const char* scale = std::getenv("BENCH_SCALE");
  return scale && std::string(scale) == "full";
}

// `full` under BENCH_SCALE=full, else `small`.
inline int64_t scaled(int64_t small, int64_t full) { return fullScale() ? full : small; }

inline std::string diskParent() {
  const char* dir = std::getenv("BENCH_DIR");
  return dir && *dir ? dir : "/var/tmp";
}

inline std::string shmParent() {
  const char* dir = std::getenv("BENCH_SHM");
  return dir && *dir ? dir : "/dev/shm";
}

inline sl::URL fileURL(const std::string& path, bool directory = false) {
  return sl::URL::fileURLWithPath(path, directory);
}

// A fresh directory below `parent`, removed with everything in it when the
// object goes away.
class ScratchDir {
 public:
  explicit ScratchDir(const std::string& parent) {
    std::string pattern = parent + "/slbench.XXXXXX";
    if (!mkdtemp(pattern.data())) throw std::runtime_error("mkdtemp below " + parent + " failed");
    path_ = pattern;
  }
  ~ScratchDir() { (void)SLFileManager::defaultManager().removeItemAtURL(fileURL(path_, true)); }
  ScratchDir(const ScratchDir&) = delete;
  ScratchDir& operator=(const ScratchDir&) = delete;
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

inline void writeFile(const std::string& path, const std::string& content) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << content;
  if (!out) throw std::runtime_error("cannot write " + path);
}

// `files` files of `fileSize` bytes spread evenly over `directories`
// directories "dNNNN" below `root` (made with its parents).
inline void makeTree(const std::string& root, int64_t files, int64_t directories, size_t fileSize) {
  std::filesystem::create_directories(root);
  const std::string content(fileSize, 'x');
  const int64_t perDirectory = (files + directories - 1) / directories;
  int64_t made = 0;
  for (int64_t d = 0; d < directories && made < files; ++d) {
    const std::string dir = root + "/d" + std::to_string(d);
    std::filesystem::create_directory(dir);
    for (int64_t f = 0; f < perDirectory && made < files; ++f, ++made)
      writeFile(dir + "/f" + std::to_string(f), content);
  }
}

// A file of `bytes` bytes of a non-constant pattern, written in 1 MiB blocks.
inline void makeLargeFile(const std::string& path, int64_t bytes) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  std::vector<char> block(1 << 20);
  for (size_t i = 0; i < block.size(); ++i) block[i] = static_cast<char>(i * 131 + 7);
  for (int64_t left = bytes; left > 0; left -= static_cast<int64_t>(block.size()))
    out.write(block.data(), static_cast<std::streamsize>(std::min<int64_t>(left, block.size())));
  if (!out) throw std::runtime_error("cannot write " + path);
}

}  // namespace slbench
