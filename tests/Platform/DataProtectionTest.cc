#include <fcntl.h>
#include <sys/xattr.h>

#include <cerrno>
#include <string>

#include <gtest/gtest.h>

#include "Platform/DataProtection.h"
#include "Platform/UniqueFd.h"
#include "TestSupport/TestSupport.h"

// Reading and setting are exercised through SLFileManager; here the stored
// form, and stored values that this code never writes.
TEST(DataProtection, StoredForm) {
  sl::test::TempDir tmp;
  sl::test::writeFile(tmp / "file");
  sl::UniqueFd fd(::open((tmp / "file").c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_EQ(sl::protectionClassFcntl(fd.get(), sl::F_SETPROTECTIONCLASS, 7), 0);
  char stored[8];
  ASSERT_EQ(::fgetxattr(fd.get(), sl::kProtectionClassAttribute, stored, sizeof stored), 4);
  EXPECT_EQ(std::string(stored, 4), std::string("\7\0\0\0", 4));

  for (const std::string& value : {std::string("\4", 1), std::string("\x09\0\0\0", 4), std::string(9, '\1')}) {
    ASSERT_EQ(::fsetxattr(fd.get(), sl::kProtectionClassAttribute, value.data(), value.size(), 0), 0);
    errno = 0;
    EXPECT_EQ(sl::protectionClassFcntl(fd.get(), sl::F_GETPROTECTIONCLASS), -1) << value.size();
    EXPECT_EQ(errno, EINVAL);
  }
}
