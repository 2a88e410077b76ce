#include <sys/stat.h>

#include <cerrno>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "Support/Errors.h"
#include "TestSupport/TestSupport.h"

namespace {

SLFileManager& fm() { return SLFileManager::defaultManager(); }
sl::URL url(const std::string& path) { return sl::URL::fileURLWithPath(path, false); }
int32_t classOf(const std::string& path) {  // -1 when it cannot be read
  int32_t protectionClass = -1;
  return fm().dataProtectionClassOfItemAtURL(url(path), &protectionClass) ? protectionClass : -1;
}

void expectPOSIXRecord(const sl::Error& err, int code, const std::string& message, const std::string& selector) {
  EXPECT_EQ(err.domain(), sl::kPOSIXErrorDomain);
  EXPECT_EQ(err.code(), code);
  EXPECT_EQ(err.localizedDescription().str(), message);
  EXPECT_EQ(err.userInfo().get(SLFunctionNameErrorKey).asString().str(), "-[SLFileManager " + selector + "]");
}

TEST(ProtectionClasses, ReadSetPredicateAndRefusals) {
  sl::test::TempDir tmp;
  sl::test::LogCapture log;
  sl::test::writeFile(tmp / "file");
  sl::test::makeDirs(tmp / "dir");
  EXPECT_EQ(classOf(tmp / "file"), 0);
  EXPECT_TRUE(fm().setDataProtectionClassOfItemAtURL(url(tmp / "file"), 4, nullptr));
  EXPECT_TRUE(fm().setDataProtectionClassOfItemAtURL(url(tmp / "dir"), 3, nullptr));
  EXPECT_EQ(classOf(tmp / "file"), 4);
  EXPECT_EQ(classOf(tmp / "dir"), 3);

  // The predicate sees the current class once; declining is a success, and
  // so is setting the class the item already has.
  std::vector<int32_t> seen;
  for (bool answer : {false, true}) {
    auto predicate = [&](int32_t current) { return seen.push_back(current), answer; };
    EXPECT_TRUE(fm().setDataProtectionClassOfItemAtURL(url(tmp / "file"), answer ? 4 : 2, predicate));
  }
  EXPECT_EQ(seen, (std::vector<int32_t>{4, 4}));
  EXPECT_EQ(classOf(tmp / "file"), 4);

  sl::Error err;
  EXPECT_FALSE(fm().setDataProtectionClassOfItemAtURL(url(tmp / "file"), 9, nullptr, &err));
  expectPOSIXRecord(err, EINVAL, "Failed to setclass(9) on file " + tmp / "file" + ": Invalid argument",
                    "setDataProtectionClassOfItemAtURL:toClass:ifPredicate:error:");

  // Never through a link: both operations fail at the open.
  sl::test::makeSymlink(tmp / "file", tmp / "link");
  const std::string refused = "Failed to open " + tmp / "link" + " : Too many levels of symbolic links";
  int32_t protectionClass;
  EXPECT_FALSE(fm().dataProtectionClassOfItemAtURL(url(tmp / "link"), &protectionClass, &err));
  expectPOSIXRecord(err, ELOOP, refused, "dataProtectionClassOfItemAtURL:class:error:");
  EXPECT_FALSE(fm().setDataProtectionClassOfItemAtURL(url(tmp / "link"), 5, nullptr, &err));
  expectPOSIXRecord(err, ELOOP, refused, "setDataProtectionClassOfItemAtURL:toClass:ifPredicate:error:");

  // A fifo without a writer opens at once (a hang here is the failure).
  ASSERT_EQ(::mkfifo((tmp / "fifo").c_str(), 0644), 0);
  EXPECT_EQ(classOf(tmp / "fifo"), 0);
  EXPECT_TRUE(log.installer().empty());
}

}  // namespace
