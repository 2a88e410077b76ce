#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <set>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "Support/Errors.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::test::LogCapture;
using sl::test::ScopedUnprivileged;
using sl::test::TempDir;
using Lines = std::vector<LogCapture::Line>;

constexpr char kCapture[] =
    "-[SLFileManager captureStoreDataFromDirectory:toDirectory:doCopy:failureIsFatal:withError:]";

sl::URL dirURL(const std::string& path) { return sl::URL::fileURLWithPath(path, true); }

std::set<std::string> namesIn(const std::string& dir) {
  std::set<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) names.insert(entry.path().filename());
  return names;
}

TEST(StoreDataCapture, CarriesWhatIsThere) {
  EXPECT_EQ(SLFileManager::storeDataItemNames(),
            (std::vector<std::string>{"Manifest.plist", "JukoraArtwork", "JukoraMetadata.plist", "GeoJSON"}));
  for (bool doCopy : {false, true}) {
    SCOPED_TRACE(doCopy ? "copy" : "move");
    TempDir tmp;
    ASSERT_FALSE(tmp.path().empty());  // never build at "/"
    sl::test::writeFile(tmp / "src/Other");
    sl::test::makeDirs(tmp / "dst");
    LogCapture log;
    auto& fm = SLFileManager::defaultManager();

    EXPECT_TRUE(fm.captureStoreDataFromDirectory(dirURL(tmp / "src"), dirURL(tmp / "dst"), doCopy, true));
    EXPECT_EQ(namesIn(tmp / "dst"), std::set<std::string>{});

    sl::test::writeFile(tmp / "src/JukoraMetadata.plist", "meta");
    EXPECT_TRUE(fm.captureStoreDataFromDirectory(dirURL(tmp / "src"), dirURL(tmp / "dst"), doCopy, true));
    EXPECT_EQ(namesIn(tmp / "dst"), std::set<std::string>{"JukoraMetadata.plist"});
    EXPECT_EQ(sl::test::readFile(tmp / "dst/JukoraMetadata.plist"), "meta");
    EXPECT_EQ(sl::test::exists(tmp / "src/JukoraMetadata.plist"), doCopy);
    EXPECT_EQ(log.installer(), Lines{});
  }
}

TEST(StoreDataCapture, FailingItem) {
  // nobody owns both directories and may carry everything but the artwork,
  // a directory of root's that it can neither read nor re-parent.
  TempDir tmp;
  ASSERT_FALSE(tmp.path().empty());  // never build at "/"
  const std::string src = tmp / "src", dst = tmp / "dst";
  const std::string from = "file://" + src + "/JukoraArtwork", to = "file://" + dst + "/JukoraArtwork";
  const sl::Error sentinel("Sentinel", 42);
  for (bool doCopy : {false, true}) {
    // Same paths in both rows, so the line the fatal row returns is the one
    // the other row logs.
    std::string expectedLine;
    for (bool fatal : {true, false}) {
      SCOPED_TRACE(std::string(doCopy ? "copy" : "move") + (fatal ? ", fatal" : ", not fatal"));
      for (const char* item : {"Manifest.plist", "JukoraMetadata.plist", "GeoJSON"})
        sl::test::writeFile(src + "/" + item, item);
      sl::test::writeFile(src + "/JukoraArtwork/image", "png");
      ASSERT_EQ(chmod((src + "/JukoraArtwork").c_str(), 0700), 0);
      sl::test::makeDirs(dst);
      for (const std::string& p : {src, dst})
        ASSERT_EQ(lchown(p.c_str(), ScopedUnprivileged::kUid, ScopedUnprivileged::kGid), 0);
      LogCapture log;
      sl::Error err = sentinel;
      bool ok;
      {
        ScopedUnprivileged nobody;
        ok = SLFileManager::defaultManager().captureStoreDataFromDirectory(dirURL(src), dirURL(dst), doCopy, fatal,
                                                                           &err);
      }
      EXPECT_EQ(ok, !fatal);
      // Items before the failure are carried; after it, only when it is not fatal.
      for (const std::string item : {"Manifest.plist", "JukoraMetadata.plist", "GeoJSON"}) {
        const bool carried = item == "Manifest.plist" || !fatal;
        EXPECT_EQ(sl::test::exists(dst + "/" + item), carried) << item;
        EXPECT_EQ(sl::test::exists(src + "/" + item), !carried || doCopy) << item;
      }
      EXPECT_TRUE(sl::test::exists(src + "/JukoraArtwork/image"));

      if (fatal) {
        ASSERT_FALSE(err.isNull());
        EXPECT_EQ(err.domain(), SLInstallerErrorDomain);
        EXPECT_EQ(err.code(), 24);
        EXPECT_EQ(err.userInfo().get("LegacyErrorString"), sl::String("JukoraArtworkCaptureFailed"));
        const std::string message = (doCopy ? "Failed to copy " : "Failed to move ") + from + " to " + to;
        EXPECT_EQ(err.localizedDescription().str(), message);
        const sl::Error cause = err.underlyingError();
        EXPECT_TRUE(cause.isPOSIX(EACCES));
        EXPECT_EQ(cause.localizedDescription().str(), (doCopy ? "copyfile of " : "rename of ") + from + " to " + to +
                                                          " failed: Permission denied");
        expectedLine = err.userInfo().get(SLSourceFileLineErrorKey).description() + ": " + message + " (" +
                       cause.description() + ")";
      } else {
        EXPECT_EQ(err, sentinel);
      }
      EXPECT_EQ(log.installer(), (Lines{{3, "installer", kCapture, expectedLine}}));
      sl::test::forceRemove(src);
      sl::test::forceRemove(dst);
    }
  }
}

}  // namespace
