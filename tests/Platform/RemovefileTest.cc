#include "Platform/Removefile.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>
#include <utility>
#include <vector>

#include "Platform/UniqueFd.h"
#include "TestSupport/TestSupport.h"

namespace sl {
// Defined in Removefile.cc for tests only.
extern void (*removefile_test_hook_after_listing)(int dirFd, const char* path);
}  // namespace sl

namespace {

using sl::test::exists;
using sl::test::makeDirs;
using sl::test::makeSymlink;
using sl::test::writeFile;
using Reports = std::vector<std::pair<std::string, int>>;

struct Recorder {
  int answer = sl::REMOVEFILE_PROCEED;
  Reports seen;
};

int record(sl::removefile_state_t state, const char* path, void* context) {
  int err = -1;
  EXPECT_EQ(sl::removefile_state_get(state, sl::REMOVEFILE_STATE_ERRNO, &err), 0);
  auto* recorder = static_cast<Recorder*>(context);
  recorder->seen.emplace_back(path, err);
  return recorder->answer;
}

// Runs removefile with `recorder` as the callback (none when null); returns
// the result and, on failure, errno in *err.
int removeWith(const std::string& path, Recorder* recorder, int* err, sl::removefile_flags_t flags = sl::REMOVEFILE_RECURSIVE) {
  sl::removefile_state_t state = sl::removefile_state_alloc();
  if (recorder != nullptr) {
    sl::removefile_state_set(state, sl::REMOVEFILE_STATE_ERROR_CALLBACK, reinterpret_cast<const void*>(&record));
    sl::removefile_state_set(state, sl::REMOVEFILE_STATE_ERROR_CONTEXT, recorder);
  }
  int result = sl::removefile(path.c_str(), state, flags);
  *err = result != 0 ? errno : 0;
  sl::removefile_state_free(state);
  return result;
}

struct ScopedHook {
  explicit ScopedHook(void (*hook)(int, const char*)) { sl::removefile_test_hook_after_listing = hook; }
  ~ScopedHook() { sl::removefile_test_hook_after_listing = nullptr; }
};

TEST(Removefile, StateKeys) {
  sl::removefile_state_t state = sl::removefile_state_alloc();
  int marker = 0;
  void* context = nullptr;
  sl::removefile_callback_t callback = nullptr;
  int err = -1;
  EXPECT_EQ(sl::removefile_state_set(state, sl::REMOVEFILE_STATE_ERROR_CALLBACK, reinterpret_cast<const void*>(&record)), 0);
  EXPECT_EQ(sl::removefile_state_set(state, sl::REMOVEFILE_STATE_ERROR_CONTEXT, &marker), 0);
  EXPECT_EQ(sl::removefile_state_get(state, sl::REMOVEFILE_STATE_ERROR_CALLBACK, &callback), 0);
  EXPECT_EQ(sl::removefile_state_get(state, sl::REMOVEFILE_STATE_ERROR_CONTEXT, &context), 0);
  EXPECT_EQ(sl::removefile_state_get(state, sl::REMOVEFILE_STATE_ERRNO, &err), 0);
  EXPECT_EQ(callback, &record);
  EXPECT_EQ(context, &marker);
  EXPECT_EQ(err, 0);
  EXPECT_EQ(sl::removefile_state_set(state, sl::REMOVEFILE_STATE_ERRNO, &marker), -1);
  EXPECT_EQ(errno, EINVAL);
  EXPECT_EQ(sl::removefile_state_get(nullptr, sl::REMOVEFILE_STATE_ERRNO, &err), -1);
  EXPECT_EQ(errno, EINVAL);
  EXPECT_EQ(sl::removefile_state_free(state), 0);
  EXPECT_EQ(sl::removefile_state_free(nullptr), 0);
}

TEST(Removefile, TopLevelItems) {
  sl::test::TempDir dir;
  Recorder recorder;
  int err = 0;
  // A file, an empty directory, a link to a directory (its target stays).
  writeFile(dir / "file", "x");
  makeDirs(dir / "empty");
  makeDirs(dir / "target/kept");
  makeSymlink(dir / "target", dir / "link");
  for (const char* name : {"file", "empty", "link"}) {
    SCOPED_TRACE(name);
    EXPECT_EQ(removeWith(dir / name, nullptr, &err), 0);
    EXPECT_FALSE(exists(dir / name));
  }
  EXPECT_TRUE(exists(dir / "target/kept"));
  // Nothing there: ENOENT, and the callback is not called.
  EXPECT_EQ(removeWith(dir / "missing", &recorder, &err), -1);
  EXPECT_EQ(err, ENOENT);
  // A link named with a trailing slash is not followed to its directory.
  makeSymlink(dir / "target", dir / "link");
  EXPECT_EQ(removeWith(dir / "link/", &recorder, &err), -1);
  EXPECT_EQ(err, ENOTDIR);
  EXPECT_TRUE(exists(dir / "target/kept"));
  // Not recursive: a non-empty directory stays, through the error path.
  EXPECT_EQ(removeWith(dir / "target", nullptr, &err, 0), -1);
  EXPECT_EQ(err, ENOTEMPTY);
  EXPECT_EQ(removeWith(dir / "target", &recorder, &err, 0), 0);
  EXPECT_EQ(recorder.seen, (Reports{{dir / "target", ENOTEMPTY}}));
  EXPECT_TRUE(exists(dir / "target/kept"));
}

TEST(Removefile, LinksInsideTheTreeAreRemovedNotFollowed) {
  sl::test::TempDir dir;
  writeFile(dir / "outside/file", "keep");
  makeDirs(dir / "outside/dir/sub");
  makeSymlink(dir / "outside/file", dir / "tree/a/to-file");
  makeSymlink(dir / "outside/dir", dir / "tree/a/b/to-dir");
  makeSymlink(dir / "nowhere", dir / "tree/dangling");
  int err = 0;
  EXPECT_EQ(removeWith(dir / "tree", nullptr, &err), 0);
  EXPECT_FALSE(exists(dir / "tree"));
  EXPECT_EQ(sl::test::readFile(dir / "outside/file"), "keep");
  EXPECT_TRUE(exists(dir / "outside/dir/sub"));
}

struct ScopedFileLimit {
  explicit ScopedFileLimit(rlim_t soft) {
    getrlimit(RLIMIT_NOFILE, &saved);
    rlimit lowered = saved;
    lowered.rlim_cur = soft;
    EXPECT_EQ(setrlimit(RLIMIT_NOFILE, &lowered), 0);
  }
  ~ScopedFileLimit() { setrlimit(RLIMIT_NOFILE, &saved); }
  rlimit saved;
};

TEST(Removefile, DeepTreeWithFewDescriptors) {
  sl::test::TempDir dir(sl::test::TempDir::kShm);
  makeDirs(dir / "deep");
  sl::UniqueFd fd(open((dir / "deep").c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  for (int level = 0; level < 10000 && fd; ++level) {
    // Some levels keep a file beside the next directory, so the walk goes
    // back down from parents that it had to open again.
    if (level % 100 == 0) sl::UniqueFd(openat(fd.get(), "f", O_CREAT | O_WRONLY | O_CLOEXEC, 0644));
    ASSERT_EQ(mkdirat(fd.get(), "d", 0755), 0);
    fd = sl::UniqueFd(openat(fd.get(), "d", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  }
  ASSERT_TRUE(fd);
  fd.reset();
  int err = 0;
  {
    ScopedFileLimit limit(64);
    EXPECT_EQ(removeWith(dir / "deep", nullptr, &err), 0);
  }
  EXPECT_EQ(err, 0);
  EXPECT_FALSE(exists(dir / "deep"));
}

TEST(Removefile, FailingEntriesAreReported) {
  sl::test::TempDir dir;
  const std::string top = dir / "owned/top";
  auto build = [&] {
    makeDirs(top + "/a/locked");
    writeFile(top + "/a/locked/f");
    writeFile(top + "/a/file");
    makeDirs(top + "/b/c");
    makeDirs(top + "/empty-locked");
    for (const char* path : {"owned", "owned/top", "owned/top/a", "owned/top/a/locked", "owned/top/b",
                             "owned/top/b/c", "owned/top/empty-locked"}) {
      ASSERT_EQ(chown((dir / path).c_str(), sl::test::ScopedUnprivileged::kUid, sl::test::ScopedUnprivileged::kGid), 0);
    }
    chmod((top + "/a/locked").c_str(), 0);
    chmod((top + "/empty-locked").c_str(), 0);
  };
  int err = 0;
  // Report and go on: the locked directory, then each parent that it keeps
  // from being empty; an empty directory that cannot be opened still goes.
  build();
  Recorder recorder;
  {
    sl::test::ScopedUnprivileged nobody;
    EXPECT_EQ(removeWith(top, &recorder, &err), 0);
  }
  EXPECT_EQ(recorder.seen, (Reports{{top + "/a/locked", EACCES}, {top + "/a", ENOTEMPTY}, {top, ENOTEMPTY}}));
  EXPECT_FALSE(exists(top + "/a/file"));
  EXPECT_FALSE(exists(top + "/b"));
  EXPECT_FALSE(exists(top + "/empty-locked"));
  EXPECT_TRUE(exists(top + "/a/locked/f"));
  // STOP, and no callback at all: the first failure ends the walk.
  for (bool withCallback : {true, false}) {
    SCOPED_TRACE(withCallback);
    build();
    Recorder stopper{sl::REMOVEFILE_STOP, {}};
    sl::test::ScopedUnprivileged nobody;
    EXPECT_EQ(removeWith(top, withCallback ? &stopper : nullptr, &err), -1);
    EXPECT_EQ(err, EACCES);
    EXPECT_EQ(stopper.seen, withCallback ? (Reports{{top + "/a/locked", EACCES}}) : Reports{});
  }
}

// Hooks that change the tree right after the top directory was listed.
std::string gOutside;
void removeEntry(int dirFd, const char* path) {
  if (std::string(path).ends_with("/top")) ASSERT_EQ(unlinkat(dirFd, "gone", 0), 0);
}
void swapForLink(int dirFd, const char* path) {
  if (!std::string(path).ends_with("/top")) return;
  ASSERT_EQ(renameat(dirFd, "sub", AT_FDCWD, (gOutside + "/moved").c_str()), 0);
  ASSERT_EQ(symlinkat((gOutside + "/dir").c_str(), dirFd, "sub"), 0);
}
// Right after the deepest directory was listed, moves the whole chain away.
void moveChain(int, const char* path) {
  if (std::string(path).ends_with("/d39")) ASSERT_EQ(rename((gOutside + "/../top/d0").c_str(), (gOutside + "/d0").c_str()), 0);
}

TEST(Removefile, TreeChangedDuringTheWalk) {
  sl::test::TempDir dir;
  gOutside = dir / "outside";
  writeFile(dir / "outside/dir/precious", "keep");
  Recorder recorder;
  int err = 0;
  {
    SCOPED_TRACE("an entry vanishes: reported with ENOENT, the rest goes");
    writeFile(dir / "top/gone");
    writeFile(dir / "top/sub/file");
    ScopedHook hook(&removeEntry);
    EXPECT_EQ(removeWith(dir / "top", &recorder, &err), 0);
    EXPECT_EQ(recorder.seen, (Reports{{dir / "top/gone", ENOENT}}));
    EXPECT_FALSE(exists(dir / "top"));
  }
  {
    SCOPED_TRACE("a directory swapped for a link: the link goes, not its target");
    writeFile(dir / "top/sub/file");
    ScopedHook hook(&swapForLink);
    EXPECT_EQ(removeWith(dir / "top", nullptr, &err), 0);
    EXPECT_FALSE(exists(dir / "top"));
    EXPECT_EQ(sl::test::readFile(dir / "outside/dir/precious"), "keep");
    EXPECT_TRUE(exists(dir / "outside/moved/file"));
  }
  {
    SCOPED_TRACE("the tree moves away: the walk stops when an evicted parent is not where it was");
    std::string chain = dir / "top";
    for (int i = 0; i < 40; ++i) chain += "/d" + std::to_string(i);
    makeDirs(chain);
    ScopedHook hook(&moveChain);
    recorder.seen.clear();
    EXPECT_EQ(removeWith(dir / "top", &recorder, &err), -1);
    EXPECT_EQ(err, ESTALE);
    EXPECT_EQ(recorder.seen, Reports{});
    EXPECT_TRUE(exists(dir / "top"));
    EXPECT_TRUE(exists(dir / "outside/d0"));
    EXPECT_EQ(sl::test::readFile(dir / "outside/dir/precious"), "keep");
  }
}

}  // namespace
