// Kills an install at each of its file-system changes (the database's
// writes and syncs included) in a child process, reopens the registry
// (recovery) and checks that the outcome is either the old state with the
// package in place or the new state, with no stray container.

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <optional>
#include <set>

#include "Platform/AtomicFile.h"
#include "Platform/Bundle.h"
#include "Platform/Mutations.h"
#include "Registry/Database.h"
#include "Registry/Moves.h"
#include "Registry/RegistryTestSupport.h"
#include "TestSupport/Sentinel.h"

namespace {

using namespace rgtest;
using sl::test::exists;

struct Scenario {
  const char* name;
  std::string identifier;
  const char* packageType;
  const char* newType;
  // Builds the state before the install and the package; answers the
  // package's path. `packageParent` is where a package may be put.
  std::function<std::string(RegistryRoot&, EmbeddedRegistry&, const std::string& packageParent)> prepare;
};

std::set<std::string> column(rg::Database& db, const char* sql) {
  std::set<std::string> values;
  std::optional<rg::Statement> statement = db.prepare(sql, nullptr);
  while (statement && statement->step(nullptr)) values.insert(statement->text(0).value_or(""));
  return values;
}

std::vector<std::string> entries(const std::string& directory) {
  std::vector<std::string> names;
  std::error_code missing;  // a directory not made yet holds nothing
  for (const auto& entry : std::filesystem::directory_iterator(directory, missing)) names.push_back(entry.path());
  return names;
}

bool bundleReadable(const std::string& path) {
  auto bundle = sl::Bundle::createUnique(fileURL(path, true));
  return bundle && !bundle->infoDictionary().isNull();
}

// The invariant after recovery. Answers whether the install took effect.
bool checkInvariant(EmbeddedRegistry& registry, const Scenario& scenario,
                    const std::string& package, const std::string& packageBundle,
                    const std::shared_ptr<RGBundleProxy>& before) {
  std::optional<rg::Database> db = rg::Database::open(registry.databasePath(), nullptr);
  EXPECT_TRUE(db);
  if (!db) return false;
  EXPECT_EQ(column(*db, "PRAGMA integrity_check"), std::set<std::string>{"ok"});
  EXPECT_TRUE(column(*db, "SELECT id FROM operations").empty()) << "recovery leaves no operation behind";

  auto proxy = registry.bundleProxyForIdentifier(scenario.identifier);
  const bool installed = proxy && proxy->bundleType() == scenario.newType;
  if (installed) {
    EXPECT_FALSE(exists(package)) << "the new state consumed the package";
    EXPECT_TRUE(bundleReadable(proxy->bundleURL().path()));
    EXPECT_EQ(proxy->bundleURL().URLByDeletingLastPathComponent().path(), proxy->bundleContainerURL().path());
  } else {
    EXPECT_TRUE(bundleReadable(packageBundle)) << "the old state keeps the package: " << packageBundle;
    EXPECT_EQ(static_cast<bool>(proxy), static_cast<bool>(before));
    if (proxy && before) {
      EXPECT_EQ(proxy->bundleContainerURL().path(), before->bundleContainerURL().path());
      EXPECT_TRUE(proxy->foundBackingBundle());
    }
  }
  if (before) {
    EXPECT_EQ(proxy->dataContainerURL().path(), before->dataContainerURL().path());
    EXPECT_EQ(sl::test::readFile(proxy->dataContainerURL().path() + "/Documents/keep"), "user data");
  }
  // Nothing under the containers roots that no record names, and no data
  // container named twice.
  for (const auto& [rootPath, sql] :
       {std::pair{registry.bundleContainersRoot(), "SELECT bundle_container FROM applications"},
        std::pair{registry.dataContainersRoot(), "SELECT data_container FROM applications"},
        std::pair{registry.groupContainersRoot(), "SELECT path FROM groups"}}) {
    const std::set<std::string> named = column(*db, sql);
    for (const std::string& entry : entries(rootPath)) EXPECT_EQ(named.count(entry), 1u) << "stray " << entry;
  }
  EXPECT_TRUE(column(*db, "SELECT data_container FROM applications WHERE data_container IS NOT NULL "
                          "GROUP BY data_container HAVING COUNT(*) > 1")
                  .empty());
  for (const std::string& entry : entries(fileURL(package).URLByDeletingLastPathComponent().path())) {
    EXPECT_EQ(entry.find(".rgtrash"), std::string::npos) << entry;
    EXPECT_EQ(entry.find(".rgrestore"), std::string::npos) << entry;
  }
  return installed;
}

void runScenario(const Scenario& scenario, bool otherVolume) {
  bool completed = false;
  int crashes = 0;
  for (int k = 1; k <= 5000 && !completed; ++k) {
    SCOPED_TRACE(std::string(scenario.name) + " killed at change " + std::to_string(k));
    RegistryRoot root;
    std::optional<sl::test::TempDir> far;  // on the disk, only when asked for
    if (otherVolume) far.emplace();
    const std::string parent = otherVolume ? far->path() : root / "private/var/mobile/Applications/C";
    std::string package;
    std::shared_ptr<RGBundleProxy> before;
    {
      auto registry = root.open();
      ASSERT_TRUE(registry);
      package = scenario.prepare(root, *registry, parent);
      before = registry->bundleProxyForIdentifier(scenario.identifier);
      if (before) sl::test::writeFile(before->dataContainerURL().path() + "/Documents/keep", "user data");
    }
    const std::string packageBundle =
        std::string(scenario.packageType) == RGPackageTypePlaceholder ? package : package + "/Payload/App.app";

    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      sl::mut::setPlanForTesting("kill@" + std::to_string(k));
      auto registry = EmbeddedRegistry::open(root.configuration(), nullptr);
      const bool ok = registry && install(*registry, package, scenario.identifier, scenario.packageType);
      ::_exit(ok ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    completed = WIFEXITED(status) && WEXITSTATUS(status) == 0;
    ASSERT_TRUE(completed || (WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL)) << "status " << status;
    if (!completed) ++crashes;

    auto registry = root.open();
    ASSERT_TRUE(registry);
    const bool installed = checkInvariant(*registry, scenario, package, packageBundle, before);
    EXPECT_TRUE(installed || !completed);
  }
  EXPECT_TRUE(completed);
  EXPECT_GE(crashes, 8) << "the install has fewer changes than expected";
}

const std::vector<Scenario>& scenarios() {
  static const std::vector<Scenario> all = {
      {"placeholder", "com.crash.placeholder", RGPackageTypePlaceholder, "Placeholder",
       [](RegistryRoot&, EmbeddedRegistry&, const std::string& parent) {
         makeBundle(parent + "/com.crash.placeholder.app", "com.crash.placeholder");
         return parent + "/com.crash.placeholder.app";
       }},
      {"real over placeholder", "com.crash.real", RGPackageTypeCustomer, "User",
       [](RegistryRoot& root, EmbeddedRegistry& registry, const std::string& parent) {
         makeBundle(root / "tmp/com.crash.real.app", "com.crash.real");
         EXPECT_TRUE(install(registry, root / "tmp/com.crash.real.app", "com.crash.real", RGPackageTypePlaceholder));
         makeCustomerPackage(parent + "/Staging", "com.crash.real", "2", {"group.crash"});
         sl::test::writeFile(parent + "/Staging/Manifest.plist", "m");
         return parent + "/Staging";
       }},
      {"customer with a group", "com.crash.grouped", RGPackageTypeCustomer, "User",
       [](RegistryRoot&, EmbeddedRegistry&, const std::string& parent) {
         makeCustomerPackage(parent + "/Staging", "com.crash.grouped", "1", {"group.one", "group.two"});
         makeBundle(parent + "/Staging/Payload/Tunnel.vpnplugin", "com.crash.grouped.vpn");
         return parent + "/Staging";
       }},
  };
  return all;
}

TEST(RegistryCrashTest, KilledInstallsRecoverToOldOrNewState) {
  if (!sl::mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  for (const Scenario& scenario : scenarios()) runScenario(scenario, false);
}

TEST(RegistryCrashTest, KilledCopyingInstallsRecoverToOldOrNewState) {
  if (!sl::mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  sl::test::TempDir far;
  if (sameVolume(far.path(), sl::test::TempDir::kShm))
    GTEST_SKIP() << "/dev/shm and the temporary directory share a volume";
  runScenario(scenarios()[0], true);
  runScenario(scenarios()[1], true);
}

// An install stopped after its moves, then links planted in its package by
// the package's owner: recovery follows none of them. An item whose
// directory in the package became a link goes (with a notice) instead of
// coming back; one whose directory is still the package's comes back.
TEST(RegistryCrashTest, RecoveryFollowsNoLinkPlantedInThePackage) {
  if (!sl::mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  for (const std::string replaced : {"Staging/Payload", "Staging"}) {
    SCOPED_TRACE(replaced);
    RegistryRoot root;
    const std::string old = root / "private/var/mobile/Applications/C";
    const std::string package = old + "/Staging";
    makeCustomerPackage(package, "com.crash.linked");
    sl::test::writeFile(package + "/Manifest.plist", "m");
    const std::string bundleRoot = root.open()->bundleContainersRoot();
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      sl::mut::setPlanForTesting("kill@1:xattr");  // the install type, set once every move is made
      auto registry = EmbeddedRegistry::open(root.configuration(), nullptr);
      ::_exit(registry && install(*registry, package, "com.crash.linked", RGPackageTypeCustomer) ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << "status " << status;
    const std::vector<std::string> containers = entries(bundleRoot);
    ASSERT_EQ(containers.size(), 1u);
    ASSERT_TRUE(exists(containers[0] + "/App.app/Info.plist") && exists(containers[0] + "/Manifest.plist"));

    sl::test::Sentinel sentinel;
    sl::test::forceRemove(old + "/" + replaced);
    sl::test::makeSymlink(sentinel.path(), old + "/" + replaced);
    sl::test::LogCapture log;
    auto registry = root.open();
    ASSERT_TRUE(registry);
    EXPECT_EQ(sentinel.changes(), std::vector<std::string>{});
    auto removing = [&](const std::string& source, const std::string& name) {
      return sl::test::installerLine(sl::kLogLevelNotice, "rg::undoMove",
                                     "Undo of the move of " + package + source +
                                         ": its directory is gone or reached through a link; removing " +
                                         containers[0] + "/" + name);
    };
    if (replaced == "Staging") {
      EXPECT_EQ(log.installer(), (std::vector{removing("/Manifest.plist", "Manifest.plist"),
                                              removing("/Payload/App.app", "App.app")}));
    } else {
      EXPECT_EQ(log.installer(), std::vector{removing("/Payload/App.app", "App.app")});
      EXPECT_EQ(sl::test::readFile(package + "/Manifest.plist"), "m");
    }
    EXPECT_FALSE(registry->applicationIsInstalled("com.crash.linked"));
    std::optional<rg::Database> db = rg::Database::open(registry->databasePath(), nullptr);
    ASSERT_TRUE(db);
    EXPECT_EQ(column(*db, "PRAGMA integrity_check"), std::set<std::string>{"ok"});
    EXPECT_EQ(column(*db, "SELECT COUNT(*) FROM operations"), std::set<std::string>{"0"});
    for (const std::string& made : {bundleRoot, registry->dataContainersRoot(), registry->groupContainersRoot()}) {
      EXPECT_EQ(entries(made), std::vector<std::string>{}) << made;
    }
  }
}

// A copy across volumes that fails half-way (its second file's write) is
// removed again, on the way into the container and on the way back, and
// the call's record says which way; the next attempt then finishes.
TEST(RegistryCrashTest, FailedCopiesAcrossVolumesLeaveNothingBehind) {
  if (!sl::mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  sl::test::TempDir shm(sl::test::TempDir::kShm), disk;
  if (sameVolume(shm.path(), disk.path())) GTEST_SKIP() << "/dev/shm and the temporary directory share a volume";
  const std::string package = disk / "Staging";
  const rg::Move move{makeCustomerPackage(package, "com.example.far"), shm / "Container/App.app"};
  sl::test::makeDirs(shm / "Container");
  auto failOnce = [](const char* plan) { ASSERT_TRUE(sl::mut::setPlanForTesting(plan)); };
  sl::Error error;

  failOnce("EIO@2:write");
  EXPECT_FALSE(rg::moveIntoContainer(move, &error));
  sl::test::expectPOSIXRecord(error, EIO,
                              "copyfile of " + move.source + " to " + shm / "Container/.App.app.partial" +
                                  " failed: Input/output error",
                              "rg::moveIntoContainer");
  EXPECT_EQ(entries(shm / "Container"), std::vector<std::string>{});
  EXPECT_TRUE(bundleReadable(move.source));
  failOnce("");
  ASSERT_TRUE(rg::moveIntoContainer(move, &error)) << error.description();
  EXPECT_EQ(entries(package + "/Payload"), std::vector<std::string>{});

  failOnce("EIO@2:write");
  EXPECT_FALSE(rg::undoMove(move, package, &error));
  sl::test::expectPOSIXRecord(error, EIO,
                              "copyfile of " + move.destination + " to " + package + "/Payload/.App.app.rgrestore" +
                                  " failed: Input/output error",
                              "rg::undoMove");
  EXPECT_EQ(entries(package + "/Payload"), std::vector<std::string>{});
  EXPECT_TRUE(bundleReadable(move.destination));
  failOnce("");
  ASSERT_TRUE(rg::undoMove(move, package, &error)) << error.description();
  EXPECT_EQ(entries(package + "/Payload"), std::vector<std::string>{move.source});
  EXPECT_EQ(sl::test::readFile(move.source + "/Executable"), "binary of com.example.far");
}

}  // namespace

// The database under the same plans: a refused write or creation fails the
// statement (or the open) with SQLite's error for that errno, and nothing
// of it lands.
TEST(RegistryCrashTest, RefusedDatabaseChangesFailAndLeaveNothing) {
  if (!sl::mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  sl::test::TempDir dir(sl::test::TempDir::kShm);
  ASSERT_TRUE(sl::mut::setPlanForTesting("EACCES@1:create"));
  sl::Error error;
  EXPECT_FALSE(rg::Database::open(dir / "db.sqlite", &error));
  sl::test::expectRecord(error, RGErrorDomain, kRGDatabaseError,
                         "open of " + dir / "db.sqlite" + " failed: unable to open database file (14)", "rg::Database");
  EXPECT_FALSE(exists(dir / "db.sqlite"));

  ASSERT_TRUE(sl::mut::setPlanForTesting(""));
  std::optional<rg::Database> db = rg::Database::open(dir / "db.sqlite", nullptr);
  ASSERT_TRUE(db && db->exec("CREATE TABLE t(x)", nullptr));
  for (const auto& [plan, code] :
       {std::pair{"EIO@1:write", SQLITE_IOERR_WRITE}, std::pair{"ENOSPC@2:write", SQLITE_FULL}}) {
    SCOPED_TRACE(plan);
    ASSERT_TRUE(sl::mut::setPlanForTesting(plan));
    EXPECT_FALSE(db->exec("INSERT INTO t VALUES(1)", nullptr));
    EXPECT_EQ(sqlite3_extended_errcode(db->handle()), code);
    ASSERT_TRUE(sl::mut::setPlanForTesting(""));
    EXPECT_EQ(column(*db, "SELECT COUNT(*) FROM t"), std::set<std::string>{"0"});
  }
}

// A commit waits for the flushes this thread deferred; when they fail it is
// rolled back and says why.
TEST(RegistryCrashTest, CommitsFlushWhatWasDeferredFirst) {
  if (!sl::mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  sl::test::TempDir dir(sl::test::TempDir::kShm);
  std::optional<rg::Database> db = rg::Database::open(dir / "db.sqlite", nullptr);
  ASSERT_TRUE(db && db->exec("CREATE TABLE t(x)", nullptr));
  sl::DeferredSyncs deferred;
  ASSERT_TRUE(sl::syncDirectory(dir.path()));
  ASSERT_TRUE(sl::mut::setPlanForTesting("EIO@1:sync"));
  sl::Error error;
  EXPECT_FALSE(db->exec("INSERT INTO t VALUES(1)", &error));
  sl::test::expectRecord(error, RGErrorDomain, kRGDatabaseError,
                         "INSERT INTO t VALUES(1) failed: what it records is not on disk: syncfs of " + dir.path() +
                             " failed: Input/output error",
                         "rg::Database");
  ASSERT_TRUE(sl::mut::setPlanForTesting("EIO@1000:sync"));
  EXPECT_EQ(column(*db, "SELECT COUNT(*) FROM t"), std::set<std::string>{"0"});
  {
    rg::Transaction intent(*db, nullptr, rg::Transaction::Depends::kOnNothingBefore);
    ASSERT_TRUE(db->exec("INSERT INTO t VALUES(1)", nullptr) && intent.commit(nullptr));
  }
  EXPECT_TRUE(sl::deferredSyncsPending());
  EXPECT_EQ(sl::mut::matchedCount(), 1u) << "an intent waits for nothing: the log's flush only";
  ASSERT_TRUE(db->exec("INSERT INTO t VALUES(2)", nullptr));
  EXPECT_FALSE(sl::deferredSyncsPending());
  EXPECT_EQ(sl::mut::matchedCount(), 3u) << "the deferred flush, then the log's own";
  ASSERT_TRUE(sl::mut::setPlanForTesting(""));
}
