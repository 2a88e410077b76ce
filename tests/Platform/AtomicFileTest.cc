#include "Platform/AtomicFile.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <csignal>
#include <filesystem>
#include <set>

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

}  // namespace
}  // namespace sl
