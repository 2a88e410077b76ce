// Classifying old containers and reading back the migration marker.
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>

#include "FileManager/SLFileManager.h"
#include "MigratorTestSupport.h"

namespace {

using namespace mgtest;
using sl::test::exists;
constexpr int E = sl::kLogLevelError;
constexpr int N = sl::kLogLevelNotice;
const std::string kMarker = "com.vantor.stowline.container_migrator.plist";

class IntrospectionTest : public MigratorTest {
 protected:
  void SetUp() override {
    MigratorTest::SetUp();
    migrator_ = SLAppMigrator::create();  // before the old root exists: init leaves it alone
    ASSERT_TRUE(migrator_);
    sl::test::makeDirs(below(kOldRoot));
    log_.clear();
  }
  sl::Dictionary introspect(const std::string& path, bool* early, bool dir = true) {
    return SLAppMigratorTestAccess::introspect(*migrator_, fileURL(path, dir), early);
  }
  Lines host() {
    Lines out = hostLines(log_);
    log_.clear();
    return out;
  }
  std::unique_ptr<SLAppMigrator> migrator_;
};

TEST_F(IntrospectionTest, EntriesWithoutBundleAreRemovedOrIgnored) {
  bool early = false;
  sl::test::writeFile(oldEntry("stray"), "x");
  EXPECT_TRUE(introspect(oldEntry("stray"), &early, false).isNull());
  EXPECT_FALSE(exists(oldEntry("stray")));
  EXPECT_EQ(host(), (Lines{{E, "SLAppMigrator: Found regular file at " + u(oldEntry("stray")) + " ; removing"}}));

  // Data, and a bundle without identifier, which counts as no bundle.
  const std::string c = oldEntry("C");
  for (const char* name : {"Documents/f", "Library", "tmp", "A.app"}) sl::test::makeDirs(c + "/" + name);
  EXPECT_TRUE(introspect(c, &early).isNull());
  EXPECT_FALSE(exists(c));
  EXPECT_EQ(host(), (Lines{{N, "SLAppMigrator: Found app " + u(c + "/A.app", true)},
                           {E, "SLAppMigrator: Could not get identifier for bundle at " + u(c + "/A.app", true)},
                           {E, "SLAppMigrator: No app or vpn bundle found in container " + u(c, true) +
                                   " ; removing it"}}));

  EXPECT_TRUE(introspect(oldEntry("gone"), &early).isNull());
  EXPECT_EQ(host(), (Lines{{N, "SLAppMigrator: Got ENOENT when introspecting " + u(oldEntry("gone"), true) +
                                   " ; ignoring (likely raced with stowd)"}}));
}

// The listing order cannot be forced; containers made in opposite orders
// (tmpfs lists by creation) must give the same record, each listing seeing
// both bundles.
TEST_F(IntrospectionTest, AppWinsOverVPNPluginInEitherOrder) {
  for (const std::string name : {"AppFirst", "VPNFirst", "VPNOnly"}) {
    SCOPED_TRACE(name);
    const std::string c = oldEntry(name), app = c + "/A.app", vpn = c + "/P.vpnplugin";
    if (name == "AppFirst") makeBundle(app, "com.a");
    makeBundle(vpn, "com.p");
    if (name == "VPNFirst") makeBundle(app, "com.a");
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
  makeBundle(below("/Real.app"), "com.real");
  const std::string app = oldEntry("L1/A.app"), vpn = oldEntry("L2/P.vpnplugin"), marker = oldEntry("L3/" + kMarker);
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
    sl::test::makeSymlink(below("/Real.app"), link);
    bool early = false;
    EXPECT_TRUE(introspect(c, &early).isNull());
    EXPECT_TRUE(exists(link));
    EXPECT_EQ(host(), lines);
  }

  // Not searchable: any name with a dot, even one without an extension, is
  // stat'ed and fails. Not readable: the listing fails.
  const std::string closed = oldEntry("Closed"), unreadable = oldEntry("Unreadable");
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
  // A valid marker (listed first: tmpfs lists by creation) is the record as
  // it stands; the early flag follows its "ContainerType" alone.
  for (const std::string type : {"App", "VPNBundle", "Other"}) {
    const std::string c = oldEntry("M" + type);
    sl::Dictionary marker{{"ContainerPath", sl::String("/else")}, {"BundlePath", sl::String("/else/B.app")},
                          {"ContainerType", sl::String(type)},   {"BundleIdentifier", sl::String("com.b")},
                          {"Extra", sl::Number(7)}};
    writePlist(c + "/" + kMarker, marker);
    makeBundle(c + "/A.app", "com.a");
    bool early = type != "App";
    EXPECT_EQ(introspect(c, &early).description(), marker.description()) << type;
    EXPECT_EQ(early, type == "App") << type;
  }

  // An invalid marker drops the record, after the validation's own line; a
  // bundle keeps the container.
  auto changed = [](const char* key, const sl::Value& value) {  // a null value removes the key
    sl::Dictionary d{{"ContainerPath", sl::String("/c")}, {"BundlePath", sl::String("/c/A.app")},
                     {"ContainerType", sl::String("App")}, {"BundleIdentifier", sl::String("com.a")}};
    if (key) d.set(key, value);
    return d;
  };
  const struct {
    const char* name;
    sl::Value content;
    std::string message;  // "" for the load failure itself
  } cases[] = {
      {"NotADictWithApp", sl::Array{changed(nullptr, nullptr)}, ""},
      {"NotADictAlone", sl::Array{changed(nullptr, nullptr)}, ""},
      {"NoBundlePathWithApp", changed("BundlePath", nullptr), "Failed to get bundle path from migration marker file "},
      {"SecondNotAStringAlone", changed("SecondBundlePath", sl::Number(42)), "Second bundle path was not a string: 42"},
  };
  for (const auto& [name, content, message] : cases) {
    SCOPED_TRACE(name);
    const std::string c = oldEntry(name), marker = c + "/" + kMarker;
    const bool withBundle = std::string(name).ends_with("WithApp");
    writePlist(marker, content);
    if (withBundle) makeBundle(c + "/A.app", "com.a");
    bool early = false;
    EXPECT_TRUE(introspect(c, &early).isNull());
    EXPECT_EQ(exists(c), withBundle);
    const Lines lines = host();
    const std::pair failed{E, "SLAppMigrator: Failed to load migration marker file from " + u(marker)};
    EXPECT_EQ(std::count(lines.begin(), lines.end(), failed), message.empty() ? 2 : 1);
    if (!message.empty()) {
      const std::string own = "SLAppMigrator: " + message + (message.ends_with(' ') ? u(marker) : "");
      EXPECT_EQ(std::count(lines.begin(), lines.end(), std::pair{E, own}), 1) << own;
    }
  }
}

}  // namespace
