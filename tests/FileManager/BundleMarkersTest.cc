#include <sys/xattr.h>

#include <cerrno>
#include <cstdint>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "Support/Errors.h"
#include "TestSupport/TestSupport.h"

namespace {

SLFileManager& fm() { return SLFileManager::defaultManager(); }
sl::URL dirURL(const std::string& path) { return sl::URL::fileURLWithPath(path, true); }
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
void expectRecord(const sl::Error& err, const sl::test::LogCapture& log, const std::string& selector,
                  const std::string& message, int underlying) {
  const std::string function = "-[SLFileManager " + selector + "]";
  EXPECT_EQ(err.domain(), SLInstallerErrorDomain);
  EXPECT_EQ(err.code(), kSLInstallerFileSystemError);
  EXPECT_EQ(err.localizedDescription().str(), message);
  EXPECT_EQ(err.userInfo().get(SLFunctionNameErrorKey).asString().str(), function);
  EXPECT_EQ(err.underlyingError(), underlying != 0 ? sl::Error::posix(underlying) : sl::Error());
  std::string line = err.userInfo().get(SLSourceFileLineErrorKey).description() + ": " + message;
  if (underlying != 0) line += " (" + sl::Error::posix(underlying).description() + ")";
  EXPECT_EQ(log.installer(), (std::vector<sl::test::LogCapture::Line>{{3, "installer", function, line}}));
}

TEST(BundleMarkers, Placeholder) {
  sl::test::TempDir tmp;
  const std::string bundle = tmp / "A.app";
  sl::test::makeDirs(bundle);
  EXPECT_FALSE(fm().bundleAtURLIsPlaceholder(dirURL(bundle)));
  EXPECT_TRUE(fm().markBundleAsPlaceholder(dirURL(bundle)));
  EXPECT_TRUE(fm().bundleAtURLIsPlaceholder(dirURL(bundle)));
  EXPECT_EQ(rawGet(bundle, "placeholder"), std::string("\1\0\0\0", 4));
  for (size_t size : {4, 1, 8}) {  // only the length counts
    rawSet(bundle, "placeholder", std::string(size, '\0'));
    EXPECT_EQ(fm().bundleAtURLIsPlaceholder(dirURL(bundle)), size == 4) << size;
  }

  sl::test::LogCapture log;
  sl::Error err;
  EXPECT_FALSE(fm().markBundleAsPlaceholder(dirURL(tmp / "Missing.app"), &err));
  expectRecord(err, log, "markBundleAsPlaceholder:withError:",
               "Could't set placeholder EA on \"" + tmp / "Missing.app" + "\": No such file or directory", ENOENT);

  // A bundle path that is a link: Linux refuses user attributes on the link
  // itself, and nothing reaches the target, neither written nor read.
  sl::test::makeDirs(tmp / "Target.app");
  sl::test::makeSymlink(tmp / "Target.app", tmp / "Link.app");
  EXPECT_FALSE(fm().markBundleAsPlaceholder(dirURL(tmp / "Link.app"), &err));
  EXPECT_EQ(err.underlyingError(), sl::Error::posix(EPERM));
  EXPECT_EQ(rawGet(tmp / "Target.app", "placeholder"), "errno " + std::to_string(ENODATA));
  rawSet(tmp / "Target.app", "placeholder", "1234");
  rawSet(tmp / "Target.app", "installType", "12345678");
  EXPECT_FALSE(fm().bundleAtURLIsPlaceholder(dirURL(tmp / "Link.app")));
  EXPECT_EQ(fm().installTypeForBundle(dirURL(tmp / "Link.app")).description(), "0");
}

TEST(BundleMarkers, InstallType) {
  sl::test::TempDir tmp;
  const std::string bundle = tmp / "A.app";
  sl::test::makeDirs(bundle);
  sl::test::LogCapture log;
  const sl::Error sentinel("Sentinel", 1);
  sl::Error err = sentinel;
  EXPECT_EQ(fm().installTypeForBundle(dirURL(bundle), &err).description(), "0");  // absent
  for (uint64_t value : {UINT64_MAX, uint64_t{0x0102030405060708}}) {
    EXPECT_TRUE(fm().setInstallType(sl::Number(value), dirURL(bundle), &err));
    EXPECT_EQ(fm().installTypeForBundle(dirURL(bundle), &err).uint64Value(), value);
  }
  EXPECT_EQ(rawGet(bundle, "installType"), "\x08\x07\x06\x05\x04\x03\x02\x01");  // little-endian
  EXPECT_EQ(err, sentinel);
  EXPECT_TRUE(log.installer().empty());

  rawSet(bundle, "installType", "1234");
  EXPECT_TRUE(fm().installTypeForBundle(dirURL(bundle), &err).isNull());
  expectRecord(err, log, "installTypeForBundle:error:",
               "getxattr for installType EA on " + bundle + " returned 4 (expected 8)", 0);
  log.clear();
  rawSet(bundle, "installType", "123456789");
  EXPECT_TRUE(fm().installTypeForBundle(dirURL(bundle), &err).isNull());
  expectRecord(err, log, "installTypeForBundle:error:",
               "Couldn't get installType EA from \"" + bundle + "\": Numerical result out of range", ERANGE);
  log.clear();
  EXPECT_FALSE(fm().setInstallType(sl::Number(1), dirURL(tmp / "Missing.app"), &err));
  expectRecord(err, log, "setInstallType:onBundle:error:",
               "Could't set installType EA on \"" + tmp / "Missing.app" + "\": No such file or directory", ENOENT);
}

}  // namespace
