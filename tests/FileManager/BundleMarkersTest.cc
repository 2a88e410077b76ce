#include <sys/xattr.h>

#include <cerrno>
#include <cstdint>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "Support/Errors.h"
#include "TestSupport/TestSupport.h"

namespace {

using namespace sl::test;

SLFileManager& fm() { return SLFileManager::defaultManager(); }
std::string linuxName(const char* name) { return std::string("user.com.vantor.stowd.") + name; }
void rawSet(const std::string& path, const char* name, const std::string& value) {
  ASSERT_EQ(::setxattr(path.c_str(), linuxName(name).c_str(), value.data(), value.size(), 0), 0);
}
std::string rawGet(const std::string& path, const char* name) {
  char buffer[16];
  ssize_t n = ::lgetxattr(path.c_str(), linuxName(name).c_str(), buffer, sizeof buffer);
  return n < 0 ? "errno " + std::to_string(errno) : std::string(buffer, static_cast<size_t>(n));
}

// A code-4 record made by `selector`, whose underlying record (if any) is the
// bare POSIX record of `underlying`, and the one error line logged for it.
void expectLoggedRecord(const sl::Error& err, LogCapture& log, const std::string& selector, const std::string& message,
                        int underlying) {
  const std::string function = "-[SLFileManager " + selector + "]";
  expectRecord(err, SLInstallerErrorDomain, kSLInstallerFileSystemError, message, function.c_str());
  EXPECT_EQ(err.underlyingError(), underlying != 0 ? sl::Error::posix(underlying) : sl::Error());
  std::string line = err.userInfo().get(SLSourceFileLineErrorKey).description() + ": " + message;
  if (underlying != 0) line += " (" + sl::Error::posix(underlying).description() + ")";
  EXPECT_EQ(log.installer(), (std::vector<LogCapture::Line>{installerLine(3, function.c_str(), line)}));
  log.clear();
}

TEST(BundleMarkers, PlaceholderAndInstallType) {
  TempDir tmp;
  const sl::URL bundle = fileURL(tmp / "A.app", true);
  makeDirs(bundle.path());
  EXPECT_TRUE(fm().markBundleAsPlaceholder(bundle));
  EXPECT_EQ(rawGet(bundle.path(), "placeholder"), std::string("\1\0\0\0", 4));
  for (size_t size : {4, 1, 8}) {  // only the length counts
    rawSet(bundle.path(), "placeholder", std::string(size, '\0'));
    EXPECT_EQ(fm().bundleAtURLIsPlaceholder(bundle), size == 4) << size;
  }

  LogCapture log;
  sl::Error err;
  // A bundle path that is a link: Linux refuses user attributes on the link
  // itself, and nothing reaches the target, neither written nor read.
  makeDirs(tmp / "Target.app");
  makeSymlink(tmp / "Target.app", tmp / "Link.app");
  EXPECT_FALSE(fm().markBundleAsPlaceholder(fileURL(tmp / "Link.app", true), &err));
  expectLoggedRecord(err, log, "markBundleAsPlaceholder:withError:",
                     "Could't set placeholder EA on \"" + tmp / "Link.app" + "\": Operation not permitted", EPERM);
  EXPECT_EQ(rawGet(tmp / "Target.app", "placeholder"), "errno " + std::to_string(ENODATA));
  rawSet(tmp / "Target.app", "placeholder", "1234");
  rawSet(tmp / "Target.app", "installType", "12345678");
  EXPECT_FALSE(fm().bundleAtURLIsPlaceholder(fileURL(tmp / "Link.app", true)));
  EXPECT_EQ(fm().installTypeForBundle(fileURL(tmp / "Link.app", true)).description(), "0");

  // Any 64-bit value, stored little-endian; the slot is left alone on success.
  const sl::Error sentinel("Sentinel", 1);
  err = sentinel;
  EXPECT_EQ(fm().installTypeForBundle(bundle, &err).description(), "0");  // absent
  for (uint64_t value : {UINT64_MAX, uint64_t{0x0102030405060708}}) {
    EXPECT_TRUE(fm().setInstallType(sl::Number(value), bundle, &err));
    EXPECT_EQ(fm().installTypeForBundle(bundle, &err).uint64Value(), value);
  }
  EXPECT_EQ(rawGet(bundle.path(), "installType"), "\x08\x07\x06\x05\x04\x03\x02\x01");
  EXPECT_EQ(err, sentinel);
  EXPECT_TRUE(log.installer().empty());

  // Wrong widths: a short value is read and refused, a long one refused by getxattr.
  rawSet(bundle.path(), "installType", "1234");
  EXPECT_TRUE(fm().installTypeForBundle(bundle, &err).isNull());
  expectLoggedRecord(err, log, "installTypeForBundle:error:",
                     "getxattr for installType EA on " + bundle.path() + " returned 4 (expected 8)", 0);
  rawSet(bundle.path(), "installType", "123456789");
  EXPECT_TRUE(fm().installTypeForBundle(bundle, &err).isNull());
  expectLoggedRecord(err, log, "installTypeForBundle:error:",
                     "Couldn't get installType EA from \"" + bundle.path() + "\": Numerical result out of range",
                     ERANGE);
  EXPECT_FALSE(fm().setInstallType(sl::Number(1), fileURL(tmp / "Missing.app", true), &err));
  expectLoggedRecord(err, log, "setInstallType:onBundle:error:",
                     "Could't set installType EA on \"" + tmp / "Missing.app" + "\": No such file or directory",
                     ENOENT);
}

}  // namespace
