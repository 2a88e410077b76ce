#include "Support/Errors.h"

#include <gtest/gtest.h>

#include "Platform/URL.h"
#include "Support/Log.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::Dictionary;
using sl::Error;
using sl::String;
using sl::URL;
using sl::test::LogCapture;

const char kFunction[] = "-[SLFileManager createTemporaryDirectoryInDirectoryURL:error:]";

// Sets gLogHandle for the scope and restores it after.
class ScopedLogHandle {
 public:
  explicit ScopedLogHandle(sl::InstallerLogHandle* h) : saved_(gLogHandle) { gLogHandle = h; }
  ~ScopedLogHandle() { gLogHandle = saved_; }

 private:
  sl::InstallerLogHandle* saved_;
};

TEST(ErrorsTest, CreateErrorStampsFunctionAndLineAndLogsNothing) {
  LogCapture log;
  URL url = URL::fileURLWithPath("/tmp/x", true);
  Error e = _CreateError(kFunction, 81, sl::kPOSIXErrorDomain, 17, "mkdir of %@ failed: %s", url, "File exists");

  EXPECT_EQ(e.domain(), sl::kPOSIXErrorDomain);
  EXPECT_EQ(e.code(), 17);
  EXPECT_EQ(e.userInfo(), (Dictionary{{sl::kLocalizedDescriptionKey, String("mkdir of file:///tmp/x/ failed: File exists")},
                                      {"FunctionName", String(kFunction)},
                                      {"SourceFileLine", sl::Number(int64_t{81})}}));
  EXPECT_TRUE(e.underlyingError().isNull());
  EXPECT_TRUE(log.installer().empty());
}

TEST(ErrorsTest, CreateAndLogErrorMergesUserInfoAndLogsOneLine) {
  LogCapture log;
  URL path = URL::fileURLWithPath("/var/tmp/temp.XXXXXX", true);
  Dictionary callers{{"FunctionName", String("caller's own")}, {SLPathArgumentErrorKey, path}};
  const Dictionary before = callers;
  Error underlying = Error::posix(2);

  Error e = _CreateAndLogError(kFunction, 281, SLInstallerErrorDomain, 4, underlying, callers,
                               "Failed to create temp dir at path %s", "/var/tmp/temp.XXXXXX");

  EXPECT_EQ(e.domain(), "SLInstallerErrorDomain");
  EXPECT_EQ(e.code(), 4);
  Dictionary info = e.userInfo();
  EXPECT_EQ(info.get("FunctionName"), String(kFunction));  // the constructor's name wins
  EXPECT_EQ(info.get("PathArgument"), path);                // the caller's other keys stay
  EXPECT_EQ(info.get("SourceFileLine"), sl::Number(int64_t{281}));
  EXPECT_EQ(e.underlyingError(), underlying);
  EXPECT_EQ(e.localizedDescription(), "Failed to create temp dir at path /var/tmp/temp.XXXXXX");
  EXPECT_EQ(callers, before);  // never changed

  ASSERT_EQ(log.installer().size(), 1u);
  EXPECT_EQ(log.installer()[0],
            (LogCapture::Line{sl::kLogLevelError, "installer", kFunction,
                              "281: Failed to create temp dir at path /var/tmp/temp.XXXXXX (Error Domain=POSIXErrorDomain "
                              "Code=2 \"No such file or directory\")"}));

  // Without an underlying record the line ends after the message.
  log.clear();
  (void)_CreateAndLogError(kFunction, 12, SLInstallerErrorDomain, 24, nullptr, nullptr, "Failed to move %@ to %@",
                           String("a"), String("b"));
  EXPECT_EQ(log.installerMessages(), std::vector<std::string>{"12: Failed to move a to b"});

  // Without a format: no description and no line.
  log.clear();
  Error bare = _CreateAndLogError(kFunction, 5, SLInstallerErrorDomain, 70, nullptr, nullptr, nullptr);
  EXPECT_TRUE(bare.localizedDescription().isNull());
  EXPECT_EQ(bare.userInfo().count(), 2u);
  EXPECT_TRUE(log.installer().empty());
}

TEST(ErrorsTest, ThresholdRuleAtTheCallSites) {
  LogCapture log;
  auto logAllLevels = [&] {
    log.clear();
    SLLog(sl::kLogLevelError, "f", "e");
    SLLog(sl::kLogLevelNotice, "f", "n");
    SLLog(sl::kLogLevelDebug, "f", "d");
    return log.installerMessages();
  };
  using Lines = std::vector<std::string>;
  {
    ScopedLogHandle none(nullptr);
    EXPECT_EQ(logAllLevels(), (Lines{"e", "n"}));
  }
  sl::InstallerLogHandle four{4};
  {
    ScopedLogHandle h(&four);
    EXPECT_EQ(logAllLevels(), (Lines{"e"}));
  }
  sl::InstallerLogHandle seven{7};
  {
    ScopedLogHandle h(&seven);
    EXPECT_EQ(logAllLevels(), (Lines{"e", "n", "d"}));
  }
  sl::InstallerLogHandle two{2};
  {
    ScopedLogHandle h(&two);
    EXPECT_EQ(logAllLevels(), Lines{});
    // The record is still made when its line is not wanted.
    Error e = _CreateAndLogError(kFunction, 1, SLInstallerErrorDomain, 4, nullptr, nullptr, "quiet");
    EXPECT_EQ(e.localizedDescription(), "quiet");
    EXPECT_TRUE(log.installer().empty());
  }
}

}  // namespace
