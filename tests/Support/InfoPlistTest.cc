#include "Support/InfoPlist.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "Platform/PropertyList.h"
#include "Support/Log.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::test::fileURL;
using Lines = std::vector<sl::test::LogCapture::Line>;

sl::String S(const std::string& s) { return sl::String(s); }
sl::test::LogCapture::Line line(int level, const std::string& message) {
  return sl::test::installerLine(level, "SLLoadInfoPlist", message);
}

void writeInfoPlist(const std::string& bundle, const sl::Value& top) {
  sl::test::makeDirs(bundle);
  ASSERT_TRUE(sl::writePropertyListToURL(top, fileURL(bundle + "/Info.plist")));
}

// Debug lines are wanted only with a handle of threshold 7.
class InfoPlist : public ::testing::Test {
 protected:
  void SetUp() override { gLogHandle = &debugHandle_; }
  void TearDown() override { gLogHandle = previous_; }

  sl::test::TempDir tmp_;
  sl::test::LogCapture log_;
  sl::InstallerLogHandle debugHandle_{sl::kLogLevelDebug};
  sl::InstallerLogHandle* previous_ = gLogHandle;
};

TEST_F(InfoPlist, KeySetAndWholeDictionary) {
  // The file holds its own "PBBundleInfoPlistURL".
  writeInfoPlist(tmp_ / "A.app", sl::Dictionary{{"PBBundleIdentifier", S("com.example.a")},
                                                {"PBBundleVersion", S("2.1")},
                                                {"PBBundleInfoPlistURL", S("from the file")}});
  const sl::URL bundle = fileURL(tmp_ / "A.app", true);
  EXPECT_EQ(SLLoadInfoPlist(bundle, sl::Array{S("PBBundleIdentifier"), S("Missing")}),
            (sl::Dictionary{{"PBBundleIdentifier", S("com.example.a")}}));
  // The removal is for the whole-dictionary road only.
  EXPECT_EQ(SLLoadInfoPlist(bundle, sl::Array{S("PBBundleInfoPlistURL")}),
            (sl::Dictionary{{"PBBundleInfoPlistURL", S("from the file")}}));
  EXPECT_EQ(SLLoadInfoPlist(bundle, nullptr),
            (sl::Dictionary{{"PBBundleIdentifier", S("com.example.a")}, {"PBBundleVersion", S("2.1")}}));
  EXPECT_EQ(log_.installer(), Lines{});
}

TEST_F(InfoPlist, FailuresAndTheirLines) {
  // ---- Missing Info.plist: one debug line, and the lock is never taken ----
  sl::test::makeDirs(tmp_ / "Empty.app");
  const uint64_t locksBefore = sl::infoplist_detail::lockAcquisitionCount();
  EXPECT_TRUE(SLLoadInfoPlist(fileURL(tmp_ / "Empty.app", true), sl::Array{S("A")}).isNull());
  EXPECT_EQ(sl::infoplist_detail::lockAcquisitionCount(), locksBefore);
  EXPECT_EQ(log_.installer(),
            Lines{line(sl::kLogLevelDebug,
                       "Missing Info.plist at " + fileURL(tmp_ / "Empty.app/Info.plist").absoluteString())});

  // ---- A top level that is not a dictionary, with and without keys; a
  // file that cannot be parsed ----
  writeInfoPlist(tmp_ / "Array.app", sl::Array{S("A")});
  sl::test::writeFile(tmp_ / "Bad.app/Info.plist", "not a property list");
  const sl::URL arrayBundle = fileURL(tmp_ / "Array.app", true);
  const sl::Array keys{S("PBBundleIdentifier"), S("PBBundleVersion")};
  log_.clear();
  EXPECT_TRUE(SLLoadInfoPlist(arrayBundle, keys).isNull());
  EXPECT_TRUE(SLLoadInfoPlist(arrayBundle, nullptr).isNull());
  EXPECT_TRUE(SLLoadInfoPlist(fileURL(tmp_ / "Bad.app", true), keys).isNull());
  EXPECT_EQ(sl::infoplist_detail::lockAcquisitionCount(), locksBefore + 3);
  EXPECT_EQ(
      log_.installer(),
      (Lines{line(sl::kLogLevelError,
                  "Object returned from _PBBundleCreateFilteredInfoPlist was not a dictionary, was type Array"),
             line(sl::kLogLevelError, "PBBundleGetInfoDictionary failed for bundle " + arrayBundle.absoluteString()),
             line(sl::kLogLevelError, "Failed to get filtered Info.plist with keys " + keys.description() +
                                          " from bundle " + fileURL(tmp_ / "Bad.app", true).absoluteString())}));

  // ---- A bundle path that names a file: the Info.plist's absence cannot be
  // told, so the bundle is tried, and refused ----
  sl::test::writeFile(tmp_ / "File.app");
  const sl::URL fileBundle = fileURL(tmp_ / "File.app", true);
  log_.clear();
  EXPECT_TRUE(SLLoadInfoPlist(fileBundle, keys).isNull());
  EXPECT_EQ(log_.installer(),
            (Lines{sl::test::installerLine(sl::kLogLevelError, "-[SLFileManager itemDoesNotExistAtURL:]",
                                           "Failed to determine if " + fileBundle.absoluteString() +
                                               "Info.plist exists: Not a directory"),
                   line(sl::kLogLevelError, "Failed to create PBBundle from URL " + fileBundle.absoluteString())}));
}

}  // namespace
