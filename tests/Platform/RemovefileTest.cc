#include "Platform/Removefile.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cerrno>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <tuple>
#include <vector>

#include "Platform/Mutations.h"
#include "Platform/UniqueFd.h"
#include "TestSupport/TestSupport.h"

namespace sl {
// Defined in Removefile.cc for tests only.
extern void (*removefile_test_hook_after_listing)(int dirFd, const char* path);
}  // namespace sl

namespace {

using sl::test::exists, sl::test::makeDirs, sl::test::makeSymlink, sl::test::readFile, sl::test::writeFile;
using Reports = std::vector<std::pair<std::string, int>>;
// removefile's result, errno when it failed (else 0), and the (path, errno)
// pairs that the callback saw.
using Outcome = std::tuple<int, int, Reports>;
constexpr int kNoCallback = -1;

struct Calls {
  int answer;
  std::atomic<int> inside{0};
  bool overlapped = false;
  Reports reports{};
};

int record(sl::removefile_state_t state, const char* path, void* context) {
  auto* calls = static_cast<Calls*>(context);
  if (calls->inside.fetch_add(1) != 0) calls->overlapped = true;
  int err = -1;
  EXPECT_EQ(sl::removefile_state_get(state, sl::REMOVEFILE_STATE_ERRNO, &err), 0);
  calls->reports.emplace_back(path, err);
  std::this_thread::sleep_for(std::chrono::milliseconds(2));  // widens the window for an overlap
  calls->inside.fetch_sub(1);
  return calls->answer;
}

// Removes path with a callback that answers `answer` (or without one); the
// callbacks must come one at a time.
Outcome removeWith(const std::string& path, int answer = sl::REMOVEFILE_PROCEED,
                   sl::removefile_flags_t flags = sl::REMOVEFILE_RECURSIVE) {
  std::unique_ptr<sl::removefile_state, int (*)(sl::removefile_state_t)> state(sl::removefile_state_alloc(),
                                                                               &sl::removefile_state_free);
  Calls calls{answer};
  if (answer != kNoCallback) {
    sl::removefile_state_set(state.get(), sl::REMOVEFILE_STATE_ERROR_CALLBACK, reinterpret_cast<const void*>(&record));
    sl::removefile_state_set(state.get(), sl::REMOVEFILE_STATE_ERROR_CONTEXT, &calls);
  }
  const int result = sl::removefile(path.c_str(), state.get(), flags);
  const int err = result != 0 ? errno : 0;
  EXPECT_FALSE(calls.overlapped) << "callbacks overlapped";
  return {result, err, calls.reports};
}

// Runs `hook` right after each directory of the walk is listed, while alive.
std::function<void(int, const char*)> gHook;
struct ScopedHook {
  explicit ScopedHook(std::function<void(int, const char*)> hook) {
    gHook = std::move(hook);
    sl::removefile_test_hook_after_listing = [](int fd, const char* path) { gHook(fd, path); };
  }
  ~ScopedHook() { sl::removefile_test_hook_after_listing = nullptr; }
};

TEST(Removefile, TopLevelItemsAndLinks) {
  sl::test::TempDir dir;
  // A file, a link to a directory, and a tree of links to outside items:
  // all go, no link target is touched.
  writeFile(dir / "file");
  writeFile(dir / "target/kept");
  writeFile(dir / "outside", "keep");
  makeSymlink(dir / "target", dir / "link");
  makeSymlink(dir / "outside", dir / "tree/a/to-file");
  makeSymlink(dir / "target", dir / "tree/a/b/to-dir");
  makeSymlink(dir / "nowhere", dir / "tree/dangling");
  for (const char* name : {"file", "link", "tree"}) {
    EXPECT_EQ(removeWith(dir / name), (Outcome{0, 0, {}})) << name;
    EXPECT_FALSE(exists(dir / name)) << name;
  }
  EXPECT_TRUE(exists(dir / "target/kept"));
  EXPECT_EQ(readFile(dir / "outside"), "keep");
  // Nothing there: ENOENT without a callback. A link named with a trailing
  // slash is not followed to its directory. Not recursive: a non-empty
  // directory stays, through the error path.
  makeSymlink(dir / "target", dir / "link");
  EXPECT_EQ(removeWith(dir / "missing"), (Outcome{-1, ENOENT, {}}));
  EXPECT_EQ(removeWith(dir / "link/"), (Outcome{-1, ENOTDIR, {}}));
  EXPECT_EQ(removeWith(dir / "target", kNoCallback, 0), (Outcome{-1, ENOTEMPTY, {}}));
  EXPECT_EQ(removeWith(dir / "target", sl::REMOVEFILE_PROCEED, 0), (Outcome{0, 0, {{dir / "target", ENOTEMPTY}}}));
  EXPECT_TRUE(exists(dir / "target/kept"));
}

TEST(Removefile, DeepTreeWithFewDescriptors) {
  sl::test::TempDir dir(sl::test::TempDir::kShm);
  makeDirs(dir / "deep");
  sl::UniqueFd fd(open((dir / "deep").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  for (int level = 0; level < 10000 && fd; ++level) {
    // Files beside some directories: the walk goes back down from parents
    // that it had to open again.
    ASSERT_TRUE(level % 100 != 0 || sl::UniqueFd(openat(fd.get(), "f", O_CREAT | O_WRONLY | O_CLOEXEC, 0644)));
    ASSERT_EQ(mkdirat(fd.get(), "d", 0755), 0);
    fd = sl::UniqueFd(openat(fd.get(), "d", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  }
  ASSERT_TRUE(fd);
  fd.reset();
  rlimit saved;
  ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &saved), 0);
  const rlimit lowered = {64, saved.rlim_max};
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &lowered), 0);
  Outcome outcome = removeWith(dir / "deep", kNoCallback);
  ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &saved), 0);
  EXPECT_EQ(outcome, (Outcome{0, 0, {}}));
  EXPECT_FALSE(exists(dir / "deep"));
}

TEST(Removefile, FailingEntriesAreReported) {
  sl::test::TempDir dir;
  ASSERT_EQ(chown(dir.path().c_str(), sl::test::ScopedUnprivileged::kUid, sl::test::ScopedUnprivileged::kGid), 0);
  const std::string top = dir / "proceed";
  {
    sl::test::ScopedUnprivileged nobody;
    for (const std::string& tree : {top, dir / "stop", dir / "none"}) {
      writeFile(tree + "/a/locked/f");
      writeFile(tree + "/a/file");
      makeDirs(tree + "/b/c");
      makeDirs(tree + "/empty-locked", 0);
      ASSERT_EQ(chmod((tree + "/a/locked").c_str(), 0), 0);
    }
    // Report and go on: the directory that cannot be opened, then each
    // parent that it keeps from being empty. An empty one that cannot be
    // opened goes.
    EXPECT_EQ(removeWith(top),
              (Outcome{0, 0, {{top + "/a/locked", EACCES}, {top + "/a", ENOTEMPTY}, {top, ENOTEMPTY}}}));
    // STOP, or no callback at all: the first failure ends the walk.
    EXPECT_EQ(removeWith(dir / "stop", sl::REMOVEFILE_STOP), (Outcome{-1, EACCES, {{dir / "stop/a/locked", EACCES}}}));
    EXPECT_EQ(removeWith(dir / "none", kNoCallback), (Outcome{-1, EACCES, {}}));
  }
  for (const char* gone : {"/a/file", "/b", "/empty-locked"}) EXPECT_FALSE(exists(top + gone)) << gone;
  EXPECT_TRUE(exists(top + "/a/locked/f"));
}

// What a removal freed is on disk when it returns: the parent's entries
// after a whole removal, the file system after one in part. A flush that
// fails fails a removal that had succeeded (which stands).
TEST(Removefile, RemovalsAreDurableWhenTheyReturn) {
  if (!sl::mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  sl::test::TempDir dir;
  ASSERT_EQ(chown(dir.path().c_str(), sl::test::ScopedUnprivileged::kUid, sl::test::ScopedUnprivileged::kGid), 0);
  sl::test::ScopedUnprivileged nobody;
  writeFile(dir / "tree/a/f");
  writeFile(dir / "file");
  writeFile(dir / "part/locked/f");
  writeFile(dir / "part/free");
  ASSERT_EQ(chmod((dir / "part/locked").c_str(), 0), 0);
  auto syncs = [](const char* plan) { ASSERT_TRUE(sl::mut::setPlanForTesting(plan)); };

  syncs("EIO@1000:sync");
  EXPECT_EQ(removeWith(dir / "tree"), (Outcome{0, 0, {}}));
  EXPECT_EQ(sl::mut::matchedCount(), 1u);
  EXPECT_EQ(removeWith(dir / "part", sl::REMOVEFILE_STOP), (Outcome{-1, EACCES, {{dir / "part/locked", EACCES}}}));
  EXPECT_EQ(sl::mut::matchedCount(), 2u);

  syncs("EIO@1:sync");
  EXPECT_EQ(removeWith(dir / "file"), (Outcome{-1, EIO, {}}));
  EXPECT_FALSE(exists(dir / "file"));
  syncs("EIO@1:sync");
  EXPECT_EQ(removeWith(dir / "part"), (Outcome{-1, EIO, {{dir / "part/locked", EACCES}, {dir / "part", ENOTEMPTY}}}));
  EXPECT_FALSE(exists(dir / "part/free"));
  syncs("");
  ASSERT_EQ(chmod((dir / "part/locked").c_str(), 0755), 0);
}

TEST(Removefile, TreeChangedDuringTheWalk) {
  sl::test::TempDir dir;
  const std::string top = dir / "top";
  writeFile(dir / "outside/precious", "keep");
  // An entry that vanishes is reported with ENOENT; the rest goes.
  writeFile(top + "/gone");
  writeFile(top + "/sub/file");
  {
    ScopedHook hook([&](int fd, const char* path) { EXPECT_TRUE(path != top || unlinkat(fd, "gone", 0) == 0); });
    EXPECT_EQ(removeWith(top), (Outcome{0, 0, {{top + "/gone", ENOENT}}}));
  }
  // A directory swapped for a link: the link goes, its target stays.
  writeFile(top + "/sub/file");
  {
    ScopedHook hook([&](int fd, const char* path) {
      if (path != top) return;
      EXPECT_EQ(renameat(fd, "sub", AT_FDCWD, (dir / "moved").c_str()), 0);
      EXPECT_EQ(symlinkat((dir / "outside").c_str(), fd, "sub"), 0);
    });
    EXPECT_EQ(removeWith(top), (Outcome{0, 0, {}}));
  }
  EXPECT_FALSE(exists(top));
  EXPECT_EQ(readFile(dir / "outside/precious"), "keep");
  EXPECT_TRUE(exists(dir / "moved/file"));
  // The tree moves while the walk is deep inside: the evicted parent that
  // ".." now leads to is not the one recorded, and the walk stops there
  // instead of removing d0 from wherever it now stands.
  std::string chain = top;
  for (int i = 0; i < 40; ++i) chain += "/d" + std::to_string(i);
  makeDirs(chain);
  {
    ScopedHook hook([&](int, const char* path) {
      EXPECT_TRUE(path != chain || rename((top + "/d0").c_str(), (dir / "d0").c_str()) == 0);
    });
    EXPECT_EQ(removeWith(top), (Outcome{-1, ESTALE, {}}));
  }
  EXPECT_TRUE(exists(top));
  EXPECT_TRUE(exists(dir / "d0"));
}

// A tree large enough to be walked by several threads: the callbacks come
// one at a time, each directory is reported after what kept it from being
// empty, links lead nowhere, and a STOP ends every thread's walk.
TEST(Removefile, LargeTreeWalkedInParallel) {
  sl::test::TempDir dir(sl::test::TempDir::kShm);
  ASSERT_EQ(chown(dir.path().c_str(), sl::test::ScopedUnprivileged::kUid, sl::test::ScopedUnprivileged::kGid), 0);
  writeFile(dir / "outside/precious", "keep");
  sl::test::ScopedUnprivileged nobody;
  // Enough entries at the top that the walk turns parallel at once.
  auto build = [&](const std::string& top) {
    for (int f = 0; f < 520; ++f) writeFile(top + "/t" + std::to_string(f));
    for (int d = 0; d < 40; ++d) {
      const std::string sub = top + "/d" + std::to_string(d) + "/e/f";
      for (int f = 0; f < 24; ++f) writeFile(sub + "/" + std::to_string(f));
      makeSymlink(dir / "outside", sub + "/link");
      if (d % 10 == 7) {
        writeFile(sub + "/locked/kept");
        ASSERT_EQ(chmod((sub + "/locked").c_str(), 0), 0);
      }
    }
  };
  build(dir / "proceed");
  build(dir / "stop");

  const std::string top = dir / "proceed";
  const auto [result, err, reports] = removeWith(top);
  EXPECT_EQ(std::pair(result, err), std::pair(0, 0));
  // Each locked directory, then each of its ancestors up to the top, which
  // comes last.
  Reports expected;
  for (int d : {7, 17, 27, 37}) {
    const std::string sub = top + "/d" + std::to_string(d);
    for (const std::string& path : {sub + "/e/f/locked", sub + "/e/f", sub + "/e", sub})
      expected.emplace_back(path, path.ends_with("locked") ? EACCES : ENOTEMPTY);
  }
  Reports sorted = reports;
  ASSERT_FALSE(sorted.empty());
  EXPECT_EQ(sorted.back(), (std::pair<std::string, int>(top, ENOTEMPTY)));
  sorted.pop_back();
  std::sort(sorted.begin(), sorted.end());
  std::sort(expected.begin(), expected.end());
  EXPECT_EQ(sorted, expected);
  for (size_t i = 0; i < reports.size(); ++i) {
    for (size_t j = i + 1; j < reports.size(); ++j)
      EXPECT_FALSE(reports[j].first.starts_with(reports[i].first + "/")) << "parent reported first";
  }
  EXPECT_TRUE(exists(top + "/d37/e/f/locked"));
  for (const char* gone : {"/d0", "/d37/e/f/0", "/d37/e/f/link"}) EXPECT_FALSE(exists(top + gone)) << gone;
  EXPECT_EQ(readFile(dir / "outside/precious"), "keep");

  // Several threads may meet a locked directory at once; the callback hears
  // of the first only, and the others stop without asking.
  const auto [stopResult, stopErr, stopReports] = removeWith(dir / "stop", sl::REMOVEFILE_STOP);
  EXPECT_EQ(std::pair(stopResult, stopErr), std::pair(-1, EACCES));
  ASSERT_EQ(stopReports.size(), 1u);
  EXPECT_TRUE(stopReports[0].first.ends_with("/e/f/locked")) << stopReports[0].first;
  EXPECT_EQ(stopReports[0].second, EACCES);
}

}  // namespace
