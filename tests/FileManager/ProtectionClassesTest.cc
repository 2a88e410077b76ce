#include <sys/xattr.h>

#include <cerrno>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "Platform/DataProtection.h"
#include "TestSupport/TestSupport.h"

namespace {

using namespace sl::test;

constexpr char kGet[] = "-[SLFileManager dataProtectionClassOfItemAtURL:class:error:]";
constexpr char kSet[] = "-[SLFileManager setDataProtectionClassOfItemAtURL:toClass:ifPredicate:error:]";

SLFileManager& fm() { return SLFileManager::defaultManager(); }
int32_t classOf(const std::string& path) {  // -1 when it cannot be read
  int32_t protectionClass = -1;
  return fm().dataProtectionClassOfItemAtURL(fileURL(path), &protectionClass) ? protectionClass : -1;
}

TEST(ProtectionClasses, ReadSetPredicateAndRefusals) {
  TempDir tmp;
  LogCapture log;
  writeFile(tmp / "file");
  makeDirs(tmp / "dir");
  EXPECT_EQ(classOf(tmp / "file"), 0);
  EXPECT_TRUE(fm().setDataProtectionClassOfItemAtURL(fileURL(tmp / "file"), 4, nullptr));
  EXPECT_TRUE(fm().setDataProtectionClassOfItemAtURL(fileURL(tmp / "dir"), 3, nullptr));
  EXPECT_EQ(classOf(tmp / "dir"), 3);
  // The predicate sees the current class once (4, as set above); declining is
  // a success, and so is setting the class the item already has.
  std::vector<int32_t> seen;
  for (bool answer : {false, true}) {
    auto predicate = [&](int32_t current) { return seen.push_back(current), answer; };
    EXPECT_TRUE(fm().setDataProtectionClassOfItemAtURL(fileURL(tmp / "file"), answer ? 4 : 2, predicate));
  }
  EXPECT_EQ(seen, (std::vector<int32_t>{4, 4}));
  EXPECT_EQ(classOf(tmp / "file"), 4);

  sl::Error err;
  EXPECT_FALSE(fm().setDataProtectionClassOfItemAtURL(fileURL(tmp / "file"), 9, nullptr, &err));
  expectPOSIXRecord(err, EINVAL, "Failed to setclass(9) on file " + tmp / "file" + ": Invalid argument", kSet);

  // Never through a link: both operations fail at the open.
  makeSymlink(tmp / "file", tmp / "link");
  const std::string refused = "Failed to open " + tmp / "link" + " : Too many levels of symbolic links";
  int32_t protectionClass;
  EXPECT_FALSE(fm().dataProtectionClassOfItemAtURL(fileURL(tmp / "link"), &protectionClass, &err));
  expectPOSIXRecord(err, ELOOP, refused, kGet);
  EXPECT_FALSE(fm().setDataProtectionClassOfItemAtURL(fileURL(tmp / "link"), 5, nullptr, &err));
  expectPOSIXRecord(err, ELOOP, refused, kSet);

  // A class attribute that this code did not write (a value out of range, a
  // wrong length) is no class: reading fails, and so does a conditional set,
  // before its predicate is asked and without touching the attribute.
  for (const std::string& stored : {std::string("\x09\0\0\0", 4), std::string("\x04\0", 2)}) {
    SCOPED_TRACE(stored.size());
    ASSERT_EQ(setxattr((tmp / "file").c_str(), sl::kProtectionClassAttribute, stored.data(), stored.size(), 0), 0);
    const std::string bad = "Failed to getclass of file " + tmp / "file" + ": Invalid argument";
    EXPECT_FALSE(fm().dataProtectionClassOfItemAtURL(fileURL(tmp / "file"), &protectionClass, &err));
    expectPOSIXRecord(err, EINVAL, bad, kGet);
    bool asked = false;
    EXPECT_FALSE(fm().setDataProtectionClassOfItemAtURL(
        fileURL(tmp / "file"), 2, [&](int32_t) { return asked = true; }, &err));
    expectPOSIXRecord(err, EINVAL, bad, kSet);
    EXPECT_FALSE(asked);
    char now[8] = {};
    EXPECT_EQ(getxattr((tmp / "file").c_str(), sl::kProtectionClassAttribute, now, sizeof now), ssize_t(stored.size()));
    EXPECT_EQ(std::string(now, stored.size()), stored);
  }

  // A fifo without a writer opens at once (a hang here is the failure).
  ASSERT_EQ(::mkfifo((tmp / "fifo").c_str(), 0644), 0);
  EXPECT_EQ(classOf(tmp / "fifo"), 0);
  EXPECT_TRUE(log.installer().empty());
}

}  // namespace
