#include "Platform/AtomicFile.h"

#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>

#include <csignal>
#include <filesystem>
#include <set>

#include "TestSupport/TestSupport.h"

namespace sl {
namespace {

using test::TempDir;

std::span<const uint8_t> bytesOf(std::string_view s) { return {reinterpret_cast<const uint8_t*>(s.data()), s.size()}; }

std::set<std::string> entries(const std::string& dir) {
  std::set<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) names.insert(entry.path().filename());
  return names;
}

bool startsWith(const std::string& s, const std::string& prefix) { return s.compare(0, prefix.size(), prefix) == 0; }
bool endsWith(const std::string& s, const std::string& suffix) {
  return s.size() >= suffix.size() && s.compare(s.size() - suffix.size(), suffix.size(), suffix) == 0;
}

TEST(AtomicFileTest, WritesAndReplacesLeavingNoTemporaryFile) {
  TempDir dir;
  URL url = URL::fileURLWithPath(dir / "file", false);
  Error error;
  ASSERT_TRUE(writeFileAtomically(url, bytesOf("first"), 0640, &error)) << error.description();
  EXPECT_EQ(test::readFile(dir / "file"), "first");
  struct stat st;
  ASSERT_EQ(::stat((dir / "file").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0640u);  // exactly the mode, whatever the umask

  ASSERT_TRUE(writeFileAtomically(url, bytesOf("second, longer"), 0600, &error)) << error.description();
  EXPECT_EQ(test::readFile(dir / "file"), "second, longer");
  ASSERT_TRUE(writeFileAtomically(url, {}, 0644, &error)) << error.description();
  EXPECT_EQ(test::readFile(dir / "file"), "");
  EXPECT_EQ(entries(dir.path()), std::set<std::string>{"file"});

  // A name as long as a name can be still leaves room for the temporary one.
  std::string longName(255, 'n');
  ASSERT_TRUE(writeFileAtomically(URL::fileURLWithPath(dir / longName, false), bytesOf("x"), 0644, &error))
      << error.description();
  EXPECT_EQ(test::readFile(dir / longName), "x");

  EXPECT_FALSE(writeFileAtomically(URL::fileURLWithPath("/", true), bytesOf("x"), 0644, &error));
  EXPECT_TRUE(error.isPOSIX(EINVAL));
}

TEST(AtomicFileTest, FailureLeavesTheOldFileIntact) {
  TempDir dir;
  const std::string old(10000, 'o');
  test::writeFile(dir / "file", old);
  URL url = URL::fileURLWithPath(dir / "file", false);
  Error error;

  // A write that fails half-way: the file-size limit stops it at 4096 bytes.
  {
    struct rlimit saved;
    ASSERT_EQ(getrlimit(RLIMIT_FSIZE, &saved), 0);
    auto savedHandler = std::signal(SIGXFSZ, SIG_IGN);
    struct rlimit small = {4096, saved.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &small), 0);
    bool ok = writeFileAtomically(url, bytesOf(std::string(20000, 'n')), 0644, &error);
    setrlimit(RLIMIT_FSIZE, &saved);
    std::signal(SIGXFSZ, savedHandler);
    EXPECT_FALSE(ok);
  }
  EXPECT_TRUE(error.isPOSIX(EFBIG)) << error.description();
  std::string message = error.localizedDescription().str();
  EXPECT_TRUE(startsWith(message, "write of " + (dir / ".file.")) && endsWith(message, " failed: File too large"))
      << message;
  EXPECT_EQ(test::readFile(dir / "file"), old);
  EXPECT_EQ(entries(dir.path()), std::set<std::string>{"file"});

  // A directory the writer may not write into.
  {
    test::ScopedUnprivileged nobody;
    EXPECT_FALSE(writeFileAtomically(url, bytesOf("new"), 0644, &error));
  }
  EXPECT_TRUE(error.isPOSIX(EACCES)) << error.description();
  message = error.localizedDescription().str();
  EXPECT_TRUE(startsWith(message, "open of " + (dir / ".file.")) && endsWith(message, " failed: Permission denied"))
      << message;
  EXPECT_EQ(test::readFile(dir / "file"), old);
  EXPECT_EQ(entries(dir.path()), std::set<std::string>{"file"});

  // A directory in the way of the rename: the temporary file goes again.
  test::makeDirs(dir / "sub/occupied/inner");
  EXPECT_FALSE(writeFileAtomically(URL::fileURLWithPath(dir / "sub/occupied", false), bytesOf("x"), 0644, &error));
  EXPECT_TRUE(error.isPOSIX(EISDIR)) << error.description();
  EXPECT_TRUE(startsWith(error.localizedDescription().str(), "rename of " + (dir / "sub/.occupied.")));
  EXPECT_EQ(entries(dir / "sub"), std::set<std::string>{"occupied"});

  // No directory at all.
  EXPECT_FALSE(writeFileAtomically(URL::fileURLWithPath(dir / "missing/file", false), bytesOf("x"), 0644, &error));
  EXPECT_TRUE(error.isPOSIX(ENOENT));
  EXPECT_EQ(error.localizedDescription().str(), "open of " + (dir / "missing") + " failed: No such file or directory");
}

TEST(AtomicFileTest, SymbolicLinkDestinationIsReplacedNotWrittenThrough) {
  TempDir dir;
  test::writeFile(dir / "target", "keep");
  test::makeSymlink("target", dir / "link");
  test::makeSymlink("nowhere", dir / "dangling");
  Error error;
  for (const char* name : {"link", "dangling"}) {
    SCOPED_TRACE(name);
    ASSERT_TRUE(writeFileAtomically(URL::fileURLWithPath(dir / name, false), bytesOf("new"), 0644, &error))
        << error.description();
    struct stat st;
    ASSERT_EQ(::lstat((dir / name).c_str(), &st), 0);
    EXPECT_TRUE(S_ISREG(st.st_mode));
    EXPECT_EQ(test::readFile(dir / name), "new");
  }
  EXPECT_EQ(test::readFile(dir / "target"), "keep");
  EXPECT_FALSE(test::exists(dir / "nowhere"));
}

}  // namespace
}  // namespace sl
