// The fixture of the migrator's tests: one system root per test program
// (the configuration is a process-wide singleton that fixes its bases when
// it is first made), emptied before every test, with a fresh embedded
// registry as the default workspace and installer library; and builders for
// old layouts.
#pragma once

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <memory>
#include <string>
#include <vector>

#include "AppMigrator/AppMigrator.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "Platform/ApplicationRegistry.h"
#include "Platform/InstallerLibrary.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Registry/EmbeddedRegistry.h"
#include "TestSupport/TestSupport.h"

// Reaches the migrator's private operations from the tests.
class SLAppMigratorTestAccess {
 public:
  // A migrator made without running init (its start-up state stays empty).
  static std::unique_ptr<SLAppMigrator> bare() { return std::unique_ptr<SLAppMigrator>(new SLAppMigrator()); }
  static sl::Dictionary introspect(SLAppMigrator& m, const sl::URL& url, bool* early) {
    return m._introspectContainer(url, early);
  }
  static bool migrateContainer(SLAppMigrator& m, const sl::Dictionary& record) {
    return m._migrateContainerWithInfo(record);
  }
  static bool migrateSafeHarbors(SLAppMigrator& m) { return m._migrateSafeHarbors(); }
  static bool migrateData(SLAppMigrator& m, const sl::String& identifier, const sl::URL& from, const sl::URL& to) {
    return m._migrateDataContainerForIdentifier(identifier, from, to);
  }
  static bool stageAndInstall(SLAppMigrator& m, const sl::URL& bundle, const sl::String& identifier,
                              const sl::URL& vpn, const sl::URL& container) {
    return m._stageAndInstallBundleAtURL(bundle, identifier, vpn, container);
  }
  static bool installPlaceholder(SLAppMigrator& m, const sl::URL& bundle, const sl::String& identifier,
                                 const sl::URL& container) {
    return m._stageAndInstallPlaceholderForBundleAtURL(bundle, identifier, container);
  }
  static bool migrateGroups(SLAppMigrator& m, const sl::String& identifier) {
    return m._migrateGroupContainersForIdentifier(identifier);
  }
  static bool moveGroupItems(SLAppMigrator& m, const sl::URL& from, const sl::URL& to) {
    return m._moveAllItemsInGroupContainerURL(from, to);
  }
  static sl::Dictionary& groupContainerMap(SLAppMigrator& m) { return m._groupContainerMap; }
  static sl::Dictionary& harborMap(SLAppMigrator& m) { return m._harborMap; }
  static const std::optional<std::vector<sl::URL>>& itemsToMigrate(SLAppMigrator& m) { return m._itemsToMigrate; }
  static uint64_t countItemsMigrated(SLAppMigrator& m) { return m._countItemsMigrated; }
  static const sl::String& lastSystemBuildVersion(SLAppMigrator& m) { return m._lastSystemBuildVersion; }
  // Sets the item list and the counter as init and the passes leave them.
  static void setProgressState(SLAppMigrator& m, std::optional<std::vector<sl::URL>> items, uint64_t count) {
    m._itemsToMigrate = std::move(items);
    m._countItemsMigrated = count;
  }
};

namespace mgtest {

using sl::test::fileURL;

// The system root of this test program, made below /dev/shm on first use and
// set before anything reads the configuration.
inline const std::string& root() {
  static sl::test::TempDir dir(sl::test::TempDir::kShm);  // removed when the program exits
  static const bool set = (sl::setSystemRoot(dir.path()), true);
  (void)set;
  return dir.path();
}

// ROOT + an absolute path of the system ("/private/var/mobile/Applications").
inline std::string below(const std::string& absolute) { return root() + absolute; }

inline const std::string kOldRoot = "/private/var/mobile/Applications";
inline const std::string kInstallMap = "/private/var/mobile/Library/Caches/com.vantor.stowline.plist";
inline const std::string kDataDirectory = "/private/var/stowd/Library/Stowline";

// A bundle directory with an Info.plist.
inline void makeBundle(const std::string& path, const std::string& identifier, const std::string& version = "1.0",
                       const std::vector<std::string>& groups = {}) {
  sl::test::makeDirs(path);
  sl::Dictionary info{{"PBBundleIdentifier", sl::String(identifier)},
                      {"PBBundleVersion", sl::String(version)},
                      {"PBBundleExecutable", sl::String("Exec")},
                      {"PBBundleDisplayName", sl::String("Display " + identifier)}};
  if (!groups.empty()) {
    sl::Array array = sl::Array::create();
    for (const std::string& group : groups) array.append(sl::String(group));
    info.set("PBApplicationGroups", array);
  }
  ASSERT_TRUE(sl::writePropertyListToURL(info, fileURL(path + "/Info.plist")));
  sl::test::writeFile(path + "/Exec", "binary of " + identifier);
}

// Writes the old install map with "GroupContainers" entries group -> path.
inline void writeInstallMap(const std::vector<std::pair<std::string, std::string>>& groups) {
  sl::Dictionary map = sl::Dictionary::create();
  for (const auto& [group, path] : groups) map.set(group, sl::Dictionary{{"Container", sl::String(path)}});
  sl::test::makeDirs(below("/private/var/mobile/Library/Caches"));
  ASSERT_TRUE(sl::writePropertyListToURL(sl::Dictionary{{"GroupContainers", map}}, fileURL(below(kInstallMap))));
}

// The fixture: an empty root, a fresh registry, captured logs.
class MigratorTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root();
    RGApplicationWorkspace::setDefaultWorkspace(nullptr);
    SLInstallerLibrary::setDefaultLibrary(nullptr);
    registry_.reset();
    emptyRoot();
    sl::Error error;
    registry_ = EmbeddedRegistry::open(SLGlobalConfiguration::sharedInstance(), &error);
    ASSERT_TRUE(registry_) << error.description();
    RGApplicationWorkspace::setDefaultWorkspace(registry_);
    SLInstallerLibrary::setDefaultLibrary(registry_);
    SLGlobalConfiguration::sharedInstance().reScanSystemApps();
    log_.clear();
  }
  void TearDown() override {
    RGApplicationWorkspace::setDefaultWorkspace(nullptr);
    SLInstallerLibrary::setDefaultLibrary(nullptr);
    registry_.reset();
  }

  // Removes everything below the root, the root itself stays.
  static void emptyRoot() {
    for (const char* top : {"/private", "/Applications", "/tmp", "/etc", "/Developer", "/System", "/VantorInternal"})
      sl::test::forceRemove(root() + top);
  }

  std::shared_ptr<EmbeddedRegistry> registry_;
  sl::test::LogCapture log_;
};

// The messages of the host log, in order.
inline std::vector<std::string> hostMessages(const sl::test::LogCapture& log) {
  std::vector<std::string> out;
  for (const auto& line : log.host()) out.push_back(line.message);
  return out;
}

// ROOT/private/var/mobile/Applications/NAME.
inline std::string oldEntry(const std::string& name) { return below(kOldRoot) + "/" + name; }

// The URL string of a path, as the log lines show it.
inline std::string u(const std::string& path, bool directory = false) {
  return fileURL(path, directory).absoluteString();
}

// The host log as (level, message) pairs, in order.
using Lines = std::vector<std::pair<int, std::string>>;
inline Lines hostLines(const sl::test::LogCapture& log) {
  Lines out;
  for (const auto& line : log.host()) out.emplace_back(line.level, line.message);
  return out;
}

// A property list at path, its parent directories made.
inline void writePlist(const std::string& path, const sl::Value& value) {
  sl::test::makeDirs(path.substr(0, path.rfind('/')));
  ASSERT_TRUE(sl::writePropertyListToURL(value, fileURL(path)));
}

// Installs X.app (identifier `id`, in `groups`) straight into the registry,
// as an earlier run or the user would have: a placeholder is the bundle
// itself, a customer package holds it in Payload.
inline void installInRegistry(EmbeddedRegistry& registry, const std::string& id, const char* packageType,
                              const std::vector<std::string>& groups = {}) {
  const bool placeholder = std::string(packageType) == RGPackageTypePlaceholder;
  const std::string package = below("/private/var/packages/" + id);
  makeBundle(package + (placeholder ? "/X.app" : "/Payload/X.app"), id, "1.0", groups);
  ASSERT_TRUE(registry.installApplication(fileURL(placeholder ? package + "/X.app" : package, true),
                                          sl::Dictionary{{RGInstallTypeKey, sl::Number(6)},
                                                         {RGPackageTypeKey, sl::String(packageType)},
                                                         {RGBundleIdentifierOptionKey, sl::String(id)}},
                                          nullptr));
}

}  // namespace mgtest
