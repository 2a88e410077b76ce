// Classifying old containers and reading back the migration marker.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "FileManager/SLFileManager.h"
#include "MigratorTestSupport.h"

namespace {

using sl::test::exists;
using sl::test::fileURL;
using Lines = std::vector<std::pair<int, std::string>>;
constexpr int E = sl::kLogLevelError;
constexpr int N = sl::kLogLevelNotice;
const std::string kMarker = "com.vantor.stowline.container_migrator.plist";

class IntrospectionTest : public mgtest::MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    migrator_ = SLAppMigrator::create();  // before the old root exists: init leaves it alone
    ASSERT_TRUE(migrator_);
    sl::test::makeDirs(mgtest::below(mgtest::kOldRoot));
    log_.clear();
  }
  static std::string entry(const std::string& name) { return mgtest::below(mgtest::kOldRoot) + "/" + name; }
  static std::string u(const std::string& path, bool dir = false) { return fileURL(path, dir).absoluteString(); }
  sl::Dictionary introspect(const std::string& path, bool* early, bool dir = true) {
    return SLAppMigratorTestAccess::introspect(*migrator_, fileURL(path, dir), early);
  }
  Lines host() {
    Lines out;
    for (const auto& line : log_.host()) out.emplace_back(line.level, line.message);
    log_.clear();
    return out;
  }
  static void write(const std::string& path, const sl::Value& value) {
    ASSERT_TRUE(sl::writePropertyListToURL(value, fileURL(path)));
  }
  std::unique_ptr<SLAppMigrator> migrator_;
};

TEST_F(IntrospectionTest, EntriesWithoutBundleAreRemovedOrIgnored) {
  bool early = false;
  sl::test::writeFile(entry("stray"), "x");
  EXPECT_TRUE(introspect(entry("stray"), &early, false).isNull());
  EXPECT_FALSE(exists(entry("stray")));
  EXPECT_EQ(host(), (Lines{{E, "SLAppMigrator: Found regular file at " + u(entry("stray")) + " ; removing"}}));

  // Data, and a bundle without identifier, which counts as no bundle.
  const std::string c = entry("C");
  for (const char* name : {"Documents/f", "Library", "tmp", "A.app"}) sl::test::makeDirs(c + "/" + name);
  EXPECT_TRUE(introspect(c, &early).isNull());
  EXPECT_FALSE(exists(c));
  EXPECT_EQ(host(), (Lines{{N, "SLAppMigrator: Found app " + u(c + "/A.app", true)},
                           {E, "SLAppMigrator: Could not get identifier for bundle at " + u(c + "/A.app", true)},
                           {E, "SLAppMigrator: No app or vpn bundle found in container " + u(c, true) +
                                   " ; removing it"}}));

  EXPECT_TRUE(introspect(entry("gone"), &early).isNull());
  EXPECT_EQ(host(), (Lines{{N, "SLAppMigrator: Got ENOENT when introspecting " + u(entry("gone"), true) +
                                   " ; ignoring (likely raced with stowd)"}}));
}

// The listing order cannot be forced; containers made in opposite orders
// (tmpfs lists by creation) must give the same record, each listing seeing
// both bundles.
TEST_F(IntrospectionTest, AppWinsOverVPNPluginInEitherOrder) {
  for (const std::string name : {"AppFirst", "VPNFirst", "VPNOnly"}) {
    SCOPED_TRACE(name);
    const std::string c = entry(name), app = c + "/A.app", vpn = c + "/P.vpnplugin";
    if (name == "AppFirst") mgtest::makeBundle(app, "com.a");
    mgtest::makeBundle(vpn, "com.p");
    if (name == "VPNFirst") mgtest::makeBundle(app, "com.a");
    const bool hasApp = name != "VPNOnly";
    bool early = !hasApp;
    sl::Dictionary expected{{"ContainerPath", sl::String(c)},
                            {"BundlePath", sl::String(hasApp ? app : vpn)},
                            {"ContainerType", sl::String(hasApp ? "App" : "VPNBundle")},
                            {"BundleIdentifier", sl::String(hasApp ? "com.a" : "com.p")}};
    if (hasApp) expected.set("SecondBundlePath", sl::String(vpn));
    EXPECT_EQ(introspect(c, &early).description(), expected.description());
    EXPECT_EQ(early, hasApp);
    Lines lines = host(), seen{{N, "SLAppMigrator: Found vpn plugin " + u(vpn, true)}};
    if (hasApp) seen.insert(seen.begin(), {N, "SLAppMigrator: Found app " + u(app, true)});
    std::sort(lines.begin(), lines.end());
    EXPECT_EQ(lines, seen);
  }
}

TEST_F(IntrospectionTest, LinksAndUnexaminableEntriesLeaveTheContainerInPlace) {
  mgtest::makeBundle(mgtest::below("/Real.app"), "com.real");
  const std::string app = entry("L1/A.app"), vpn = entry("L2/P.vpnplugin"), marker = entry("L3/" + kMarker);
  const std::pair<std::string, Lines> cases[] = {
      {app, {{E, "SLAppMigrator: Skipping container with app symlink at " + u(app)}}},
      {vpn,
       {{N, "SLAppMigrator: Found vpn plugin " + u(vpn)},
        {E, "SLAppMigrator: VPN plugin was symlink; skipping container " + u(vpn)}}},
      {marker,
       {{N, "SLAppMigrator: Found migration marker " + u(marker)},
        {E, "SLAppMigrator: Migration marker was symlink; skipping container " + u(marker)}}},
  };
  for (const auto& [link, lines] : cases) {
    SCOPED_TRACE(link);
    const std::string c = link.substr(0, link.rfind('/'));
    sl::test::makeDirs(c);
    sl::test::makeSymlink(mgtest::below("/Real.app"), link);
    bool early = false;
    EXPECT_TRUE(introspect(c, &early).isNull());
    EXPECT_TRUE(exists(link));
    EXPECT_EQ(host(), lines);
  }

  // Not searchable: any name with a dot, even one without an extension, is
  // stat'ed and fails. Not readable: the listing fails.
  const std::string closed = entry("Closed"), unreadable = entry("Unreadable");
  sl::test::writeFile(closed + "/.hidden");
  sl::test::makeDirs(unreadable);
  ASSERT_EQ(::chmod(closed.c_str(), 0744), 0);
  ASSERT_EQ(::chmod(unreadable.c_str(), 0711), 0);
  sl::test::ScopedUnprivileged nobody;
  bool early = false;
  EXPECT_TRUE(introspect(closed, &early).isNull());
  EXPECT_TRUE(introspect(unreadable, &early).isNull());
  sl::Error error;
  ASSERT_FALSE(SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(fileURL(unreadable, true), false, &error));
  EXPECT_EQ(host(), (Lines{{E, "SLAppMigrator: Failed to stat path " + closed + "/.hidden : Permission denied"},
                           {E, "SLAppMigrator: Failed to get URLs in container " + u(unreadable, true) + " : " +
                                   error.description()}}));
}

TEST_F(IntrospectionTest, MarkerInContainer) {
  // A valid marker is the record as it stands; the early flag follows its
  // "ContainerType" alone.
  for (const std::string type : {"App", "VPNBundle", "Other"}) {
    const std::string c = entry("M" + type);
    mgtest::makeBundle(c + "/A.app", "com.a");
    sl::Dictionary marker{{"ContainerPath", sl::String("/else")}, {"BundlePath", sl::String("/else/B.app")},
                          {"ContainerType", sl::String(type)},   {"BundleIdentifier", sl::String("com.b")},
                          {"Extra", sl::Number(7)}};
    write(c + "/" + kMarker, marker);
    bool early = type != "App";
    EXPECT_EQ(introspect(c, &early).description(), marker.description()) << type;
    EXPECT_EQ(early, type == "App") << type;
  }

  // An invalid marker drops the record; a bundle keeps the container.
  for (const bool withBundle : {true, false}) {
    host();
    const std::string c = entry(withBundle ? "BadWithApp" : "BadAlone");
    sl::test::makeDirs(c);
    if (withBundle) mgtest::makeBundle(c + "/A.app", "com.a");
    write(c + "/" + kMarker, sl::Array{sl::String("not a dictionary")});
    bool early = false;
    EXPECT_TRUE(introspect(c, &early).isNull());
    EXPECT_EQ(exists(c), withBundle);
    const Lines lines = host();
    const std::pair failed{E, "SLAppMigrator: Failed to load migration marker file from " + u(c + "/" + kMarker)};
    EXPECT_EQ(std::count(lines.begin(), lines.end(), failed), 2) << withBundle;
  }
}

TEST_F(IntrospectionTest, MarkerValidation) {
  const std::string path = entry(kMarker);
  auto marker = [](std::initializer_list<std::pair<const std::string, sl::Value>> changes) {
    sl::Dictionary d{{"ContainerPath", sl::String("/c")}, {"BundlePath", sl::String("/c/A.app")},
                     {"ContainerType", sl::String("App")}, {"BundleIdentifier", sl::String("com.a")}};
    for (const auto& [key, value] : changes) d.set(key, value);  // a null value removes the key
    return d;
  };
  const std::pair<sl::Value, std::string> cases[] = {
      {marker({}), ""},
      {marker({{"ContainerType", sl::String("Other")}}), ""},
      {marker({{"SecondBundlePath", sl::Number(42)}}), "Second bundle path was not a string: 42"},
      {sl::Array{marker({})}, "Failed to load migration marker file from " + u(path)},
      {marker({{"BundlePath", nullptr}, {"ContainerType", nullptr}}),
       "Failed to get bundle path from migration marker file " + u(path)},
  };
  for (const auto& [content, message] : cases) {
    SCOPED_TRACE(content.description());
    write(path, content);
    const sl::Dictionary loaded = SLAppMigratorTestAccess::loadMarker(*migrator_, fileURL(path));
    EXPECT_EQ(loaded.description(), message.empty() ? content.description() : "(null)");
    EXPECT_EQ(host(), (message.empty() ? Lines{} : Lines{{E, "SLAppMigrator: " + message}}));
  }
}

}  // namespace
