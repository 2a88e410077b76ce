#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <latch>
#include <memory>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "Configuration/SLGlobalConfiguration.h"
#include "FileManager/SLFileManager.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Support/InfoPlist.h"
#include "Support/Log.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::test::fileURL;
using sl::test::installerLine;
using Lines = std::vector<sl::test::LogCapture::Line>;
using IDs = std::set<std::string>;

constexpr char kScan[] = "-[SLGlobalConfiguration _bundleIDMapForBundlesInDirectory:withExtension:]";
constexpr char kBundleURLKey[] = "com.vantor.Stowline.bundleURL";

IDs keysOf(const sl::Dictionary& catalogue) {
  IDs out;
  for (const auto& entry : catalogue) out.insert(entry.first);
  return out;
}

// A fresh configuration in a system root of its own, with debug lines wanted.
class BundleCatalogues : public ::testing::Test {
 protected:
  void SetUp() override {
    sl::setSystemRoot(root_.path());
    config_ = std::make_unique<SLGlobalConfiguration>();
    gLogHandle = &debugHandle_;
  }
  void TearDown() override {
    gLogHandle = previousHandle_;
    sl::setSystemRoot("");
  }
  // ROOT/relative as a bundle; a null identifier leaves the key out.
  void bundle(const std::string& relative, const char* identifier, const char* version = nullptr) {
    sl::Dictionary info{{"Other", sl::String("x")}};
    if (identifier != nullptr) info.set("PBBundleIdentifier", sl::String(identifier));
    if (version != nullptr) info.set("PBBundleVersion", sl::String(version));
    sl::test::makeDirs(root_ / relative);
    ASSERT_TRUE(sl::writePropertyListToURL(info, fileURL(root_ / relative + "/Info.plist")));
  }

  sl::test::TempDir root_;
  std::unique_ptr<SLGlobalConfiguration> config_;
  sl::InstallerLogHandle debugHandle_{sl::kLogLevelDebug};
  sl::InstallerLogHandle* previousHandle_ = gLogHandle;
};

TEST_F(BundleCatalogues, ScanRulesAndCaching) {
  bundle("Applications/A.app", "com.example.a", "1.0");
  bundle("Applications/B.app", "com.example.dup");
  bundle("Applications/C.app", "com.example.dup");
  bundle("Applications/Upper.APP", "com.example.upper");
  bundle("Applications/NoIdentifier.app", nullptr, "3");
  bundle("elsewhere/Linked.app", "com.example.linked");
  sl::test::makeSymlink(root_ / "elsewhere/Linked.app", root_ / "Applications/Linked.app");
  sl::test::makeDirs(root_ / "Applications/NoPlist.app");
  const std::string apps = config_->systemAppsDirectory().path();
  // Of the two bundles with one identifier, the one listed later wins.
  std::string later;
  const auto listing = SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(fileURL(apps, true), true);
  ASSERT_TRUE(listing);
  for (const sl::URL& url : *listing) {
    if (url.lastPathComponent() == "B.app" || url.lastPathComponent() == "C.app") later = url.lastPathComponent();
  }

  sl::test::LogCapture log;
  const sl::Dictionary catalogue = config_->systemAppBundleIDToInfoMap();
  EXPECT_EQ(keysOf(catalogue), (IDs{"com.example.a", "com.example.dup"}));
  EXPECT_EQ(catalogue.get("com.example.a"), (sl::Dictionary{{"PBBundleIdentifier", sl::String("com.example.a")},
                                                            {"PBBundleVersion", sl::String("1.0")},
                                                            {kBundleURLKey, fileURL(apps + "/A.app", true)}}));
  EXPECT_EQ(catalogue.get("com.example.dup").asDictionary().get(kBundleURLKey), fileURL(apps + "/" + later, true));
  const std::string noPlist = fileURL(apps + "/NoPlist.app", true).absoluteString();
  EXPECT_THAT(
      log.installer(),
      ::testing::UnorderedElementsAreArray(Lines{
          installerLine(sl::kLogLevelNotice, "-[SLFileManager urlsForItemsInDirectoryAtURL:ignoringSymlinks:error:]",
                        "Ignoring symlink at " + apps + "/Linked.app"),
          installerLine(sl::kLogLevelDebug, "SLLoadInfoPlist", "Missing Info.plist at " + noPlist + "Info.plist"),
          installerLine(sl::kLogLevelDebug, kScan, "Failed to load Info.plist from bundle " + noPlist),
          installerLine(sl::kLogLevelDebug, kScan,
                        "Failed to get PBBundleIdentifier from bundle " +
                            fileURL(apps + "/NoIdentifier.app", true).absoluteString())}));

  // ---- Cached until reScanSystemApps; the other rescans leave it ----
  bundle("Applications/New.app", "com.example.new");
  config_->reScanBasaltApps();
  config_->reScanInternalApps();
  EXPECT_EQ(keysOf(config_->systemAppBundleIDToInfoMap()), keysOf(catalogue));
  config_->reScanSystemApps();
  EXPECT_EQ(keysOf(config_->systemAppBundleIDToInfoMap()),
            (IDs{"com.example.a", "com.example.dup", "com.example.new"}));
  EXPECT_EQ(keysOf(catalogue), (IDs{"com.example.a", "com.example.dup"}));  // what was handed out stays
}

TEST_F(BundleCatalogues, OtherCataloguesFrameworksAndFailures) {
  bundle("Applications/S.app", "com.example.system");
  bundle("Applications/Both.app", "com.example.both");
  bundle("System/Library/Basalt/Core.app", "com.example.core");
  bundle("System/Library/Basalt/Both.app", "com.example.both");
  sl::test::LogCapture log;

  // ---- Missing directories: null (the framework set empty), silent; the
  // catalogue is scanned again on the next call, the framework set is not ----
  EXPECT_TRUE(config_->internalAppBundleIDToInfoMap().isNull());
  EXPECT_EQ(config_->builtInFrameworkBundleIDs(), IDs{});
  EXPECT_EQ(log.installer(), Lines{});
  bundle("VantorInternal/Applications/I.app", "com.example.internal");
  bundle("System/Library/Frameworks/X.framework", "com.example.x");
  EXPECT_EQ(keysOf(config_->internalAppBundleIDToInfoMap()), IDs{"com.example.internal"});
  EXPECT_EQ(config_->builtInFrameworkBundleIDs(), IDs{});
  config_->reScanSystemApps();
  EXPECT_EQ(config_->builtInFrameworkBundleIDs(), IDs{"com.example.x"});
  bundle("VantorInternal/PrivateFrameworks/Y.framework", "com.example.y");
  config_->reScanBasaltApps();
  EXPECT_EQ(config_->builtInFrameworkBundleIDs(), IDs{"com.example.x"});
  config_->reScanInternalApps();
  EXPECT_EQ(config_->builtInFrameworkBundleIDs(), (IDs{"com.example.x", "com.example.y"}));

  // ---- Disk images (without any, the developer applications alone; empty,
  // never null) and the built-in set, which leaves the basalt ones out ----
  EXPECT_EQ(config_->diskImageAppBundleIDToInfoMap(), sl::Dictionary::create());
  bundle("Developer/Applications/D.app", "com.example.developer");
  EXPECT_EQ(keysOf(config_->diskImageAppBundleIDToInfoMap()), IDs{"com.example.developer"});
  EXPECT_EQ(keysOf(config_->basaltAppBundleIDToInfoMap()), (IDs{"com.example.core", "com.example.both"}));
  EXPECT_EQ(config_->builtInApplicationBundleIDs(),
            (IDs{"com.example.system", "com.example.both", "com.example.internal", "com.example.developer"}));

  // ---- Any other listing failure: null, one error line, not cached ----
  config_->reScanSystemApps();
  ASSERT_EQ(chmod((root_ / "Applications").c_str(), 0700), 0);
  const sl::URL apps = config_->systemAppsDirectory();
  sl::Dictionary catalogue;
  sl::Error expected;
  log.clear();
  {
    sl::test::ScopedUnprivileged nobody;
    ASSERT_FALSE(SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(apps, true, &expected));
    catalogue = config_->systemAppBundleIDToInfoMap();
  }
  EXPECT_TRUE(catalogue.isNull());
  EXPECT_TRUE(expected.isPOSIX(EACCES));
  EXPECT_EQ(log.installer(),
            (Lines{installerLine(sl::kLogLevelError, kScan,
                                 sl::format("Failed to search for apps in %@ : %@", apps, expected))}));
  EXPECT_EQ(keysOf(config_->systemAppBundleIDToInfoMap()), (IDs{"com.example.system", "com.example.both"}));
}

TEST_F(BundleCatalogues, ConcurrentFirstCalls) {
  for (int i = 0; i < 20; ++i) bundle("Applications/" + std::to_string(i) + ".app", std::to_string(i).c_str());
  const uint64_t loadsBefore = sl::infoplist_detail::lockAcquisitionCount();
  sl::test::LogCapture log;
  SLGlobalConfiguration* shared[2] = {};
  sl::URL data[2];
  sl::Dictionary seen[2];
  std::latch start(2);
  auto ask = [&](int i) {
    start.arrive_and_wait();
    shared[i] = &SLGlobalConfiguration::sharedInstance();
    data[i] = config_->dataDirectory();
    seen[i] = config_->systemAppBundleIDToInfoMap();
  };
  { std::jthread first(ask, 0), second(ask, 1); }
  EXPECT_EQ(shared[0], shared[1]);
  EXPECT_EQ(data[0], data[1]);
  EXPECT_TRUE(sl::test::exists(data[0].path()));
  EXPECT_EQ(seen[0].count(), 20u);
  EXPECT_EQ(seen[0], seen[1]);
  EXPECT_EQ(log.installer(), Lines{});  // neither creation failed
  // The scan runs under the object lock: whichever caller comes second waits
  // for the first one's catalogue instead of loading every bundle again.
  EXPECT_EQ(sl::infoplist_detail::lockAcquisitionCount(), loadsBefore + 20);
}

}  // namespace
