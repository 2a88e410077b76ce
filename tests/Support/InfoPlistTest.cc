#include "Support/InfoPlist.h"

#include <gtest/gtest.h>

#include <string>
#include <thread>
#include <vector>

#include "Platform/PropertyList.h"
#include "Support/Log.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::test::LogCapture;
using Lines = std::vector<LogCapture::Line>;

sl::URL dirURL(const std::string& path) { return sl::URL::fileURLWithPath(path, true); }
sl::String S(const std::string& s) { return sl::String(s); }
LogCapture::Line line(int level, const std::string& message) { return {level, "installer", "SLLoadInfoPlist", message}; }

void writeInfoPlist(const std::string& bundle, const sl::Value& top) {
  sl::test::makeDirs(bundle);
  ASSERT_TRUE(sl::writePropertyListToURL(top, sl::URL::fileURLWithPath(bundle + "/Info.plist", false)));
}

// Debug lines are wanted only with a handle of threshold 7.
class InfoPlist : public ::testing::Test {
 protected:
  void SetUp() override { gLogHandle = &debugHandle_; }
  void TearDown() override { gLogHandle = previous_; }

  sl::test::TempDir tmp_;
  LogCapture log_;
  sl::InstallerLogHandle debugHandle_{sl::kLogLevelDebug};
  sl::InstallerLogHandle* previous_ = gLogHandle;
};

TEST_F(InfoPlist, KeySetAndWholeDictionary) {
  // The file holds its own "PBBundleInfoPlistURL".
  writeInfoPlist(tmp_ / "A.app", sl::Dictionary{{"PBBundleIdentifier", S("com.example.a")},
                                                {"PBBundleVersion", S("2.1")},
                                                {"PBBundleInfoPlistURL", S("from the file")}});
  const sl::URL bundle = dirURL(tmp_ / "A.app");
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
  EXPECT_TRUE(SLLoadInfoPlist(dirURL(tmp_ / "Empty.app"), sl::Array{S("A")}).isNull());
  EXPECT_EQ(sl::infoplist_detail::lockAcquisitionCount(), locksBefore);
  const std::string missing = sl::URL::fileURLWithPath(tmp_ / "Empty.app/Info.plist", false).absoluteString();
  EXPECT_EQ(log_.installer(), Lines{line(sl::kLogLevelDebug, "Missing Info.plist at " + missing)});

  // ---- A top level that is not a dictionary, with and without keys; a
  // file that cannot be parsed ----
  writeInfoPlist(tmp_ / "Array.app", sl::Array{S("A")});
  sl::test::writeFile(tmp_ / "Bad.app/Info.plist", "not a property list");
  const sl::URL arrayBundle = dirURL(tmp_ / "Array.app");
  const sl::Array keys{S("PBBundleIdentifier"), S("PBBundleVersion")};
  log_.clear();
  EXPECT_TRUE(SLLoadInfoPlist(arrayBundle, keys).isNull());
  EXPECT_TRUE(SLLoadInfoPlist(arrayBundle, nullptr).isNull());
  EXPECT_TRUE(SLLoadInfoPlist(dirURL(tmp_ / "Bad.app"), keys).isNull());
  EXPECT_EQ(sl::infoplist_detail::lockAcquisitionCount(), locksBefore + 3);
  EXPECT_EQ(log_.installer(),
            (Lines{line(sl::kLogLevelError,
                        "Object returned from _PBBundleCreateFilteredInfoPlist was not a dictionary, was type Array"),
                   line(sl::kLogLevelError, "PBBundleGetInfoDictionary failed for bundle " + arrayBundle.absoluteString()),
                   line(sl::kLogLevelError, "Failed to get filtered Info.plist with keys " + keys.description() +
                                                " from bundle " + dirURL(tmp_ / "Bad.app").absoluteString())}));
}

TEST_F(InfoPlist, ConcurrentLoadsEachGetTheirOwnResult) {
  constexpr int kRounds = 200;
  writeInfoPlist(tmp_ / "0.app", sl::Dictionary{{"PBBundleIdentifier", S("com.example.0")}});
  writeInfoPlist(tmp_ / "1.app", sl::Dictionary{{"PBBundleIdentifier", S("com.example.1")}});
  std::vector<std::string> results[2];
  auto load = [&](int t) {
    const sl::URL bundle = dirURL(tmp_ / (std::to_string(t) + ".app"));
    for (int i = 0; i < kRounds; ++i) {
      sl::Dictionary info = SLLoadInfoPlist(bundle, t == 0 ? sl::Array{S("PBBundleIdentifier")} : nullptr);
      results[t].push_back(info.get("PBBundleIdentifier").asString().str());
    }
  };
  std::thread first(load, 0), second(load, 1);
  first.join();
  second.join();
  EXPECT_EQ(results[0], std::vector<std::string>(kRounds, "com.example.0"));
  EXPECT_EQ(results[1], std::vector<std::string>(kRounds, "com.example.1"));
}

}  // namespace
