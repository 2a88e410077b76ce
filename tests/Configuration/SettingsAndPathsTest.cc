#include <fcntl.h>

#include <set>
#include <string>
#include <thread>
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

LogCapture::Line notice(const std::string& message) {
  return {sl::kLogLevelNotice, "installer", "-[SLGlobalConfiguration init]", message};
}

// The class of an existing directory; -1 when it cannot be opened.
int protectionClass(const std::string& path) {
  sl::UniqueFd fd(open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  return fd ? sl::protectionClassFcntl(fd.get(), sl::F_GETPROTECTIONCLASS) : -1;
}

TEST(SettingsAndPaths, OnlyValuesOfTheRightKindChangeSettings) {
  const sl::Boolean no(false), yes(true);
  const struct {
    sl::Dictionary prefs;
    bool lower, skipFamily, skipThinning;
    int32_t installs;
    Lines lines;
  } rows[] = {
      {{}, true, false, false, 4, {}},
      {{{"LowerInstallPriority", sl::Number(0)},
        {"SkipDeviceFamilyCheck", sl::Number(1)},
        {"SkipThinningCheck", sl::String("YES")},
        {"SimultaneousInstallsNumber", sl::String("8")}},
       true, false, false, 4, {}},
      {{{"LowerInstallPriority", sl::String("NO")}, {"SimultaneousInstallsNumber", sl::Number(-2)}},
       true, false, false, -2, {notice("Setting simultaneous installations allowed to -2")}},
      {{{"LowerInstallPriority", no},
        {"SkipDeviceFamilyCheck", yes},
        {"SkipThinningCheck", yes},
        {"SimultaneousInstallsNumber", sl::Number(8)}},
       false, true, true, 8,
       {notice("Not running installation at background priority because of a set default"),
        notice("Skipping device family check because of a set default"),
        notice("Skipping device thinning check because of a set default"),
        notice("Setting simultaneous installations allowed to 8")}},
  };
  for (const auto& row : rows) {
    SCOPED_TRACE(row.prefs.description());
    TempRoot root;
    if (!row.prefs.isNull()) root.writeDomain("com.vantor.stowline", row.prefs);  // the first row: no file
    LogCapture log;
    SLGlobalConfiguration config;
    EXPECT_EQ(config.lowerInstallPriority(), row.lower);
    EXPECT_EQ(config.skipDeviceFamilyCheck(), row.skipFamily);
    EXPECT_EQ(config.skipThinningCheck(), row.skipThinning);
    EXPECT_EQ(config.nSimultaneousInstallations(), row.installs);
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
                       "file:///System/Library/Frameworks/",
                       "file:///System/Library/PrivateFrameworks/",
                       "file:///VantorInternal/Frameworks/",
                       "file:///VantorInternal/PrivateFrameworks/",
                   }));
  EXPECT_TRUE(config.codeSigningEnforcementIsDisabled());
  EXPECT_EQ(config.appBundleMetadataItemNames(), SLFileManager::storeDataItemNames());
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
    EXPECT_EQ(url, sl::URL::fileURLWithPath(path, true));
    EXPECT_EQ(protectionClass(path), row.cls);
    if (row.accessor == &SLGlobalConfiguration::stagingRoot) {  // caches first, without a class
      EXPECT_EQ(protectionClass(root.dir / "private/var/stowd/Library/Caches"), 0);
    }

    sl::test::forceRemove(path);
    EXPECT_EQ((config.*row.accessor)(), url);
    EXPECT_EQ(protectionClass(path), row.cls);
    EXPECT_EQ(log.installer(), Lines{});

    // A file in the way: every call logs the record and still answers the path.
    sl::test::forceRemove(path);
    sl::test::writeFile(path);
    sl::Error expected;
    ASSERT_FALSE(SLFileManager::defaultManager().createDirectoryAtURL(url, true, 0755, &expected));
    const LogCapture::Line line{sl::kLogLevelError, "installer",
                                std::string("-[SLGlobalConfiguration ") + row.name + "]",
                                std::string(row.failure) + " \"" + url.absoluteString() + "\": " + expected.description()};
    EXPECT_EQ((config.*row.accessor)(), url);
    EXPECT_EQ((config.*row.accessor)(), url);
    EXPECT_EQ(log.installer(), (Lines{line, line}));
  }
}

TEST(SettingsAndPaths, PersistedFlagAndThinningIdentifierReadOnEveryCall) {
  TempRoot root;
  SLGlobalConfiguration config;
  constexpr char kFlag[] = "UpdatedPluginContainersWithParentIDWithSafeHarborFix";
  const std::pair<sl::Dictionary, bool> flagRows[] = {{{}, false},
                                                      {{{kFlag, sl::String("no")}}, true},
                                                      {{{kFlag, sl::Number(0)}}, true},
                                                      {{{kFlag, sl::Boolean(false)}}, false}};
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
                                                               {{}, nullptr},
                                                               {{{kVariant, sl::Array{sl::Number(1)}}}, nullptr}};
  for (const auto& [stored, expected] : thinningRows) {
    root.writeDomain("com.vantor.jukorastored", stored);
    EXPECT_EQ(config.alternateThinningModelIdentifier(), expected) << stored.description();
  }
}

TEST(SettingsAndPaths, ConcurrentFirstCalls) {
  TempRoot root;
  SLGlobalConfiguration* shared[2] = {};
  SLGlobalConfiguration config;
  sl::URL paths[2];
  std::vector<std::thread> threads;
  for (int i = 0; i < 2; ++i) {
    threads.emplace_back([&, i] {
      shared[i] = &SLGlobalConfiguration::sharedInstance();
      paths[i] = config.dataDirectory();
    });
  }
  for (std::thread& t : threads) t.join();
  EXPECT_EQ(shared[0], shared[1]);
  EXPECT_EQ(paths[0], paths[1]);
  EXPECT_EQ(protectionClass(root.dir / "private/var/stowd/Library/Stowline"), 4);
}

}  // namespace
