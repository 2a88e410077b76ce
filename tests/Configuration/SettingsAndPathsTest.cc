#include <fcntl.h>

#include <string>
#include <tuple>
#include <vector>

#include <gtest/gtest.h>

#include "Configuration/SLGlobalConfiguration.h"
#include "FileManager/SLFileManager.h"
#include "Platform/DataProtection.h"
#include "Platform/Preferences.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::test::LogCapture;
using Lines = std::vector<LogCapture::Line>;

// A system root of its own, with nothing pending in the preferences store.
struct TempRoot {
  TempRoot() {
    sl::setSystemRoot(dir.path());
    sl::preferencesResetForTesting();
  }
  // Stores a whole domain as a file, as another process would.
  void writeDomain(const char* domain, const sl::Dictionary& values) const {
    sl::test::makeDirs(dir / "private/var/mobile/Library/Preferences");
    ASSERT_TRUE(sl::writePropertyListToURL(values.isNull() ? sl::Dictionary::create() : values,
                                           sl::preferencesFileURL(domain)));
  }
  sl::test::TempDir dir;
};

// The class of an existing directory; -1 when it cannot be opened.
int protectionClass(const std::string& path) {
  sl::UniqueFd fd(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return fd ? sl::protectionClassFcntl(fd.get(), sl::F_GETPROTECTIONCLASS) : -1;
}

TEST(SettingsAndPaths, OnlyValuesOfTheRightKindChangeSettings) {
  auto notice = [](const char* message) {
    return sl::test::installerLine(sl::kLogLevelNotice, "-[SLGlobalConfiguration init]", message);
  };
  using Settings = std::tuple<bool, bool, bool, int32_t>;  // lower, skip family, skip thinning, installs
  const struct {
    sl::Dictionary prefs;
    Settings settings;
    Lines lines;
  } rows[] = {
      {{}, {true, false, false, 4}, {}},  // no file at all
      {{{"LowerInstallPriority", sl::Number(0)}, {"SkipDeviceFamilyCheck", sl::Number(1)},
        {"SkipThinningCheck", sl::String("YES")}, {"SimultaneousInstallsNumber", sl::String("8")}},
       {true, false, false, 4}, {}},
      // Any number of installations is taken, one below 1 too.
      {{{"LowerInstallPriority", sl::Boolean(false)}, {"SkipDeviceFamilyCheck", sl::Boolean(true)},
        {"SkipThinningCheck", sl::Boolean(true)}, {"SimultaneousInstallsNumber", sl::Number(-2)}},
       {false, true, true, -2},
       {notice("Not running installation at background priority because of a set default"),
        notice("Skipping device family check because of a set default"),
        notice("Skipping device thinning check because of a set default"),
        notice("Setting simultaneous installations allowed to -2")}},
      // A property-list boolean is a number: true is 1.
      {{{"SimultaneousInstallsNumber", sl::Boolean(true)}},
       {true, false, false, 1},
       {notice("Setting simultaneous installations allowed to 1")}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.prefs.description());
    TempRoot root;
    if (!row.prefs.isNull()) root.writeDomain("com.vantor.stowline", row.prefs);
    LogCapture log;
    SLGlobalConfiguration config;
    EXPECT_EQ(Settings(config.lowerInstallPriority(), config.skipDeviceFamilyCheck(), config.skipThinningCheck(),
                       config.nSimultaneousInstallations()),
              row.settings);
    EXPECT_EQ(log.installer(), row.lines);
  }
}

TEST(SettingsAndPaths, DefaultRootGivesTheSystemsOwnPaths) {
  // Only computing accessors: nothing may be created below the real root.
  sl::setSystemRoot("/");
  SLGlobalConfiguration config;
  std::vector<std::string> paths;
  for (const sl::URL& url : {config.oldContainerPath(), config.oldInstallMapPath(), config.dataDirectoryPath(),
                             config.roleUserMigrationMarkerFilePath(), config.factoryMountDirectory()}) {
    paths.push_back(url.absoluteString());
  }
  for (const sl::URL& url : config.allFrameworksDirectories()) paths.push_back(url.absoluteString());
  EXPECT_EQ(paths, (std::vector<std::string>{
                       "file:///private/var/mobile/Applications/",
                       "file:///private/var/mobile/Library/Caches/com.vantor.stowline.plist",
                       "file:///private/var/stowd/Library/Stowline/",
                       "file:///private/var/stowd/Library/Stowline/RoleUserMigration.plist",
                       "file:///private/var/factory_mount/",
                       "file:///System/Library/Frameworks/", "file:///System/Library/PrivateFrameworks/",
                       "file:///VantorInternal/Frameworks/", "file:///VantorInternal/PrivateFrameworks/"}));
}

TEST(SettingsAndPaths, CreatedOnEveryCallWithTheirClassAndFailuresLogged) {
  const struct {
    const char* name;
    sl::URL (SLGlobalConfiguration::*accessor)();
    const char* relative;
    int32_t cls;
    const char* failure;
  } rows[] = {
      {"carrierBundlesDirectory", &SLGlobalConfiguration::carrierBundlesDirectory,
       "private/var/mobile/Library/Carrier Bundles", 0, "Failed to create carrier bundles directory at"},
      {"stagingRoot", &SLGlobalConfiguration::stagingRoot,
       "private/var/stowd/Library/Caches/com.vantor.mobile.stowd.staging", 4, "Failed to create staging root at"},
      {"logDirectory", &SLGlobalConfiguration::logDirectory, "private/var/stowd/Library/Logs/Stowline", 4,
       "Failed to create log directory at"},
      {"dataDirectory", &SLGlobalConfiguration::dataDirectory, "private/var/stowd/Library/Stowline", 4,
       "Failed to create data dir at"},
      {"cachesDirectory", &SLGlobalConfiguration::cachesDirectory, "private/var/stowd/Library/Caches", 0,
       "Failed to create data dir at"},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    TempRoot root;
    SLGlobalConfiguration config;
    LogCapture log;
    const std::string path = root.dir / row.relative;
    const sl::URL url = (config.*row.accessor)();
    EXPECT_EQ(url, sl::test::fileURL(path, true));
    EXPECT_EQ(protectionClass(path), row.cls);
    if (row.accessor == &SLGlobalConfiguration::stagingRoot) {  // caches first, without a class
      EXPECT_EQ(protectionClass(root.dir / "private/var/stowd/Library/Caches"), 0);
    }
    EXPECT_EQ(log.installer(), Lines{});

    // A file in the way: every call tries again, logs the record and still
    // answers the path.
    sl::test::forceRemove(path);
    sl::test::writeFile(path);
    sl::Error expected;
    ASSERT_FALSE(SLFileManager::defaultManager().createDirectoryAtURL(url, true, 0755, &expected));
    const auto line = sl::test::installerLine(
        sl::kLogLevelError, (std::string("-[SLGlobalConfiguration ") + row.name + "]").c_str(),
        std::string(row.failure) + " \"" + url.absoluteString() + "\": " + expected.description());
    EXPECT_EQ((config.*row.accessor)(), url);
    EXPECT_EQ((config.*row.accessor)(), url);
    EXPECT_EQ(log.installer(), (Lines{line, line}));
  }
}

TEST(SettingsAndPaths, PersistedFlagAndThinningIdentifierReadOnEveryCall) {
  TempRoot root;
  SLGlobalConfiguration config;
  constexpr char kFlag[] = "UpdatedPluginContainersWithParentIDWithSafeHarborFix";
  const std::pair<sl::Dictionary, bool> flagRows[] = {
      {{}, false}, {{{kFlag, sl::Number(0)}}, true}, {{{kFlag, sl::Boolean(false)}}, false}};
  for (const auto& [stored, expected] : flagRows) {
    root.writeDomain("com.vantor.stowline", stored);
    EXPECT_EQ(config.haveUpdatedPluginContainersWithParentID(), expected) << stored.description();
  }
  for (bool value : {true, false}) {
    config.setHaveUpdatedPluginContainersWithParentID(value);
    EXPECT_EQ(config.haveUpdatedPluginContainersWithParentID(), value);
    EXPECT_EQ(sl::dictionaryWithContentsOfURL(sl::preferencesFileURL("com.vantor.stowline")).get(kFlag),
              sl::Boolean(value));
  }

  constexpr char kVariant[] = "ThinnedAppVariantID";
  const std::pair<sl::Dictionary, sl::String> thinningRows[] = {{{{kVariant, sl::String("model-7")}}, "model-7"},
                                                               {{{kVariant, sl::Number(42)}}, "42"},
                                                               {{{kVariant, sl::Boolean(true)}}, "1"},
                                                               {{{kVariant, sl::Array{sl::Number(1)}}}, nullptr}};
  for (const auto& [stored, expected] : thinningRows) {
    root.writeDomain("com.vantor.jukorastored", stored);
    EXPECT_EQ(config.alternateThinningModelIdentifier(), expected) << stored.description();
  }
}

}  // namespace
