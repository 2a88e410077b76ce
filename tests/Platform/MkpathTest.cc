#include "Platform/Mkpath.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <string>

#include "Platform/UniqueFd.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::test::exists;

int mkpath(const std::string& path, mode_t mode = 0755) { return sl::mkpath_np(path.c_str(), mode); }

TEST(Mkpath, MakesMissingComponentsAndNamesWhatStands) {
  sl::test::TempDir tmp;
  struct UmaskZero {
    mode_t old = umask(0);
    ~UmaskZero() { umask(old); }
  } umaskZero;

  // Made, every component with the mode; repeated and trailing slashes.
  EXPECT_EQ(mkpath(tmp / "a//b/c/", 0751), 0);
  for (const char* made : {"a", "a/b", "a/b/c"})
    EXPECT_EQ(std::filesystem::symlink_status(tmp / made).permissions(), std::filesystem::perms(0751)) << made;

  // Something at the path, a non-directory in the way, a link to a
  // directory (passed through in the middle, a non-directory at the end).
  sl::test::writeFile(tmp / "file");
  sl::test::makeSymlink(tmp / "a", tmp / "link");
  const std::pair<std::string, int> cases[] = {
      {tmp / "a/b", EEXIST},   {tmp / "a/b/", EEXIST},           {tmp / "file", ENOTDIR}, {tmp / "file/x/y", ENOTDIR},
      {tmp / "link", ENOTDIR}, {tmp / "link/b/new/deeper", 0}, {"", ENOENT}};
  for (const auto& [path, expected] : cases) EXPECT_EQ(mkpath(path), expected) << path;
  EXPECT_TRUE(exists(tmp / "a/b/new/deeper"));

  // Relative to the working directory.
  sl::UniqueFd cwd(open(".", O_PATH | O_DIRECTORY | O_CLOEXEC));
  ASSERT_EQ(chdir(tmp.path().c_str()), 0);
  EXPECT_EQ(mkpath("rel/x"), 0);
  ASSERT_EQ(fchdir(cwd.get()), 0);
  EXPECT_TRUE(exists(tmp / "rel/x"));

  // Other failures carry mkdir's errno.
  sl::test::ScopedUnprivileged nobody;
  EXPECT_EQ(mkpath(tmp / "a/b/denied/x"), EACCES);
}

}  // namespace
