#include <unistd.h>

#include <filesystem>
#include <set>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "Support/Errors.h"
#include "TestSupport/TestSupport.h"

namespace {

using namespace sl::test;
using Lines = std::vector<LogCapture::Line>;

constexpr char kCapture[] =
    "-[SLFileManager captureStoreDataFromDirectory:toDirectory:doCopy:failureIsFatal:withError:]";

std::set<std::string> namesIn(const std::string& dir) {
  std::set<std::string> names;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) names.insert(entry.path().filename());
  return names;
}

TEST(StoreDataCapture, CarriesWhatIsThereAndStopsOnlyWhenFatal) {
  EXPECT_EQ(SLFileManager::storeDataItemNames(),
            (std::vector<std::string>{"Manifest.plist", "JukoraArtwork", "JukoraMetadata.plist", "GeoJSON"}));
  // nobody owns both directories and may carry everything but the artwork,
  // a directory of root's that it can neither read nor re-parent. GeoJSON is
  // missing, which is no failure; Other is no store item.
  TempDir tmp;
  const std::string src = tmp / "src", dst = tmp / "dst";
  const std::string from = "file://" + src + "/JukoraArtwork", to = "file://" + dst + "/JukoraArtwork";
  using Names = std::set<std::string>;
  const sl::Error sentinel("Sentinel", 42);
  for (bool doCopy : {false, true}) {
    // Same paths in both rows, so the line the fatal row returns is the one
    // the other row logs.
    std::string expectedLine;
    for (bool fatal : {true, false}) {
      SCOPED_TRACE(std::string(doCopy ? "copy" : "move") + (fatal ? ", fatal" : ", not fatal"));
      for (const char* item : {"Manifest.plist", "JukoraMetadata.plist", "Other"}) writeFile(src + "/" + item, item);
      writeFile(src + "/JukoraArtwork/image", "png");
      ASSERT_EQ(chmod((src + "/JukoraArtwork").c_str(), 0700), 0);
      makeDirs(dst);
      for (const std::string& p : {src, dst})
        ASSERT_EQ(lchown(p.c_str(), ScopedUnprivileged::kUid, ScopedUnprivileged::kGid), 0);
      LogCapture log;
      sl::Error err = sentinel;
      bool ok;
      {
        ScopedUnprivileged nobody;
        ok = SLFileManager::defaultManager().captureStoreDataFromDirectory(fileURL(src, true), fileURL(dst, true),
                                                                           doCopy, fatal, &err);
      }
      EXPECT_EQ(ok, !fatal);
      // Items before the failure are carried; after it, only when it is not fatal.
      const Names carried = fatal ? Names{"Manifest.plist"} : Names{"Manifest.plist", "JukoraMetadata.plist"};
      EXPECT_EQ(namesIn(dst), carried);
      EXPECT_EQ(readFile(dst + "/Manifest.plist"), "Manifest.plist");
      Names left = {"Manifest.plist", "JukoraMetadata.plist", "JukoraArtwork", "Other"};
      if (!doCopy) std::erase_if(left, [&](const std::string& name) { return carried.contains(name); });
      EXPECT_EQ(namesIn(src), left);
      EXPECT_TRUE(exists(src + "/JukoraArtwork/image"));

      if (fatal) {
        const std::string message = (doCopy ? "Failed to copy " : "Failed to move ") + from + " to " + to;
        expectRecord(err, SLInstallerErrorDomain, 24, message, kCapture);
        EXPECT_EQ(err.userInfo().get("LegacyErrorString"), sl::String("JukoraArtworkCaptureFailed"));
        expectPOSIXRecord(err.underlyingError(), EACCES,
                          (doCopy ? "copyfile of " : "rename of ") + from + " to " + to + " failed: Permission denied",
                          nullptr);
        expectedLine = err.userInfo().get(SLSourceFileLineErrorKey).description() + ": " + message + " (" +
                       err.underlyingError().description() + ")";
      } else {
        EXPECT_EQ(err, sentinel);
      }
      EXPECT_EQ(log.installer(), (Lines{installerLine(3, kCapture, expectedLine)}));
      forceRemove(src);
      forceRemove(dst);
    }
  }
}

}  // namespace
