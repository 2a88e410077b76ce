// The migrator's start-up state and the main pass over the old container
// root (the plug-in's entry points are exercised by the program's tests).
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>

#include "FileManager/SLFileManager.h"
#include "MigratorTestSupport.h"

namespace {

using namespace mgtest;
using sl::test::exists;
using Access = SLAppMigratorTestAccess;
using Line = Lines::value_type;
constexpr int E = sl::kLogLevelError;
constexpr int N = sl::kLogLevelNotice;
const std::string kReturningFailed =
    "SLAppMigrator: Returning migration failed. Please include the contents of /var/mobile/Library/Logs/Stowline "
    "and /var/Mobile/Library/Logs/Movantis in a bug report.";

class StartupAndMainPassTest : public MigratorTest {
 protected:
  static std::string oldRoot() { return below(kOldRoot); }
  static std::string installMap() { return below(kInstallMap); }
  static std::string data(const std::string& name) { return below(kDataDirectory) + "/" + name; }
  static void writeOSRelease() {
    sl::test::writeFile(below("/etc/os-release"), "NAME=Testix\nVERSION_ID=9.1\nBUILD_ID=21A42\n");
  }
  Lines host() const { return hostLines(log_); }
  std::unique_ptr<SLAppMigrator> make() {
    std::unique_ptr<SLAppMigrator> migrator = SLAppMigrator::create();
    EXPECT_TRUE(migrator);
    return migrator;
  }
  static const sl::Dictionary kVersion;
};
const sl::Dictionary StartupAndMainPassTest::kVersion{{"ProductName", sl::String("Testix")},
                                                      {"ProductVersion", sl::String("9.1")},
                                                      {"SystemBuildVersion", sl::String("21A42")}};

TEST_F(StartupAndMainPassTest, InitLoadsTheStartUpState) {
  {
    SCOPED_TRACE("no old root: install map unread; malformed harbor map; last version read");
    writePlist(installMap(), sl::Dictionary{{"Other", sl::String("x")}});
    writePlist(data("SafeHarbor.plist"), sl::Array{sl::String("not a map")});
    writePlist(data("AppMigratorLastSystemVersion.plist"), sl::Dictionary{{"SystemBuildVersion", sl::String("20X1")}});
    auto m = make();
    EXPECT_FALSE(Access::itemsToMigrate(*m));
    EXPECT_TRUE(Access::harborMap(*m).isNull());
    EXPECT_EQ(Access::lastSystemBuildVersion(*m), "20X1");
    EXPECT_EQ(m->dataClassName(), "SLAppMigrator");
    EXPECT_FLOAT_EQ(m->estimatedDuration(), 20.0f);
    EXPECT_FLOAT_EQ(m->migrationProgress(), 0.5f);
    EXPECT_EQ(host(),
              (Lines{{E, "SLAppMigrator: Failed to load existing harbor map from " + u(data("SafeHarbor.plist"))}}));
    sl::test::forceRemove(data("SafeHarbor.plist"));
  }
  {
    SCOPED_TRACE("ten entries and a link; \"GroupContainers\" not a dictionary");
    log_.clear();
    for (int i = 0; i < 10; ++i) sl::test::makeDirs(oldRoot() + "/E" + std::to_string(i));
    sl::test::makeSymlink(oldRoot() + "/E0", oldRoot() + "/link");
    writePlist(installMap(), sl::Dictionary{{"GroupContainers", sl::String("x")}});
    auto m = make();
    ASSERT_TRUE(Access::itemsToMigrate(*m));
    const auto& items = *Access::itemsToMigrate(*m);
    EXPECT_EQ(items.size(), 10u);
    EXPECT_TRUE(
        std::none_of(items.begin(), items.end(), [](const sl::URL& i) { return i.lastPathComponent() == "link"; }));
    EXPECT_TRUE(Access::groupContainerMap(*m).isNull());
    EXPECT_FLOAT_EQ(m->estimatedDuration(), 42.5f);
    EXPECT_FLOAT_EQ(m->migrationProgress(), 0.0f);
    EXPECT_EQ(host(), (Lines{{N, "SLAppMigrator: 10 items to migrate"},
                             {N, "SLAppMigrator: No group container map found in install map"}}));
  }
  {
    SCOPED_TRACE("empty old root: deleted, install map unread");
    log_.clear();
    sl::test::forceRemove(oldRoot());
    sl::test::makeDirs(oldRoot());
    auto m = make();
    EXPECT_FALSE(Access::itemsToMigrate(*m));
    EXPECT_FALSE(exists(oldRoot()));
    EXPECT_TRUE(exists(installMap()));
    EXPECT_EQ(host(), Lines{});
  }
  {
    SCOPED_TRACE("old root that cannot be listed: no migrator");
    log_.clear();
    sl::test::makeDirs(oldRoot());
    ASSERT_EQ(chmod(oldRoot().c_str(), 0), 0);
    sl::Error expected;
    std::unique_ptr<SLAppMigrator> m;
    {
      sl::test::ScopedUnprivileged nobody;
      const sl::URL rootURL = fileURL(oldRoot(), true);
      EXPECT_FALSE(SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(rootURL, true, &expected));
      m = SLAppMigrator::create();
    }
    EXPECT_FALSE(m);
    EXPECT_TRUE(expected.isPOSIX(EACCES));
    EXPECT_EQ(
        host(),
        (Lines{{E, sl::format("SLAppMigrator: Failed to get items at %@ : %@", fileURL(oldRoot(), true), expected)}}));
  }
  {
    SCOPED_TRACE("progress figures");
    auto m = Access::bare();
    std::vector<sl::URL> ten(10, fileURL(oldRoot() + "/E0", true));
    Access::setProgressState(*m, ten, 4);
    EXPECT_FLOAT_EQ(m->migrationProgress(), 0.4f);
    Access::setProgressState(*m, std::vector<sl::URL>(), 0);
    EXPECT_FLOAT_EQ(m->migrationProgress(), -1.0f);
  }
}

// Without items the pass still runs the safe harbors and the data-protection
// update; the old install map stays, since the root is not found empty.
TEST_F(StartupAndMainPassTest, PassWithoutOldRoot) {
  for (bool emptyRoot : {false, true}) {
    SCOPED_TRACE(emptyRoot ? "empty root, deleted by init; no os-release" : "no root");
    sl::test::forceRemove(below("/etc"));
    emptyRoot ? sl::test::makeDirs(oldRoot()) : writeOSRelease();
    writeInstallMap({});
    writePlist(data("SafeHarbor.plist"), sl::Dictionary::create());
    log_.clear();
    auto m = make();
    EXPECT_TRUE(m->performMigration());
    EXPECT_TRUE(exists(installMap()));
    EXPECT_FALSE(exists(data("SafeHarbor.plist")));
    const std::string version = data("AppMigratorLastSystemVersion.plist");
    if (emptyRoot) {
      EXPECT_FALSE(exists(version));
      EXPECT_EQ(host(), (Lines{{E, "SLAppMigrator: Failed to write current build info to " + u(version)}}));
    } else {
      EXPECT_EQ(sl::dictionaryWithContentsOfURL(fileURL(version)), kVersion);
      EXPECT_EQ(host(), (Lines{{N, "SLAppMigrator: Recorded current system version as 21A42"}}));
    }
    sl::test::forceRemove(version);
  }
}

TEST_F(StartupAndMainPassTest, FinalCheckOfTheOldRoot) {
  const std::string note = oldRoot() + "/WhereDidMyApplicationsGo.txt";
  writeOSRelease();
  {
    SCOPED_TRACE("only the note: deleted and counted, old layout removed");
    sl::test::writeFile(note, "gone");
    writeInstallMap({});
    auto m = make();
    EXPECT_TRUE(m->performMigration());
    EXPECT_EQ(Access::countItemsMigrated(*m), 1u);
    EXPECT_FLOAT_EQ(m->migrationProgress(), 1.0f);
    EXPECT_FALSE(exists(oldRoot()));
    EXPECT_FALSE(exists(installMap()));
    EXPECT_EQ(host(), (Lines{{N, "SLAppMigrator: 1 items to migrate"},
                             {N, "SLAppMigrator: Introspecting " + u(note)},
                             {N, "SLAppMigrator: Recorded current system version as 21A42"}}));
  }
  {
    SCOPED_TRACE("a link in the root is never migrated but fails the final check");
    log_.clear();
    sl::test::forceRemove(data("AppMigratorLastSystemVersion.plist"));
    sl::test::writeFile(note, "gone");
    sl::test::makeSymlink("/nonexistent", oldRoot() + "/link");
    auto m = make();
    EXPECT_EQ(Access::itemsToMigrate(*m)->size(), 1u);
    EXPECT_FALSE(m->performMigration());
    EXPECT_TRUE(exists(oldRoot() + "/link"));
    EXPECT_FALSE(exists(data("AppMigratorLastSystemVersion.plist")));
    EXPECT_EQ(host(),
              (Lines{{N, "SLAppMigrator: 1 items to migrate"},
                     {N, "SLAppMigrator: Old install map not found at " + u(installMap())},
                     {N, "SLAppMigrator: Introspecting " + u(note)},
                     {E, "SLAppMigrator: Not removing " + u(installMap()) + " because 1 items remain unmigrated."},
                     {E, kReturningFailed}}));
  }
}

// Application containers go first, the last found first; VPN-only ones
// follow in listing order. Their migration fails (the registry knows no
// plug-in), the pass goes on, and the containers left fail the run.
TEST_F(StartupAndMainPassTest, ApplicationRecordsAreMigratedFirst) {
  for (const std::string name : {"A", "B", "C", "X", "Y"})
    makeBundle(oldRoot() + "/" + name + "/" + name + (name < "X" ? ".app" : ".vpnplugin"), "com.example." + name);
  auto m = make();
  std::vector<std::string> apps, plugins;
  for (const sl::URL& item : *Access::itemsToMigrate(*m)) {
    const std::string name = item.lastPathComponent();
    const std::string line = "SLAppMigrator: Migrating com.example." + name + " at " + item.path() + "/" + name;
    if (name < "X")
      apps.insert(apps.begin(), line + ".app");
    else
      plugins.push_back(line + ".vpnplugin");
  }
  apps.insert(apps.end(), plugins.begin(), plugins.end());
  EXPECT_FALSE(m->performMigration());
  std::vector<std::string> migrating;
  for (const std::string& message : hostMessages(log_))
    if (message.starts_with("SLAppMigrator: Migrating ")) migrating.push_back(message);
  EXPECT_EQ(migrating, apps);
  EXPECT_EQ(Access::countItemsMigrated(*m), 5u);
  EXPECT_FLOAT_EQ(m->migrationProgress(), 1.0f);
}

// One application unknown to the registry, with its data and one group, from
// the old layout to the registry's containers: placeholder first, then the
// data, then the real bundle.
TEST_F(StartupAndMainPassTest, OneContainerEndToEnd) {
  const std::string c = oldRoot() + "/C", group = below("/private/var/mobile/OldGroups/G");
  const sl::String identifier("com.example.a");
  makeBundle(c + "/A.app", identifier.str(), "1.0", {"group.example.g"});
  const char* const dataItems[] = {"Documents", "Library", "tmp", "Tillbox"};
  for (const char* item : dataItems) sl::test::writeFile(c + "/" + item + "/file", item);
  // Marker-family names are no leftovers.
  for (const char* name : {"migration_marker", "placeholder"}) sl::test::writeFile(c + "/com.vantor.stowline." + name);
  sl::test::writeFile(group + "/shared", "group data");
  writeInstallMap({{"group.example.g", group}});
  writeOSRelease();

  auto m = make();
  EXPECT_TRUE(m->performMigration());

  auto proxy = RGBundleProxy::bundleProxyForIdentifier(identifier);
  ASSERT_TRUE(proxy);
  EXPECT_EQ(proxy->bundleType().str(), "User");
  const std::string dataContainer = proxy->dataContainerURL().path();
  for (const char* item : dataItems) EXPECT_EQ(sl::test::readFile(dataContainer + "/" + item + "/file"), item);
  const sl::Dictionary info =
      sl::dictionaryWithContentsOfURL(proxy->bundleURL().URLByAppendingPathComponent("Info.plist", false));
  EXPECT_EQ(info.get("PBBundleIdentifier").asString(), "com.example.a");
  const sl::URL newGroup = proxy->groupContainerURLs().get("group.example.g").asURL();
  EXPECT_EQ(sl::test::readFile(newGroup.path() + "/shared"), "group data");
  EXPECT_FALSE(exists(group));
  EXPECT_FALSE(exists(oldRoot()));
  EXPECT_FALSE(exists(installMap()));
  EXPECT_EQ(sl::dictionaryWithContentsOfURL(fileURL(data("AppMigratorLastSystemVersion.plist"))), kVersion);

  // The run as the host log shows it, from its first lines to its last.
  const Lines lines = host();
  ASSERT_GE(lines.size(), 3u);
  EXPECT_EQ(lines[0], (Line{N, "SLAppMigrator: 1 items to migrate"}));
  EXPECT_EQ(lines[1], (Line{N, "SLAppMigrator: Introspecting " + u(c, true)}));
  EXPECT_EQ(lines.back(), (Line{N, "SLAppMigrator: Recorded current system version as 21A42"}));
  for (const std::string& line : {"Moving data from container " + u(c, true) + " to " + u(dataContainer, true),
                                  "Staging and installing app com.example.a at " + u(c + "/A.app", true) +
                                      " (and secondary (null))",
                                  "Removing container for com.example.a at " + u(c, true)})
    EXPECT_NE(std::find(lines.begin(), lines.end(), Line{N, "SLAppMigrator: " + line}), lines.end()) << line;
}

}  // namespace
