#include "Platform/Mkpath.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include "Platform/UniqueFd.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::test::exists;

int mkpath(const std::string& path, mode_t mode = 0755) { return sl::mkpath_np(path.c_str(), mode); }

mode_t modeOf(const std::string& path) {
  struct stat st {};
  EXPECT_EQ(lstat(path.c_str(), &st), 0) << path;
  return st.st_mode & 07777;
}

TEST(Mkpath, MakesMissingComponentsAndNamesWhatStands) {
  sl::test::TempDir tmp;
  ASSERT_FALSE(tmp.path().empty());  // else the paths below would be in "/"
  struct UmaskZero {
    mode_t old = umask(0);
    ~UmaskZero() { umask(old); }
  } umaskZero;

  // Made, every component with the mode; repeated and trailing slashes.
  EXPECT_EQ(mkpath(tmp / "a//b/c/", 0751), 0);
  for (const char* made : {"a", "a/b", "a/b/c"}) EXPECT_EQ(modeOf(tmp / made), 0751u) << made;
  EXPECT_EQ(mkpath(tmp / "a/b"), EEXIST);
  EXPECT_EQ(mkpath(tmp / "a/b/"), EEXIST);

  // A non-directory at the path or in the way.
  sl::test::writeFile(tmp / "file");
  EXPECT_EQ(mkpath(tmp / "file"), ENOTDIR);
  EXPECT_EQ(mkpath(tmp / "file/x/y"), ENOTDIR);

  // A link to a directory: passed through in the middle, a non-directory
  // at the end.
  sl::test::makeSymlink(tmp / "a", tmp / "link");
  EXPECT_EQ(mkpath(tmp / "link"), ENOTDIR);
  EXPECT_EQ(mkpath(tmp / "link/b/new/deeper"), 0);
  EXPECT_TRUE(exists(tmp / "a/b/new/deeper"));

  // Relative to the working directory.
  sl::UniqueFd cwd(open(".", O_PATH | O_DIRECTORY | O_CLOEXEC));
  ASSERT_EQ(chdir(tmp.path().c_str()), 0);
  EXPECT_EQ(mkpath("rel/x"), 0);
  ASSERT_EQ(fchdir(cwd.get()), 0);
  EXPECT_TRUE(exists(tmp / "rel/x"));

  // Other failures carry mkdir's errno.
  {
    sl::test::ScopedUnprivileged nobody;
    EXPECT_EQ(mkpath(tmp / "a/b/denied/x"), EACCES);
  }
  EXPECT_EQ(mkpath(""), ENOENT);
}

}  // namespace
