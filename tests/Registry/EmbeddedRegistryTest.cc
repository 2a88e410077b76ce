#include "Registry/EmbeddedRegistry.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include "FileManager/SLFileManager.h"
#include "Registry/Database.h"
#include "Registry/RegistryTestSupport.h"

namespace {

using namespace rgtest;
using sl::test::exists;
using sl::test::TempDir;

struct Reports {
  std::vector<sl::Dictionary> all;
  RGProgressHandler handler() {
    return [this](const sl::Dictionary& report) { all.push_back(report); };
  }
  std::string lastError() const {
    return all.empty() ? "" : all.back().get(RGProgressErrorKey).asString().str();
  }
};

TEST(EmbeddedRegistryTest, PlaceholderThenRealBundleKeepsDataContainer) {
  RegistryRoot root;
  auto registry = root.open();
  SLFileManager& fm = SLFileManager::defaultManager();

  // ---- The placeholder ----
  const std::string placeholder = root / "tmp/com.example.app.app";
  makeBundle(placeholder, "com.example.app");
  sl::Error error;
  ASSERT_TRUE(install(*registry, placeholder, "com.example.app", RGPackageTypePlaceholder, &error))
      << error.description();
  EXPECT_FALSE(exists(placeholder));
  auto first = registry->bundleProxyForIdentifier("com.example.app");
  ASSERT_TRUE(first);
  EXPECT_EQ(first->bundleType().str(), "Placeholder");
  EXPECT_TRUE(fm.bundleAtURLIsPlaceholder(first->bundleURL()));
  EXPECT_EQ(fm.installTypeForBundle(first->bundleURL()).uint64Value(), 6u);
  EXPECT_EQ(first->bundleURL().path(), first->bundleContainerURL().path() + "/com.example.app.app");
  const std::string data = first->dataContainerURL().path();
  EXPECT_EQ(data.rfind(registry->dataContainersRoot() + "/", 0), 0u) << data;
  for (const char* item : {"Documents", "Library", "tmp"}) EXPECT_TRUE(exists(data + "/" + item)) << item;
  EXPECT_EQ(first->groupContainerURLs(), sl::Dictionary::create());
  sl::test::writeFile(data + "/Documents/user.txt", "moved by the migrator");

  // ---- The real bundle over it, from a customer package on the same volume ----
  const std::string package = root / "private/var/mobile/Applications/C/Staging";
  const std::string app = makeCustomerPackage(package, "com.example.app", "2.0");
  makeBundle(package + "/Payload/Tunnel.vpnplugin", "com.example.app.vpn");
  sl::test::writeFile(package + "/Manifest.plist", "<plist/>");
  const ino_t inode = inodeOf(app);
  Reports reports;
  ASSERT_TRUE(install(*registry, package, "com.example.app", RGPackageTypeCustomer, &error, reports.handler()))
      << error.description();
  EXPECT_FALSE(exists(package));
  auto second = registry->bundleProxyForIdentifier("com.example.app");
  ASSERT_TRUE(second);
  EXPECT_EQ(second->bundleType().str(), "User");
  EXPECT_TRUE(second->foundBackingBundle());
  EXPECT_EQ(second->dataContainerURL().path(), data);
  EXPECT_EQ(sl::test::readFile(data + "/Documents/user.txt"), "moved by the migrator");
  EXPECT_EQ(inodeOf(second->bundleURL().path()), inode) << "a move on one volume is a rename";
  EXPECT_FALSE(fm.bundleAtURLIsPlaceholder(second->bundleURL()));
  EXPECT_EQ(fm.installTypeForBundle(second->bundleURL()).uint64Value(), 6u);
  const std::string container = second->bundleContainerURL().path();
  EXPECT_TRUE(exists(container + "/Tunnel.vpnplugin/Info.plist"));
  EXPECT_TRUE(exists(container + "/Manifest.plist"));
  EXPECT_FALSE(exists(first->bundleContainerURL().path())) << "the placeholder's container goes";
  EXPECT_FALSE(first->foundBackingBundle());
  ASSERT_FALSE(reports.all.empty());
  EXPECT_EQ(reports.all.back().get(RGProgressPercentCompleteKey).asNumber().int64Value(), 100);
  EXPECT_EQ(reports.lastError(), "");

  // ---- Repeats nothing: the same package path and identifier again ----
  sl::test::makeDirs(package + "/Payload");
  ASSERT_TRUE(install(*registry, package, "com.example.app", RGPackageTypeCustomer));
  EXPECT_FALSE(exists(package));
  EXPECT_EQ(registry->bundleProxyForIdentifier("com.example.app")->bundleContainerURL().path(), container);

  // ---- After reopening ----
  registry.reset();
  registry = root.open();
  EXPECT_EQ(registry->bundleProxyForIdentifier("com.example.app")->dataContainerURL().path(), data);
}

TEST(EmbeddedRegistryTest, TwoApplicationsShareOneGroup) {
  RegistryRoot root;
  auto registry = root.open();
  makeCustomerPackage(root / "pkgA", "com.example.a", "1", {"group.shared", "group.a"});
  makeCustomerPackage(root / "pkgB", "com.example.b", "1", {"group.shared"});
  ASSERT_TRUE(install(*registry, root / "pkgA", "com.example.a", RGPackageTypeCustomer));
  ASSERT_TRUE(install(*registry, root / "pkgB", "com.example.b", RGPackageTypeCustomer));
  const sl::Dictionary a = registry->bundleProxyForIdentifier("com.example.a")->groupContainerURLs();
  const sl::Dictionary b = registry->bundleProxyForIdentifier("com.example.b")->groupContainerURLs();
  ASSERT_EQ(a.count(), 2u);
  ASSERT_EQ(b.count(), 1u);
  EXPECT_EQ(a.get("group.shared").asURL().path(), b.get("group.shared").asURL().path());
  EXPECT_NE(a.get("group.shared").asURL().path(), a.get("group.a").asURL().path());
  EXPECT_TRUE(exists(b.get("group.shared").asURL().path()));
  EXPECT_NE(registry->bundleProxyForIdentifier("com.example.a")->dataContainerURL().path(),
            registry->bundleProxyForIdentifier("com.example.b")->dataContainerURL().path());

  // A file-system step that fails (a new group container cannot be made)
  // undoes what was done and still consumes the package.
  auto bundleContainers = [&] {
    return SLFileManager::defaultManager()
        .urlsForItemsInDirectoryAtURL(fileURL(registry->bundleContainersRoot(), true), false)
        ->size();
  };
  const size_t bundleContainersBefore = bundleContainers();
  sl::test::forceRemove(registry->groupContainersRoot());
  sl::test::writeFile(registry->groupContainersRoot());
  makeCustomerPackage(root / "pkgC", "com.example.c", "1", {"group.new"});
  Reports reports;
  sl::Error error;
  EXPECT_FALSE(install(*registry, root / "pkgC", "com.example.c", RGPackageTypeCustomer, &error, reports.handler()));
  EXPECT_TRUE(error.isPOSIX(ENOTDIR)) << error.description();
  EXPECT_EQ(reports.lastError(), kRGProgressErrorInstallFailed);
  EXPECT_FALSE(exists(root / "pkgC"));
  EXPECT_FALSE(registry->applicationIsInstalled("com.example.c"));
  EXPECT_EQ(bundleContainers(), bundleContainersBefore);
}

// Refusals, the blacklist and built-in applications. Every refusal consumes
// the package and reports under "Error" before the call returns.
TEST(EmbeddedRegistryTest, RefusalsBlacklistAndBuiltInApplications) {
  RegistryRoot root;
  makeBundle(root / "Applications/Newer.app", "com.example.builtin.newer", "5.2");
  makeBundle(root / "Applications/Older.app", "com.example.builtin.older", "1.9");
  auto registry = root.open();
  const std::string blacklisted = *SLGlobalConfiguration::installationBlacklist().begin();

  struct Case {
    const char* name;
    std::string bundleIdentifier, option, version;
    const char* packageType;
    bool skipBlacklist;
    int64_t code;  // 0: installed
    const char* progressError;
    std::string message;
  };
  const Case cases[] = {
      {"mismatch", "com.x", "com.y", "1", RGPackageTypeCustomer, true, kRGIdentifierMismatchError,
       kRGProgressErrorIdentifierMismatch, "Package identifier com.x does not match the option com.y"},
      {"blacklisted", blacklisted, blacklisted, "1", RGPackageTypeCustomer, false, kRGBlacklistedError,
       kRGProgressErrorBlacklisted, blacklisted + " is on the installation blacklist"},
      {"blacklist skipped", blacklisted, blacklisted, "1", RGPackageTypeCustomer, true, 0, "", ""},
      {"built-in newer", "com.example.builtin.newer", "com.example.builtin.newer", "5.1.9", RGPackageTypeCustomer,
       true, kRGAlreadyInstalledError, RGErrorApplicationAlreadyInstalled,
       "The built-in com.example.builtin.newer has version 5.2, not older than the package's 5.1.9"},
      {"built-in placeholder", "com.example.builtin.older", "com.example.builtin.older", "9",
       RGPackageTypePlaceholder, true, kRGPlaceholderRefusedError, kRGProgressErrorPlaceholderRefused,
       "A placeholder is never installed over the built-in application com.example.builtin.older"},
      {"built-in older", "com.example.builtin.older", "com.example.builtin.older", "1.10", RGPackageTypeCustomer,
       true, 0, "", ""},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    const std::string package = root / (std::string("pkg-") + c.name);
    if (std::string(c.packageType) == RGPackageTypePlaceholder)
      makeBundle(package, c.bundleIdentifier, c.version);
    else
      makeCustomerPackage(package, c.bundleIdentifier, c.version);
    sl::Dictionary opts = options(c.option, c.packageType);
    if (!c.skipBlacklist) opts.remove(RGSkipBlacklistOptionKey);
    Reports reports;
    sl::Error error;
    const bool installed = registry->installApplication(fileURL(package, true), opts, &error, reports.handler());
    EXPECT_FALSE(exists(package));
    if (c.code == 0) {
      EXPECT_TRUE(installed) << error.description();
      auto proxy = registry->bundleProxyForIdentifier(c.option);
      EXPECT_EQ(proxy ? proxy->bundleType().str() : "(none)", "User");
      continue;
    }
    EXPECT_FALSE(installed);
    sl::test::expectRecord(error, RGErrorDomain, c.code, c.message, nullptr);
    EXPECT_EQ(reports.lastError(), c.progressError);
    EXPECT_EQ(reports.all.back().get(RGProgressErrorDescriptionKey).asString().str(), c.message);
  }

  // A built-in application is installed, of type "System", with a data
  // container made on first request and kept.
  auto system = registry->bundleProxyForIdentifier("com.example.builtin.newer");
  ASSERT_TRUE(system);
  EXPECT_EQ(system->bundleType().str(), "System");
  EXPECT_EQ(system->bundleURL().path(), root / "Applications/Newer.app");
  EXPECT_TRUE(system->foundBackingBundle());
  const std::string data = system->dataContainerURL().path();
  EXPECT_TRUE(!data.empty() && exists(data + "/Documents")) << data;
  EXPECT_EQ(registry->bundleProxyForIdentifier("com.example.builtin.newer")->dataContainerURL().path(), data);
  EXPECT_TRUE(registry->applicationIsInstalled("com.example.builtin.newer"));
  EXPECT_FALSE(registry->applicationIsInstalled("com.example.unknown"));
}

// Recovery runs only in an open that has the registry alone: an install
// under way in another registry object keeps its operation, and an open
// made once that object is closed recovers what it left.
TEST(EmbeddedRegistryTest, RecoveryLeavesTheOperationsOfOpenRegistriesAlone) {
  RegistryRoot root;
  auto registry = root.open();
  const std::string package = root / "private/var/mobile/Applications/C/Staging";
  sl::test::LogCapture log;
  struct Stop {};
  bool stop = false;
  // While the install registers (its bundle moved, its state not yet
  // committed) another object opens and closes; with `stop` the install
  // then ends there, as a crash would end it, with its registry still open.
  const RGProgressHandler openAnother = [&](const sl::Dictionary& report) {
    if (!(report.get(RGProgressStatusKey).asString() == "Registering")) return;
    log.clear();
    EXPECT_TRUE(root.open());
    EXPECT_EQ(log.installer(), std::vector{sl::test::installerLine(
                                   sl::kLogLevelNotice, "+[EmbeddedRegistry open:error:]",
                                   "The registry at " + registry->databasePath() +
                                       " is open elsewhere: recovery of its operations in flight (1) is left to a "
                                       "later open")});
    EXPECT_FALSE(exists(package + "/Payload/App.app")) << "moved back under the install";
    if (stop) throw Stop{};
  };

  makeCustomerPackage(package, "com.example.live");
  ASSERT_TRUE(install(*registry, package, "com.example.live", RGPackageTypeCustomer, nullptr, openAnother));
  const std::string bundle = registry->bundleProxyForIdentifier("com.example.live")->bundleURL().path();
  EXPECT_EQ(sl::test::readFile(bundle + "/Executable"), "binary of com.example.live");

  stop = true;
  makeCustomerPackage(package, "com.example.stopped");
  EXPECT_THROW(install(*registry, package, "com.example.stopped", RGPackageTypeCustomer, nullptr, openAnother), Stop);
  registry.reset();
  registry = root.open();  // alone now: recovers
  EXPECT_EQ(sl::test::readFile(package + "/Payload/App.app/Executable"), "binary of com.example.stopped");
  EXPECT_FALSE(registry->applicationIsInstalled("com.example.stopped"));

  // ---- Without its lock file the registry does not open ----
  const std::string lock = root / "private/var/stowd/Library/Registry/registry.lock";
  registry.reset();
  sl::test::forceRemove(lock);
  sl::test::makeSymlink(root / "elsewhere", lock);
  sl::Error error;
  EXPECT_FALSE(EmbeddedRegistry::open(root.configuration(), &error));
  sl::test::expectPOSIXRecord(error, ELOOP,
                              "Cannot open the registry's lock file " + lock + ": Too many levels of symbolic links",
                              "+[EmbeddedRegistry open:error:]");
  EXPECT_FALSE(exists(root / "elsewhere"));
}

// A package inside the registry's own layout, or holding it, is refused and
// kept: consuming it would remove what the registry records.
TEST(EmbeddedRegistryTest, PackagesInTheRegistrysOwnLayoutAreRefusedAndKept) {
  RegistryRoot root;
  auto registry = root.open();
  makeCustomerPackage(root / "pkg", "com.example.own");
  ASSERT_TRUE(install(*registry, root / "pkg", "com.example.own", RGPackageTypeCustomer));
  const auto proxy = registry->bundleProxyForIdentifier("com.example.own");
  const std::string bundle = proxy->bundleURL().path();
  const std::string data = proxy->dataContainerURL().path();
  sl::test::writeFile(data + "/Documents/keep", "user data");
  sl::test::makeSymlink(proxy->bundleContainerURL().path(), root / "link");
  const std::string builtIn = root.configuration().systemAppsDirectory().path() + "/Built.app";
  makeBundle(builtIn, "com.example.own");
  const std::string containers = " the registry's own containers";
  const struct {
    std::string package;
    const char* packageType;
    std::string overlap;
  } cases[] = {
      {bundle, RGPackageTypePlaceholder, "lies inside" + containers},  // over the installed application
      {data, RGPackageTypeCustomer, "lies inside" + containers},
      {root / "link/App.app", RGPackageTypePlaceholder, "lies inside" + containers},
      {root / "private/var/stowd", RGPackageTypeCustomer, "holds" + containers},
      {builtIn, RGPackageTypePlaceholder, "lies inside the built-in applications"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.package);
    Reports reports;
    sl::Error error;
    EXPECT_FALSE(install(*registry, c.package, "com.example.own", c.packageType, &error, reports.handler()));
    sl::test::expectRecord(error, RGErrorDomain, kRGInvalidPackageError,
                           "Package " + c.package + " " + c.overlap,
                           "-[EmbeddedRegistry installApplication:withOptions:error:usingBlock:]");
    EXPECT_EQ(reports.lastError(), kRGProgressErrorInvalidPackage);
  }
  EXPECT_EQ(sl::test::readFile(bundle + "/Executable"), "binary of com.example.own");
  EXPECT_TRUE(exists(builtIn + "/Info.plist"));
  EXPECT_EQ(sl::test::readFile(data + "/Documents/keep"), "user data");
  EXPECT_EQ(registry->bundleProxyForIdentifier("com.example.own")->bundleURL().path(), bundle);
}

TEST(EmbeddedRegistryTest, PackageOnAnotherVolumeIsCopied) {
  RegistryRoot root;
  TempDir other;  // $TMPDIR or /tmp, on the disk
  if (sameVolume(root.path(), other.path())) GTEST_SKIP() << "/dev/shm and the temporary directory share a volume";
  auto registry = root.open();
  const std::string package = other / "Staging";
  makeCustomerPackage(package, "com.example.far");
  sl::test::writeFile(package + "/JukoraMetadata.plist", "meta");
  sl::Error error;
  ASSERT_TRUE(install(*registry, package, "com.example.far", RGPackageTypeCustomer, &error)) << error.description();
  EXPECT_FALSE(exists(package));
  EXPECT_FALSE(exists(other / ".Staging.rgtrash"));
  auto proxy = registry->bundleProxyForIdentifier("com.example.far");
  ASSERT_TRUE(proxy);
  EXPECT_EQ(sl::test::readFile(proxy->bundleURL().path() + "/Executable"), "binary of com.example.far");
  EXPECT_EQ(sl::test::readFile(proxy->bundleContainerURL().path() + "/JukoraMetadata.plist"), "meta");
  EXPECT_FALSE(exists(proxy->bundleContainerURL().path() + "/.App.app.partial"));
}

TEST(EmbeddedRegistryTest, SafeHarborsAndDataProtection) {
  RegistryRoot root;
  auto registry = root.open();
  SLInstallerLibrary::setDefaultLibrary(registry);
  sl::test::makeDirs(root / "harbor");
  EXPECT_NE(StowlineRegisterSafeHarborForContainerType(root / "harbor", "com.example.h", 2, nullptr), 0);
  EXPECT_EQ(registry->safeHarborForIdentifier("com.example.h"), std::make_pair(root / "harbor", 2));

  EXPECT_EQ(StowlineRegisterSafeHarborForContainerType(root / "missing", "com.example.h", 2, nullptr), 0);
  const sl::Error failure = StowlineCopyLastSafeHarborRegistrationError();
  EXPECT_TRUE(failure.isPOSIX(ENOENT)) << failure.description();
  EXPECT_EQ(failure.localizedDescription().str(), "Safe harbor " + root / "missing" +
                                                      " for com.example.h cannot be registered: stat failed: "
                                                      "No such file or directory");
  sl::test::writeFile(root / "file");
  sl::Error error;
  EXPECT_FALSE(registry->registerSafeHarbor(root / "file", "com.example.h", 2, &error));
  EXPECT_TRUE(error.isPOSIX(ENOTDIR));
  EXPECT_EQ(registry->safeHarborForIdentifier("com.example.h")->first, root / "harbor") << "the entry stays";

  makeCustomerPackage(root / "pkg", "com.example.p");
  ASSERT_TRUE(install(*registry, root / "pkg", "com.example.p", RGPackageTypeCustomer));
  const sl::URL data = registry->bundleProxyForIdentifier("com.example.p")->dataContainerURL();
  EXPECT_TRUE(StowlineUpdateContainerDataProtectionForMigratorOnly(
      sl::Dictionary{{kSLUpdateSystemAppDataContainerDataProtection, sl::Boolean(true)}}));
  int32_t protectionClass = 0;
  ASSERT_TRUE(SLFileManager::defaultManager().dataProtectionClassOfItemAtURL(data, &protectionClass));
  EXPECT_EQ(protectionClass, 4);
  SLInstallerLibrary::setDefaultLibrary(nullptr);
}

// Statements are kept per SQL text and lent out: every use starts afresh,
// a nested use of a text gets a statement of its own, and a failure reads
// as it did when each use prepared its own.
TEST(DatabaseTest, KeptStatements) {
  TempDir dir(TempDir::kShm);
  std::optional<rg::Database> opened = rg::Database::open(dir / "db.sqlite", nullptr);
  ASSERT_TRUE(opened && opened->exec("CREATE TABLE t(x TEXT UNIQUE, y TEXT)", nullptr));
  constexpr char kInsert[] = "INSERT INTO t VALUES(?, ?)";
  constexpr char kSelect[] = "SELECT x, y FROM t ORDER BY x";
  ASSERT_TRUE(opened->prepare(kInsert, nullptr)->bind(1, "a").bind(2, "1").run(nullptr));
  rg::Database db = std::move(*opened);  // the kept statement moves along
  ASSERT_TRUE(db.prepare(kInsert, nullptr)->bind(1, "b").run(nullptr));  // y not bound: NULL

  for (int use = 0; use < 2; ++use) {  // the first row only: the next use starts over
    std::optional<rg::Statement> select = db.prepare(kSelect, nullptr);
    ASSERT_TRUE(select && select->step(nullptr));
    EXPECT_EQ(select->text(0), "a");
  }
  std::vector<std::string> pairs;
  std::optional<rg::Statement> outer = db.prepare(kSelect, nullptr);
  while (outer->step(nullptr) && pairs.size() < 8) {  // bounded: a shared statement would loop
    std::optional<rg::Statement> inner = db.prepare(kSelect, nullptr);
    while (inner->step(nullptr)) pairs.push_back(*outer->text(0) + *inner->text(0) + inner->text(1).value_or("-"));
  }
  outer.reset();
  EXPECT_EQ(pairs, (std::vector<std::string>{"aa1", "ab-", "ba1", "bb-"}));

  sl::Error error;
  EXPECT_FALSE(db.prepare(kInsert, nullptr)->bind(1, "a").run(&error));
  sl::test::expectRecord(error, RGErrorDomain, kRGDatabaseError,
                         "INSERT INTO t VALUES(?, ?) failed: UNIQUE constraint failed: t.x (2067)", "rg::Database");
  EXPECT_TRUE(db.prepare(kInsert, nullptr)->bind(1, "c").run(nullptr));

  int open = 0;
  for (sqlite3_stmt* s = sqlite3_next_stmt(db.handle(), nullptr); s != nullptr; s = sqlite3_next_stmt(db.handle(), s))
    ++open;
  EXPECT_EQ(open, 2) << "one statement per text; the nested one is finalized";
}

}  // namespace
