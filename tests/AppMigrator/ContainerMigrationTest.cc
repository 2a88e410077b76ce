// One old container carried into the registry's layout, the user-data move,
// and the safe harbors; on real trees in the fixture's root with the
// embedded registry.
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "FileManager/SLFileManager.h"
#include "MigratorTestSupport.h"

namespace {

using namespace mgtest;
using sl::test::exists;
using sl::test::makeDirs;
using sl::test::readFile;
using sl::test::writeFile;
const std::string kMarker = "com.vantor.stowline.container_migrator.plist";

class ContainerMigrationTest : public MigratorTest {
 protected:
  // ROOT/private/var/mobile/Applications/NAME holding NAME.app (identifier
  // `id`), Documents/doc.txt and Library/Preferences/prefs.plist.
  sl::Dictionary makeContainer(const std::string& name, const std::string& id, const std::string& bundleId = "") {
    const std::string container = oldEntry(name);
    makeBundle(container + "/" + name + ".app", bundleId.empty() ? id : bundleId);
    writeFile(container + "/Documents/doc.txt", "doc of " + id);
    writeFile(container + "/Library/Preferences/prefs.plist", "prefs of " + id);
    return sl::Dictionary{{"ContainerPath", sl::String(container)},
                          {"BundlePath", sl::String(container + "/" + name + ".app")},
                          {"ContainerType", sl::String("App")},
                          {"BundleIdentifier", sl::String(id)}};
  }
  // What an earlier run leaves after its placeholder install.
  void installPlaceholder(const std::string& id) { installInRegistry(*registry_, id, RGPackageTypePlaceholder); }
  static std::shared_ptr<RGBundleProxy> proxy(const std::string& id) {
    return RGBundleProxy::bundleProxyForIdentifier(sl::String(id));
  }
  bool migrate(const sl::Dictionary& record) {
    return SLAppMigratorTestAccess::migrateContainer(*migrator_, record);
  }
  bool logged(int level, const std::string& message) const {
    const Lines lines = hostLines(log_);
    return std::find(lines.begin(), lines.end(), std::pair(level, message)) != lines.end();
  }
  static std::string path(const sl::Dictionary& record, const char* key) { return record.get(key).asString().str(); }

  std::unique_ptr<SLAppMigrator> migrator_ = SLAppMigratorTestAccess::bare();
};

TEST_F(ContainerMigrationTest, FailuresBeforeTheDataMovesKeepTheContainerWithItsMarker) {
  // A VPN plug-in never gets a placeholder; unknown to the registry, it fails.
  // Its marker keeps the bytes of a name that is not UTF-8.
  sl::Dictionary vpn = makeContainer("V\xff", "com.example.vpn");
  vpn.set("ContainerType", sl::String("VPNBundle"));
  EXPECT_FALSE(migrate(vpn));
  EXPECT_EQ(sl::dictionaryWithContentsOfURL(fileURL(path(vpn, "ContainerPath") + "/" + kMarker)), vpn);
  EXPECT_TRUE(exists(path(vpn, "ContainerPath") + "/Documents/doc.txt"));
  EXPECT_FALSE(registry_->applicationIsInstalled(sl::String("com.example.vpn")));
  EXPECT_TRUE(logged(sl::kLogLevelError, "SLAppMigrator: Failed to get bundle proxy for identifier com.example.vpn"));

  // An item of its own stays behind after the install (a link counts too):
  // leftovers.
  const sl::Dictionary left = makeContainer("L", "com.example.left");
  const std::string container = path(left, "ContainerPath");
  sl::test::makeSymlink("/nowhere", container + "/notes");
  EXPECT_FALSE(migrate(left));
  EXPECT_TRUE(exists(container + "/" + kMarker));
  EXPECT_TRUE(exists(container + "/notes"));
  EXPECT_TRUE(logged(sl::kLogLevelError, "SLAppMigrator: Found missed items in file://" + container +
                                             "/ for com.example.left: (\n    file://" + container + "/notes\n)"));
}

// A registry whose proxy knows the application but gives no data
// container: the migrator says what the proxy did give, and keeps the
// container.
TEST_F(ContainerMigrationTest, ProxyWithoutDataContainerIsDescribed) {
  struct Proxy : RGBundleProxy {
    sl::String bundleIdentifier() const override { return sl::String("com.example.nodata"); }
    sl::String bundleType() const override { return sl::String("User"); }
    sl::URL bundleURL() const override { return sl::URL::fileURLWithPath("/b/N.app", true); }
    sl::URL bundleContainerURL() const override { return sl::URL(); }
    sl::URL dataContainerURL() const override { return sl::URL(); }
    sl::Dictionary groupContainerURLs() const override { return sl::Dictionary::create(); }
    bool foundBackingBundle() const override { return false; }
  };
  struct Workspace : RGApplicationWorkspace {
    bool applicationIsInstalled(const sl::String&) override { return true; }
    bool installApplication(const sl::URL&, const sl::Dictionary&, sl::Error*, const RGProgressHandler&) override {
      return false;
    }
    std::shared_ptr<RGBundleProxy> bundleProxyForIdentifier(const sl::String&) override {
      return std::make_shared<Proxy>();
    }
  };
  RGApplicationWorkspace::setDefaultWorkspace(std::make_shared<Workspace>());
  const sl::Dictionary record = makeContainer("N", "com.example.nodata");
  log_.clear();
  EXPECT_FALSE(migrate(record));
  EXPECT_TRUE(exists(path(record, "ContainerPath") + "/Documents/doc.txt"));
  const Lines expected = {
      {sl::kLogLevelNotice, "SLAppMigrator: App com.example.nodata is already installed, so not creating placeholder."},
      {sl::kLogLevelError, "SLAppMigrator: Failed to get data container URL for com.example.nodata"},
      {sl::kLogLevelError, "SLAppMigrator: Proxy had bundle identifier com.example.nodata"},
      {sl::kLogLevelError, "SLAppMigrator: Proxy had bundle type User"},
      {sl::kLogLevelError, "SLAppMigrator: Proxy had bundle URL file:///b/N.app/"},
      {sl::kLogLevelError, "SLAppMigrator: Proxy had bundle container URL (null)"},
      {sl::kLogLevelError, "SLAppMigrator: Proxy did not have backing bundle"},
  };
  EXPECT_EQ(hostLines(log_), expected);
}

TEST_F(ContainerMigrationTest, ContainerGoesOnceTheDataHasMoved) {
  // An old bundle that is a placeholder itself: data moved, nothing installed.
  const sl::Dictionary placeholder = makeContainer("P", "com.example.p");
  ASSERT_TRUE(SLFileManager::defaultManager().markBundleAsPlaceholder(fileURL(path(placeholder, "BundlePath"), true)));
  EXPECT_TRUE(migrate(placeholder));
  EXPECT_FALSE(exists(path(placeholder, "ContainerPath")));
  ASSERT_TRUE(proxy("com.example.p"));
  EXPECT_EQ(proxy("com.example.p")->bundleType().str(), "Placeholder");
  EXPECT_EQ(readFile(proxy("com.example.p")->dataContainerURL().path() + "/Documents/doc.txt"), "doc of com.example.p");

  // The registry refuses the real bundle (its identifier is another): the
  // container still goes, the result is false, the data is in place.
  installPlaceholder("com.example.f");
  const sl::Dictionary refused = makeContainer("F", "com.example.f", "com.example.other");
  EXPECT_FALSE(migrate(refused));
  EXPECT_FALSE(exists(path(refused, "ContainerPath")));
  EXPECT_EQ(readFile(proxy("com.example.f")->dataContainerURL().path() + "/Documents/doc.txt"), "doc of com.example.f");
  EXPECT_TRUE(logged(sl::kLogLevelNotice, "SLAppMigrator: App com.example.f is already installed, so not creating "
                                          "placeholder."));

  // A built-in application at a higher version refuses the install, and
  // that is success.
  makeBundle(root() + "/Applications/B.app", "com.example.builtin", "9.0");
  SLGlobalConfiguration::sharedInstance().reScanSystemApps();
  const sl::Dictionary builtIn = makeContainer("B", "com.example.builtin");
  EXPECT_TRUE(migrate(builtIn));
  EXPECT_TRUE(logged(sl::kLogLevelNotice, "SLAppMigrator: Installation of " + u(path(builtIn, "BundlePath"), true) +
                                              " failed because it's older than what's built into the system. Data "
                                              "migration already happened so we're done here."));
  EXPECT_FALSE(exists(path(builtIn, "ContainerPath")));
  EXPECT_EQ(readFile(proxy("com.example.builtin")->dataContainerURL().path() + "/Documents/doc.txt"),
            "doc of com.example.builtin");
}

TEST_F(ContainerMigrationTest, InterruptedRunFinishesWithNothingLost) {
  // The earlier run installed the placeholder, moved the data and the bundle
  // into Staging/Payload, then stopped.
  const sl::Dictionary record = makeContainer("R", "com.example.r");
  const std::string container = path(record, "ContainerPath");
  installPlaceholder("com.example.r");
  const std::string data = proxy("com.example.r")->dataContainerURL().path();
  sl::test::forceRemove(data + "/Documents");
  ASSERT_EQ(::rename((container + "/Documents").c_str(), (data + "/Documents").c_str()), 0);
  sl::test::forceRemove(container + "/Library");
  makeDirs(container + "/Staging/Payload");
  ASSERT_EQ(::rename(path(record, "BundlePath").c_str(), (container + "/Staging/Payload/R.app").c_str()), 0);
  writePlist(container + "/" + kMarker, record);

  EXPECT_TRUE(migrate(record));
  EXPECT_FALSE(exists(container));
  EXPECT_EQ(proxy("com.example.r")->bundleType().str(), "User");
  EXPECT_EQ(proxy("com.example.r")->dataContainerURL().path(), data);
  EXPECT_EQ(readFile(data + "/Documents/doc.txt"), "doc of com.example.r");
  EXPECT_TRUE(exists(proxy("com.example.r")->bundleURL().path() + "/Exec"));
}

TEST_F(ContainerMigrationTest, DataItemsReplaceTheirNamesakesAndStopAtTheFirstFailure) {
  sl::test::TempDir dir(sl::test::TempDir::kShm);
  const std::string from = dir / "from", to = dir / "to";
  writeFile(from + "/Documents/new.txt", "new");
  writeFile(from + "/Library/new.txt", "new lib");
  writeFile(to + "/Library/old.txt");
  writeFile(to + "/tmp/keep.txt", "keep");
  auto move = [&] {
    return SLAppMigratorTestAccess::migrateData(*migrator_, sl::String("com.example.d"), fileURL(from, true),
                                                fileURL(to, true));
  };
  EXPECT_TRUE(move());
  EXPECT_EQ(readFile(to + "/Documents/new.txt"), "new");
  EXPECT_EQ(readFile(to + "/Library/new.txt"), "new lib");
  EXPECT_FALSE(exists(to + "/Library/old.txt"));
  EXPECT_EQ(readFile(to + "/tmp/keep.txt"), "keep");  // no "tmp" in the old container
  EXPECT_FALSE(exists(from + "/Documents"));

  // The second item's destination is a non-empty directory that the
  // migrator (running as nobody) cannot empty.
  sl::test::forceRemove(from);
  sl::test::forceRemove(to);
  for (const char* name : {"Documents", "Library", "tmp", "Tillbox"}) writeFile(from + "/" + name + "/f", name);
  writeFile(to + "/Library/root.txt");
  for (const std::string& p : {from, to, from + "/Documents", from + "/Library", from + "/tmp", from + "/Tillbox"})
    ASSERT_EQ(::chown(p.c_str(), sl::test::ScopedUnprivileged::kUid, sl::test::ScopedUnprivileged::kGid), 0);
  log_.clear();
  {
    sl::test::ScopedUnprivileged nobody;
    EXPECT_FALSE(move());
  }
  EXPECT_EQ(readFile(to + "/Documents/f"), "Documents");
  EXPECT_EQ(readFile(from + "/Library/f"), "Library");
  EXPECT_TRUE(exists(from + "/tmp/f") && exists(from + "/Tillbox/f"));
  EXPECT_FALSE(exists(to + "/tmp") || exists(to + "/Tillbox"));
  const std::vector<std::string> messages = hostMessages(log_);
  ASSERT_EQ(messages.size(), 1u);
  EXPECT_TRUE(messages[0].starts_with("SLAppMigrator: Failed to move " + u(from + "/Library", true) + " to " +
                                      u(to + "/Library", true) + " migrating for com.example.d : Error Domain=" +
                                      "POSIXErrorDomain Code=" + std::to_string(ENOTEMPTY) + " "))
      << messages[0];
}

TEST_F(ContainerMigrationTest, SafeHarbors) {
  const std::string mapFile = below(kDataDirectory) + "/SafeHarbor.plist";
  auto run = [&](const sl::Dictionary& map) {
    writeFile(mapFile, "map");
    SLAppMigratorTestAccess::harborMap(*migrator_) = map;
    log_.clear();
    return SLAppMigratorTestAccess::migrateSafeHarbors(*migrator_);
  };
  // No map (none, or unreadable at start-up): nothing happens.
  EXPECT_TRUE(run(nullptr));
  EXPECT_TRUE(exists(mapFile));
  EXPECT_TRUE(log_.host().empty());
  // Empty and malformed maps are done with.
  EXPECT_TRUE(run(sl::Dictionary::create()));
  EXPECT_FALSE(exists(mapFile));
  EXPECT_TRUE(run(sl::Dictionary{{"com.example.n", sl::Dictionary{{"HarborPathKey", sl::Number(5)}}},
                                 {"com.example.s", sl::String("not an entry")}}));
  EXPECT_FALSE(exists(mapFile));
  EXPECT_EQ(hostMessages(log_),
            (std::vector<std::string>{
                "SLAppMigrator: Failed to get harbor path from harbor entry for com.example.n : {\n"
                "    HarborPathKey = 5;\n}",
                "SLAppMigrator: Failed to get harbor info for identifier com.example.s"}));

  // One registration fails: the other is still made, and the map stays.
  const std::string harbor = root() + "/private/var/harbor", missing = root() + "/private/var/missing";
  makeDirs(harbor);
  EXPECT_FALSE(run(sl::Dictionary{{"com.example.a", sl::Dictionary{{"HarborPathKey", sl::String(missing)}}},
                                  {"com.example.b", sl::Dictionary{{"HarborPathKey", sl::String(harbor)}}}}));
  EXPECT_TRUE(exists(mapFile));
  EXPECT_EQ(registry_->safeHarborForIdentifier("com.example.b"), std::make_pair(harbor, 2));
  EXPECT_FALSE(registry_->safeHarborForIdentifier("com.example.a"));
  EXPECT_TRUE(logged(sl::kLogLevelError,
                     "SLAppMigrator: Failed to migrate safe harbor for identifier com.example.a at " + missing + " : " +
                         StowlineCopyLastSafeHarborRegistrationError().description()));
  EXPECT_TRUE(logged(sl::kLogLevelNotice, "SLAppMigrator: Migrating safe harbor for com.example.b at " + harbor));
}

}  // namespace
