#include <sys/stat.h>

#include <cerrno>
#include <string>

#include <gtest/gtest.h>

#include "Platform/ExtendedAttributes.h"
#include "Platform/Lchmod.h"
#include "TestSupport/TestSupport.h"

// Names, NOFOLLOW and the stored form are exercised through SLFileManager's
// bundle markers; here the names kept as they are and the creation flags.
TEST(ExtendedAttributes, NamespacesAndCreationFlags) {
  for (const char* name : {"user.a", "trusted.a", "security.a", "system.posix_acl_access"}) {
    EXPECT_EQ(sl::linuxAttributeName(name), name);
  }
  EXPECT_EQ(sl::linuxAttributeName("userx"), "user.userx");

  sl::test::TempDir tmp;
  sl::test::writeFile(tmp / "file");
  const std::string file = tmp / "file";
  const char* path = file.c_str();
  errno = 0;
  EXPECT_EQ(sl::setxattr(path, "a", "x", 1, 0, sl::XATTR_REPLACE), -1);
  EXPECT_EQ(errno, sl::ENOATTR);
  EXPECT_EQ(sl::setxattr(path, "a", "x", 1, 0, sl::XATTR_CREATE), 0);
  errno = 0;
  EXPECT_EQ(sl::setxattr(path, "a", "x", 1, 0, sl::XATTR_CREATE), -1);
  EXPECT_EQ(errno, EEXIST);
}

TEST(Lchmod, LinksLeftOthersChanged) {
  sl::test::TempDir tmp;
  sl::test::writeFile(tmp / "file", "", 0644);
  sl::test::makeSymlink(tmp / "file", tmp / "link");
  struct stat st;
  EXPECT_EQ(sl::lchmod((tmp / "link").c_str(), 0600), 0);
  ASSERT_EQ(::stat((tmp / "file").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  EXPECT_EQ(sl::lchmod((tmp / "file").c_str(), 0600), 0);
  ASSERT_EQ(::stat((tmp / "file").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0600u);
}
