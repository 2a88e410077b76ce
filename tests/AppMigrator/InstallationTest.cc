// Bundle staging and installation, placeholder installation and group
// container migration, against the embedded registry in the fixture's root.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

#include "AppMigrator/MigratorTestSupport.h"
#include "FileManager/SLFileManager.h"
#include "Platform/FileData.h"
#include "Platform/ImageDestination.h"
#include "Platform/TemporaryDirectory.h"

namespace {

using mgtest::below;
using sl::test::exists;
using sl::test::fileURL;
using sl::test::LogCapture;
using Access = SLAppMigratorTestAccess;

// Sorted names in a directory (none when it cannot be listed).
std::vector<std::string> names(const std::string& dir) {
  std::vector<std::string> out;
  auto items = SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(fileURL(dir, true), false);
  for (const sl::URL& item : items.value_or(std::vector<sl::URL>())) out.push_back(item.lastPathComponent());
  std::sort(out.begin(), out.end());
  return out;
}

// Forwards to the registry and keeps what the last install call was handed:
// the options and the names in the package and in its Payload.
struct RecordingWorkspace : RGApplicationWorkspace {
  explicit RecordingWorkspace(std::shared_ptr<RGApplicationWorkspace> n) : next(std::move(n)) {}
  bool applicationIsInstalled(const sl::String& id) override { return next->applicationIsInstalled(id); }
  bool installApplication(const sl::URL& path, const sl::Dictionary& withOptions, sl::Error* error,
                          const RGProgressHandler& block) override {
    options = withOptions, entries = names(path.path()), payload = names(path.path() + "/Payload");
    return next->installApplication(path, withOptions, error, block);
  }
  std::shared_ptr<RGBundleProxy> bundleProxyForIdentifier(const sl::String& id) override {
    return next->bundleProxyForIdentifier(id);
  }
  std::shared_ptr<RGApplicationWorkspace> next;
  sl::Dictionary options;
  std::vector<std::string> entries, payload;
};

class InstallationTest : public mgtest::MigratorTest {
 protected:
  void SetUp() override { fresh(); }
  // An empty root, a fresh registry behind the recorder, no log lines.
  void fresh() {
    recorder_.reset();  // it holds the old registry
    MigratorTest::SetUp();
    recorder_ = std::make_shared<RecordingWorkspace>(registry_);
    RGApplicationWorkspace::setDefaultWorkspace(recorder_);
  }
  static std::string url(const std::string& path, bool directory = true) { return mgtest::u(path, directory); }
  std::vector<LogCapture::Line> lines() { return log_.host(); }
  static LogCapture::Line line(int level, const char* function, const std::string& message) {
    return {level, "Movanta", function, "SLAppMigrator: " + message};
  }
  const std::string c_ = below(mgtest::kOldRoot) + "/C";
  std::shared_ptr<RecordingWorkspace> recorder_;
  std::unique_ptr<SLAppMigrator> migrator_ = Access::bare();
};

constexpr char kStage[] =
    "-[SLAppMigrator _stageAndInstallBundleAtURL:withIdentifier:andVPNPluginAtURL:inContainerURL:]";
constexpr char kPlaceholder[] =
    "-[SLAppMigrator _stageAndInstallPlaceholderForBundleAtURL:withIdentifier:inContainerURL:]";
constexpr char kGroups[] = "-[SLAppMigrator _migrateGroupContainersForIdentifier:]";

TEST_F(InstallationTest, StagesAndInstallsBundles) {
  for (const bool vpn : {false, true}) {
    SCOPED_TRACE(vpn ? "with a VPN plug-in" : "without a VPN plug-in");
    fresh();
    mgtest::makeBundle(c_ + "/A.app", "com.ex.a");
    if (vpn) mgtest::makeBundle(c_ + "/P.vpnplugin", "com.ex.a.plugin");
    sl::test::writeFile(c_ + "/JukoraMetadata.plist", "meta");
    ASSERT_TRUE(Access::stageAndInstall(*migrator_, fileURL(c_ + "/A.app", true), "com.ex.a",
                                        vpn ? fileURL(c_ + "/P.vpnplugin", true) : sl::URL(), fileURL(c_, true)));
    EXPECT_EQ(recorder_->payload,
              (vpn ? std::vector<std::string>{"A.app", "P.vpnplugin"} : std::vector<std::string>{"A.app"}));
    EXPECT_EQ(recorder_->entries, (std::vector<std::string>{"JukoraMetadata.plist", "Payload"}));
    EXPECT_EQ(recorder_->options, (sl::Dictionary{{"InstallType", sl::Number(6)},
                                                  {"PackageType", sl::String("Customer")},
                                                  {"VerifyForMigrator", sl::Boolean(true)},
                                                  {"SkipBlacklist", sl::Boolean(true)},
                                                  {"PBBundleIdentifier", sl::String("com.ex.a")}}));
    const auto proxy = RGBundleProxy::bundleProxyForIdentifier("com.ex.a");
    ASSERT_TRUE(proxy);
    EXPECT_TRUE(exists(proxy->bundleURL().path()));
    EXPECT_EQ(vpn, exists(proxy->bundleContainerURL().path() + "/P.vpnplugin"));
    EXPECT_TRUE(lines().empty());
  }

  // A refusal other than a built-in application's: the handler's line, then
  // the failure with the record.
  const std::string bundle = c_ + "/A.app";
  const auto stage = [&](const char* id) {
    return Access::stageAndInstall(*migrator_, fileURL(bundle, true), id, nullptr, fileURL(c_, true));
  };
  fresh();
  mgtest::makeBundle(bundle, "com.ex.b");
  EXPECT_FALSE(stage("com.ex.c"));
  ASSERT_EQ(lines().size(), 2u);
  EXPECT_EQ(lines()[0], line(3, kStage,
                             "Installation of " + url(bundle) +
                                 " failed with Stowline error Package identifier com.ex.b does not match "
                                 "the option com.ex.c (IdentifierMismatch : " +
                                 c_ + "/Staging)"));
  EXPECT_TRUE(lines()[1].message.starts_with("SLAppMigrator: Failed to install " + url(c_ + "/Staging") +
                                                 " : Error Domain=RGErrorDomain Code=4 "));

  // The payload directory cannot be made: the bundle stays where it was.
  sl::test::forceRemove(c_ + "/Staging");
  mgtest::makeBundle(bundle, "com.ex.b");
  ASSERT_EQ(::chmod(c_.c_str(), 0555), 0);
  log_.clear();
  {
    sl::test::ScopedUnprivileged nobody;
    EXPECT_FALSE(stage("com.ex.b"));
  }
  ASSERT_EQ(lines().size(), 1u);
  EXPECT_TRUE(lines()[0].message.starts_with("SLAppMigrator: Failed to create " + url(c_ + "/Staging/Payload")));
  EXPECT_TRUE(exists(bundle + "/Info.plist"));
}

// A bundle without "PBBundleDisplayName" and "PBBundleShortVersionString".
void makePlaceholderSource(const std::string& bundle, bool icon) {
  sl::test::makeDirs(bundle);
  ASSERT_TRUE(sl::writePropertyListToURL(sl::Dictionary{{"PBBundleIdentifier", sl::String("com.ex.p")},
                                                        {"PBBundleExecutable", sl::String("Exec")},
                                                        {"PBBundleVersion", sl::String("2")},
                                                        {"Unrelated", sl::String("x")}},
                                         fileURL(bundle + "/Info.plist")));
  if (!icon) return;
  sl::MutableDataBuffer png;
  const KVImageDestinationOwner destination(KVImageDestinationCreateWithData(png, kUTTypePNG, 1));
  KVImageDestinationAddImage(destination.get(), sl::Image{4, 4, std::vector<uint8_t>(64, 200)});
  ASSERT_TRUE(KVImageDestinationFinalize(destination.get()));
  sl::test::writeFile(bundle + "/Icon.png", std::string(png.bytes.begin(), png.bytes.end()));
}

TEST_F(InstallationTest, InstallsPlaceholders) {
  const std::string bundle = c_ + "/P.app";
  const std::string staged = sl::perProcessTemporaryDirectory().path() + "/com.vantor.stowline.migrator/com.ex.p.app";
  const auto install = [&] {
    return Access::installPlaceholder(*migrator_, fileURL(bundle, true), "com.ex.p", fileURL(c_, true));
  };
  const auto options = [](bool metadata) {
    sl::Dictionary o{{"InstallType", sl::Number(6)},
                     {"PackageType", sl::String("Placeholder")},
                     {"SkipBlacklist", sl::Boolean(true)},
                     {"PBBundleIdentifier", sl::String("com.ex.p")}};
    if (metadata) o.set(RGJukoraMetadataKey, sl::Data(std::string_view("meta")));
    return o;
  };
  const auto installing = line(5, kPlaceholder, "Installing placeholder for com.ex.p");

  // The icon is written when the renderer gives one; without it, two lines.
  // Readable store metadata travels as bytes, without a line.
  for (const bool icon : {true, false}) {
    SCOPED_TRACE(icon ? "with an icon and metadata" : "without an icon or metadata");
    fresh();
    makePlaceholderSource(bundle, icon);
    if (icon) sl::test::writeFile(c_ + "/JukoraMetadata.plist", "meta");
    ASSERT_TRUE(install());
    EXPECT_EQ(recorder_->options, options(icon));
    const std::string installed = RGBundleProxy::bundleProxyForIdentifier("com.ex.p")->bundleURL().path();
    sl::Dictionary expected{{"PBBundleIdentifier", sl::String("com.ex.p")},
                            {"PBBundleExecutable", sl::String("Exec")},
                            {"PBBundleVersion", sl::String("2")}};
    if (icon) expected.set("PBBundleIconFile", sl::String("Icon.png"));
    EXPECT_EQ(sl::dictionaryWithContentsOfURL(fileURL(installed + "/Info.plist")), expected);
    EXPECT_EQ(icon, exists(installed + "/Icon.png"));
    EXPECT_EQ(lines(), (icon ? std::vector{installing}
                             : std::vector{line(3, "-[SLAppMigrator _writeIconForBundle:toURL:]",
                                                "Failed to create icon from bundle " + url(bundle)),
                                           line(3, kPlaceholder,
                                                "Writing placeholder icon for app com.ex.p to " +
                                                    url(staged + "/Icon.png", false) + " failed"),
                                           installing}));
    EXPECT_FALSE(exists(staged));
  }

  // Store metadata that cannot be read: logged, installed without.
  fresh();
  makePlaceholderSource(bundle, true);
  sl::test::makeDirs(c_ + "/JukoraMetadata.plist");
  ASSERT_TRUE(install());
  EXPECT_EQ(recorder_->options, options(false));
  ASSERT_EQ(lines().size(), 2u);
  EXPECT_TRUE(lines()[0].message.starts_with("SLAppMigrator: Failed to read " +
                                                 url(c_ + "/JukoraMetadata.plist", false) +
                                                 " : Error Domain=FileErrorDomain Code=256 "));

  // The registry refuses (never over a built-in application): the record's
  // user-info is logged, the staged directory goes.
  fresh();
  mgtest::makeBundle(below("/Applications/Builtin.app"), "com.ex.p", "1");
  SLGlobalConfiguration::sharedInstance().reScanSystemApps();
  makePlaceholderSource(bundle, true);
  EXPECT_FALSE(install());
  ASSERT_EQ(lines().size(), 2u);
  EXPECT_TRUE(lines()[1].message.starts_with("SLAppMigrator: Failed to install placeholder for com.ex.p: {"));
  EXPECT_NE(lines()[1].message.find("never installed over the built-in application com.ex.p"), std::string::npos);
  EXPECT_FALSE(exists(staged));

  // An identifier that would lead out of the staging parent: refused, and
  // what stands where it leads is not removed.
  const std::string outside = sl::perProcessTemporaryDirectory().path() + "/outside.app/kept";
  sl::test::writeFile(outside);
  log_.clear();
  EXPECT_FALSE(Access::installPlaceholder(*migrator_, fileURL(bundle, true), "../outside", fileURL(c_, true)));
  EXPECT_EQ(lines().size(), 1u);
  EXPECT_TRUE(exists(outside));
  sl::test::forceRemove(sl::perProcessTemporaryDirectory().path() + "/outside.app");

  // The staging parent lies in a shared directory. One that is not this
  // user's own (a link, another user's directory) is refused before
  // anything is made or removed through it.
  const std::string parent = staged.substr(0, staged.rfind('/'));
  const std::string elsewhere = c_ + "/elsewhere";
  sl::test::writeFile(elsewhere + "/com.ex.p.app/kept");
  sl::test::forceRemove(parent);
  sl::test::makeSymlink(elsewhere, parent);
  for (const bool link : {true, false}) {
    SCOPED_TRACE(link ? "link" : "another user's directory");
    if (!link) {
      sl::test::forceRemove(parent);
      sl::test::makeDirs(parent + "/com.ex.p.app");
      ASSERT_EQ(chown(parent.c_str(), sl::test::ScopedUnprivileged::kUid, sl::test::ScopedUnprivileged::kGid), 0);
    }
    log_.clear();
    EXPECT_FALSE(install());
    const std::string why = parent + " is not a private directory of this user";
    EXPECT_EQ(lines(), (std::vector{line(3, kPlaceholder,
                                         "Failed to create staged placeholder directory at " + url(staged) +
                                             " : Error Domain=POSIXErrorDomain Code=17 \"" + why +
                                             "\" UserInfo={LocalizedDescription=" + why + "}")}));
    EXPECT_TRUE(exists(link ? elsewhere + "/com.ex.p.app/kept" : staged));
  }
  // Our own, left open to others and holding what a stopped run left: it
  // is closed, and the placeholder is built afresh.
  fresh();
  makePlaceholderSource(bundle, true);
  sl::test::writeFile(staged + "/stale");
  ASSERT_EQ(chmod(parent.c_str(), 0777), 0);
  ASSERT_TRUE(install());
  struct stat parentStat {};
  ASSERT_EQ(lstat(parent.c_str(), &parentStat), 0);
  EXPECT_EQ(parentStat.st_mode & 07777, 0755u);
  EXPECT_FALSE(exists(RGBundleProxy::bundleProxyForIdentifier("com.ex.p")->bundleURL().path() + "/stale"));
  // An identifier with a NUL byte would name the staging parent itself
  // where the system reads the path: refused, and the parent stays.
  log_.clear();
  EXPECT_FALSE(Access::installPlaceholder(*migrator_, fileURL(bundle, true), sl::String(std::string_view("\0", 1)),
                                          fileURL(c_, true)));
  EXPECT_EQ(lines().size(), 1u);
  EXPECT_TRUE(exists(parent));

  // A bundle that is not there.
  sl::test::forceRemove(bundle);
  log_.clear();
  EXPECT_FALSE(install());
  EXPECT_EQ(lines(), (std::vector{line(3, kPlaceholder, "Failed to create PBBundle for " + url(bundle))}));
  EXPECT_FALSE(exists(staged));
}

std::string groupPath(const std::string& id, const std::string& group) {
  return RGBundleProxy::bundleProxyForIdentifier(id)->groupContainerURLs().get(group).asURL().path();
}

TEST_F(InstallationTest, MigratesGroupContainers) {
  // No group container map, or an empty one: the registry is not asked (it
  // does not know the identifier).
  EXPECT_TRUE(Access::migrateGroups(*migrator_, "com.ex.unknown"));
  sl::Dictionary& map = Access::groupContainerMap(*migrator_) = sl::Dictionary::create();
  EXPECT_TRUE(Access::migrateGroups(*migrator_, "com.ex.unknown"));
  EXPECT_TRUE(lines().empty());

  mgtest::installInRegistry(*registry_, "com.ex.a", RGPackageTypeCustomer, {"group.new", "group.shared"});
  mgtest::installInRegistry(*registry_, "com.ex.b", RGPackageTypeCustomer, {"group.shared"});
  mgtest::installInRegistry(*registry_, "com.ex.c", RGPackageTypeCustomer, {"group.empty", "group.gone"});
  const std::string old = below("/private/var/mobile/OldGroups"), shared = groupPath("com.ex.a", "group.shared");
  sl::test::writeFile(old + "/shared/file", "old");
  sl::test::writeFile(old + "/shared/sub/inner", "old");
  sl::test::makeSymlink("file", old + "/shared/link");
  sl::test::makeDirs(old + "/empty");
  sl::test::writeFile(shared + "/file", "new");
  sl::test::writeFile(shared + "/sub/newonly", "new");
  for (const char* name : {"shared", "empty", "gone"}) {
    map.set(std::string("group.") + name, sl::Dictionary{{"Container", sl::String(old + "/" + name)}});
  }
  log_.clear();

  // The first application of a group moves it: old items replace (never
  // merge with) new ones, a link moves as the link.
  EXPECT_TRUE(Access::migrateGroups(*migrator_, "com.ex.a"));
  EXPECT_EQ(sl::test::readFile(shared + "/file"), "old");
  EXPECT_EQ(names(shared + "/sub"), std::vector<std::string>{"inner"});
  char target[8] = {};
  EXPECT_EQ(::readlink((shared + "/link").c_str(), target, sizeof target - 1), 4);
  EXPECT_FALSE(exists(old + "/shared"));
  EXPECT_FALSE(map.contains("group.shared"));
  EXPECT_EQ(
      lines(),
      (std::vector{line(5, kGroups, "No group container entry to migrate for com.ex.a[group.new]"),
                   line(5, kGroups,
                        "Migrating group container group.shared at " + url(old + "/shared") + " to " + url(shared))}));

  // The second finds no entry; an empty old group goes with its entry, a
  // missing one keeps it.
  log_.clear();
  EXPECT_TRUE(Access::migrateGroups(*migrator_, "com.ex.b"));
  EXPECT_TRUE(Access::migrateGroups(*migrator_, "com.ex.c"));
  EXPECT_FALSE(exists(old + "/empty"));
  EXPECT_EQ(names(old), std::vector<std::string>{});
  EXPECT_EQ(map, (sl::Dictionary{{"group.gone", sl::Dictionary{{"Container", sl::String(old + "/gone")}}}}));
  EXPECT_EQ(lines(), (std::vector{line(5, kGroups, "No group container entry to migrate for com.ex.b[group.shared]"),
                                  line(5, kGroups,
                                       "Migrating group container group.empty at " + url(old + "/empty") + " to " +
                                           url(groupPath("com.ex.c", "group.empty"))),
                                  line(3, kGroups, "Missing source group container at " + url(old + "/gone"))}));

  // An item that cannot move (nobody cannot empty the directory in its
  // way): the others still move, and the answer is false, so the caller
  // does not remove the old container with what it still holds.
  sl::test::writeFile(old + "/partial/one", "1");
  sl::test::writeFile(old + "/partial/two", "2");
  sl::test::writeFile(old + "/into/two/kept", "root's");
  for (const char* dir : {"/partial", "/into"}) ASSERT_EQ(::chown((old + dir).c_str(), 65534, 65534), 0);
  log_.clear();
  {
    sl::test::ScopedUnprivileged nobody;
    EXPECT_FALSE(Access::moveGroupItems(*migrator_, fileURL(old + "/partial", true), fileURL(old + "/into", true)));
  }
  ASSERT_EQ(lines().size(), 1u);
  EXPECT_TRUE(lines()[0].message.starts_with("SLAppMigrator: Failed to move item " + url(old + "/partial/two", false)));
  EXPECT_EQ(names(old + "/partial"), std::vector<std::string>{"two"});
}

TEST(FileDataTest, ReadFailuresCarryTheFileDomain) {
  sl::test::TempDir dir;
  sl::test::writeFile(dir / "secret", "x", 0600);
  // A sparse file claiming more than memory holds is refused, not read.
  sl::test::writeFile(dir / "huge", "", 0644);
  ASSERT_EQ(truncate((dir / "huge").c_str(), off_t{64} << 30), 0);
  sl::test::ScopedUnprivileged nobody;
  for (const auto& [name, code, posix] :
       {std::tuple("missing", 260, ENOENT), std::tuple("secret", 257, EACCES), std::tuple("huge", 256, EFBIG)}) {
    sl::Error error;
    EXPECT_TRUE(sl::dataWithContentsOfURL(fileURL(dir / name), &error).isNull());
    EXPECT_EQ(error.domain() + std::to_string(error.code()), "FileErrorDomain" + std::to_string(code));
    EXPECT_TRUE(error.underlyingError().isPOSIX(posix)) << name;
  }
}

}  // namespace
