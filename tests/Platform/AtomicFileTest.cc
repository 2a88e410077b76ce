#include "Platform/AtomicFile.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <csignal>
#include <filesystem>
#include <set>

#include "Platform/Mutations.h"
#include "Platform/Removefile.h"
#include "TestSupport/TestSupport.h"

namespace sl {
namespace {

namespace fs = std::filesystem;
using test::fileURL;
using test::readFile;
using test::TempDir;
using testing::AllOf, testing::EndsWith, testing::StartsWith;
using Names = std::set<std::string>;

std::span<const uint8_t> bytesOf(std::string_view s) { return {reinterpret_cast<const uint8_t*>(s.data()), s.size()}; }

Names entries(const std::string& dir) {
  Names names;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) names.insert(entry.path().filename());
  return names;
}

TEST(AtomicFileTest, WritesAndReplacesLeavingNoTemporaryFile) {
  TempDir dir;
  test::writeFile(dir / "target", "keep");
  test::makeSymlink("target", dir / "link");
  test::makeSymlink("nowhere", dir / "dangling");
  // Made and replaced by more and by nothing; links replaced, not written
  // through; a name as long as a name can be still leaves room for the
  // temporary one. The mode is exactly the one asked, whatever the umask.
  const std::string longName(255, 'n');
  Error error;
  for (const auto& [name, content] : std::vector<std::pair<std::string, std::string>>{
           {"file", "first"}, {"file", "second, longer"}, {"file", ""}, {"link", "new"}, {"dangling", "new"},
           {longName, "x"}}) {
    ASSERT_TRUE(writeFileAtomically(fileURL(dir / name), bytesOf(content), 0666, &error)) << error.description();
    EXPECT_EQ(readFile(dir / name), content);
    EXPECT_TRUE(fs::is_regular_file(fs::symlink_status(dir / name))) << name;
    EXPECT_EQ(fs::status(dir / name).permissions(), fs::perms(0666)) << name;
  }
  EXPECT_EQ(readFile(dir / "target"), "keep");
  EXPECT_EQ(entries(dir.path()), (Names{"dangling", "file", "link", "target", longName}));  // nothing else

  EXPECT_FALSE(writeFileAtomically(fileURL("/", true), bytesOf("x"), 0644, &error));
  EXPECT_TRUE(error.isPOSIX(EINVAL));
}

TEST(AtomicFileTest, FailureLeavesTheOldFileIntact) {
  TempDir dir;
  const std::string old(10000, 'o');
  test::writeFile(dir / "file", old);
  Error error;

  // A write that fails half-way: the file-size limit stops it at 4096 bytes.
  {
    struct rlimit saved;
    ASSERT_EQ(getrlimit(RLIMIT_FSIZE, &saved), 0);
    const struct rlimit small = {4096, saved.rlim_max};
    auto savedHandler = std::signal(SIGXFSZ, SIG_IGN);
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &small), 0);
    EXPECT_FALSE(writeFileAtomically(fileURL(dir / "file"), bytesOf(std::string(20000, 'n')), 0644, &error));
    setrlimit(RLIMIT_FSIZE, &saved);
    std::signal(SIGXFSZ, savedHandler);
  }
  EXPECT_TRUE(error.isPOSIX(EFBIG)) << error.description();
  EXPECT_THAT(error.localizedDescription().str(),
              AllOf(StartsWith("write of " + (dir / ".file.")), EndsWith(" failed: File too large")));
  EXPECT_EQ(readFile(dir / "file"), old);
  EXPECT_EQ(entries(dir.path()), Names{"file"});

  // A directory the writer may not write into.
  {
    test::ScopedUnprivileged nobody;
    EXPECT_FALSE(writeFileAtomically(fileURL(dir / "file"), bytesOf("new"), 0644, &error));
  }
  EXPECT_TRUE(error.isPOSIX(EACCES)) << error.description();
  EXPECT_THAT(error.localizedDescription().str(),
              AllOf(StartsWith("open of " + (dir / ".file.")), EndsWith(" failed: Permission denied")));
  EXPECT_EQ(readFile(dir / "file"), old);

  // A directory in the way of the rename: the temporary file goes again.
  test::makeDirs(dir / "sub/occupied/inner");
  EXPECT_FALSE(writeFileAtomically(fileURL(dir / "sub/occupied"), bytesOf("x"), 0644, &error));
  EXPECT_TRUE(error.isPOSIX(EISDIR)) << error.description();
  EXPECT_THAT(error.localizedDescription().str(), StartsWith("rename of " + (dir / "sub/.occupied.")));
  EXPECT_EQ(entries(dir / "sub"), Names{"occupied"});

  // No directory at all.
  EXPECT_FALSE(writeFileAtomically(fileURL(dir / "missing/file"), bytesOf("x"), 0644, &error));
  test::expectPOSIXRecord(error, ENOENT, "open of " + (dir / "missing") + " failed: No such file or directory",
                          nullptr);
}


// Counts flushes (and fails the Nth with EIO) through the mutation layer's
// plan, which counts only the kinds it names.
TEST(AtomicFileTest, DeferredFlushesWaitForWhatDependsOnThem) {
  if (!mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  TempDir disk, shm(TempDir::kShm);
  test::writeFile(disk / "old", "old");
  test::writeFile(disk / "doomed", "x");
  test::writeFile(disk / "second", "x");
  ASSERT_EQ(mkdir((disk / "empty").c_str(), 0755), 0);
  auto syncs = [](const char* plan = "EIO@1000:sync") { ASSERT_TRUE(mut::setPlanForTesting(plan)); };
  Error error;

  syncs();
  ASSERT_TRUE(syncDirectory(disk.path()));
  EXPECT_EQ(mut::matchedCount(), 1u) << "flushed at once outside a scope";
  {
    DeferredSyncs outer;
    syncs();
    {
      DeferredSyncs inner;
      ASSERT_TRUE(syncDirectory(disk.path()) && syncParentDirectory(disk / "old") && syncDirectory(shm.path()));
      EXPECT_EQ(mut::matchedCount(), 0u);
      // The content is flushed before its name, new or replaced; the
      // directory waits.
      ASSERT_TRUE(writeFileAtomically(fileURL(disk / "new"), bytesOf("new"), 0644, &error)) << error.description();
      ASSERT_TRUE(writeFileAtomically(fileURL(disk / "old"), bytesOf("newer"), 0644, &error)) << error.description();
      EXPECT_EQ(mut::matchedCount(), 2u);
      {
        DeferredSyncs scratch(DeferredSyncs::What::kDirectoriesAndContent);
        ASSERT_TRUE(writeFileAtomically(fileURL(disk / "scratch"), bytesOf("s"), 0644, &error));
      }
      ASSERT_TRUE(writeFileAtomically(fileURL(disk / "new"), bytesOf("new"), 0644, &error));
      EXPECT_EQ(mut::matchedCount(), 3u) << "only a scratch file's content waits, and only in its scope";
      EXPECT_EQ(syncDirectory(disk / "missing", &error), false);
      EXPECT_EQ(error.localizedDescription().str(), "open of " + (disk / "missing") + " failed: No such file or directory");
    }
    EXPECT_TRUE(deferredSyncsPending()) << "the inner scope leaves the flush to the outer one";

    // An empty directory goes without a flush; anything else waits for one
    // per file system, and stays when that fails.
    syncs("EIO@1:sync");
    ASSERT_EQ(removefile((disk / "empty").c_str(), nullptr, 0), 0);
    EXPECT_EQ(mut::matchedCount(), 0u);
    errno = 0;
    EXPECT_EQ(removefile((disk / "doomed").c_str(), nullptr, 0), -1);
    EXPECT_EQ(errno, EIO);
    EXPECT_EQ(readFile(disk / "doomed"), "x");
    EXPECT_TRUE(deferredSyncsPending());
    syncs("EIO@1:sync");
    EXPECT_FALSE(flushDeferredSyncs(&error));
    EXPECT_TRUE(error.isPOSIX(EIO));
    EXPECT_THAT(error.localizedDescription().str(), AllOf(StartsWith("syncfs of "), EndsWith(" failed: Input/output error")));
    syncs();
    ASSERT_EQ(removefile((disk / "doomed").c_str(), nullptr, 0), 0);
    EXPECT_EQ(mut::matchedCount(), 2u) << "one syncfs for each file system";
    EXPECT_TRUE(deferredSyncsPending()) << "the removal's own flush waits too";
    EXPECT_FALSE(deferredSyncsPending(Pending::kBesidesRemovals));
    ASSERT_EQ(removefile((disk / "second").c_str(), nullptr, 0), 0);
    EXPECT_EQ(mut::matchedCount(), 2u) << "a removal does not wait for another";
    EXPECT_TRUE(flushDeferredSyncs(&error));
    EXPECT_EQ(mut::matchedCount(), 3u);

    ASSERT_TRUE(syncDirectory(shm.path()));
  }
  EXPECT_EQ(mut::matchedCount(), 4u) << "the outermost scope flushes what is left";
  EXPECT_FALSE(deferredSyncsPending());
  EXPECT_EQ(readFile(disk / "new"), "new");
  EXPECT_EQ(readFile(disk / "scratch"), "s");
  EXPECT_EQ(readFile(disk / "old"), "newer");
  mut::setPlanForTesting("");
}

}  // namespace
}  // namespace sl
