#include <cerrno>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
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

  // A fifo without a writer opens at once (a hang here is the failure).
  ASSERT_EQ(::mkfifo((tmp / "fifo").c_str(), 0644), 0);
  EXPECT_EQ(classOf(tmp / "fifo"), 0);
  EXPECT_TRUE(log.installer().empty());
}

}  // namespace
