// The file manager's whole-tree operations: listing, removal, copy and move.
//
// Trees that only exist to be read are built once per run; removal and copy
// destroy or duplicate them, so those rebuild or clean up with the timer
// paused. The disk removes a file with data only after its discard, and
// creating many files right after deleting many is slow: the disk removal
// runs last, and copies go to fresh names that are removed after the loop.
#include <benchmark/benchmark.h>

#include <cstdio>
#include <string>
#include <vector>

#include "BenchSupport.h"
#include "FileManager/SLFileManager.h"

namespace {

using slbench::fileURL;
using slbench::scaled;

const int64_t kListEntries = scaled(10'000, 100'000);
const int64_t kTreeFiles = scaled(2'000, 100'000);
const int64_t kTreeDirectories = scaled(40, 2'000);
constexpr size_t kSmallFileSize = 512;
const int64_t kLargeFileSize = scaled(int64_t{64} << 20, int64_t{1} << 30);

enum Volume { kDisk = 0, kShm = 1 };

const std::string& parentOf(int volume) {
  static const std::string disk = slbench::diskParent(), shm = slbench::shmParent();
  return volume == kShm ? shm : disk;
}

// The disk scratch directory and the read-only material in it, made on
// first use.
struct DiskFixture {
  slbench::ScratchDir scratch{slbench::diskParent()};
  std::string listing = scratch.path() + "/listing";
  std::string tree = scratch.path() + "/tree";
  std::string large = scratch.path() + "/large";
  bool listingMade = false, treeMade = false, largeMade = false;

  static DiskFixture& shared() {
    static DiskFixture fixture;
    return fixture;
  }
  // One directory of empty files: listing does not read data.
  const std::string& listingDirectory() {
    if (!listingMade) {
      std::filesystem::create_directory(listing);
      for (int64_t i = 0; i < kListEntries; ++i) slbench::writeFile(listing + "/entry" + std::to_string(i), "");
      listingMade = true;
    }
    return listing;
  }
  const std::string& sourceTree() {
    if (!treeMade) {
      slbench::makeTree(tree, kTreeFiles, kTreeDirectories, kSmallFileSize);
      treeMade = true;
    }
    return tree;
  }
  const std::string& largeFile() {
    if (!largeMade) {
      slbench::makeLargeFile(large, kLargeFileSize);
      largeMade = true;
    }
    return large;
  }
};

void BM_ListDirectory(benchmark::State& state) {
  const sl::URL url = fileURL(DiskFixture::shared().listingDirectory(), true);
  for (auto _ : state) {
    auto urls = SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(url, false);
    if (!urls || static_cast<int64_t>(urls->size()) != kListEntries) state.SkipWithError("listing failed");
    benchmark::DoNotOptimize(urls);
  }
  state.SetItemsProcessed(state.iterations() * kListEntries);
}
BENCHMARK(BM_ListDirectory)->Unit(benchmark::kMillisecond);

// Copies `source` to a fresh name below a scratch directory of the volume
// each iteration; the copies are removed after the loop.
void copyBench(benchmark::State& state, const std::string& source, int64_t bytes) {
  slbench::ScratchDir destination(parentOf(static_cast<int>(state.range(0))));
  int n = 0;
  for (auto _ : state) {
    const std::string target = destination.path() + "/copy" + std::to_string(n++);
    sl::Error error;
    if (!SLFileManager::defaultManager().copyItemAtURL(fileURL(source), fileURL(target), &error)) {
      state.SkipWithError("copy failed");
      break;
    }
  }
  state.SetBytesProcessed(state.iterations() * bytes);
  state.SetLabel(state.range(0) == kShm ? "disk to /dev/shm" : "same volume");
}

void BM_CopyTree(benchmark::State& state) {
  const std::string& source = DiskFixture::shared().sourceTree();
  copyBench(state, source, kTreeFiles * static_cast<int64_t>(kSmallFileSize));
  state.SetItemsProcessed(state.iterations() * kTreeFiles);
}
BENCHMARK(BM_CopyTree)->Arg(kDisk)->Arg(kShm)->Iterations(3)->Unit(benchmark::kMillisecond);

void BM_CopyLargeFile(benchmark::State& state) {
  const std::string& source = DiskFixture::shared().largeFile();
  copyBench(state, source, kLargeFileSize);
}
BENCHMARK(BM_CopyLargeFile)->Arg(kDisk)->Arg(kShm)->Iterations(3)->Unit(benchmark::kMillisecond);

// A move on one volume is one rename: the tree goes back and forth.
void BM_MoveTree(benchmark::State& state) {
  const std::string& tree = DiskFixture::shared().sourceTree();
  const std::string other = tree + ".moved";
  bool moved = false;
  for (auto _ : state) {
    const std::string& from = moved ? other : tree;
    const std::string& to = moved ? tree : other;
    if (!SLFileManager::defaultManager().moveItemAtURL(fileURL(from, true), fileURL(to, true))) {
      state.SkipWithError("move failed");
      break;
    }
    moved = !moved;
  }
  if (moved && std::rename(other.c_str(), tree.c_str()) != 0) state.SkipWithError("moving the tree back failed");
}
BENCHMARK(BM_MoveTree);

// Each iteration removes a freshly built tree.
void BM_RemoveTree(benchmark::State& state) {
  slbench::ScratchDir scratch(parentOf(static_cast<int>(state.range(0))));
  const std::string tree = scratch.path() + "/tree";
  for (auto _ : state) {
    state.PauseTiming();
    slbench::makeTree(tree, kTreeFiles, kTreeDirectories, kSmallFileSize);
    state.ResumeTiming();
    if (!SLFileManager::defaultManager().removeItemAtURL(fileURL(tree, true))) {
      state.SkipWithError("removal failed");
      break;
    }
  }
  state.SetItemsProcessed(state.iterations() * kTreeFiles);
  state.SetLabel(state.range(0) == kShm ? "/dev/shm" : "disk");
}
BENCHMARK(BM_RemoveTree)->Arg(kShm)->Arg(kDisk)->Iterations(3)->Unit(benchmark::kMillisecond);

}  // namespace
