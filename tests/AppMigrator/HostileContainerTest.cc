// Whole migrations of an old layout that holds one hostile container. A
// sentinel tree outside the system root must come out unchanged, whatever
// the container holds.
#include <sys/inotify.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <functional>
#include <thread>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "MigratorTestSupport.h"
#include "Platform/UniqueFd.h"
#include "TestSupport/Sentinel.h"

namespace {

using namespace mgtest;
using sl::test::exists;
using sl::test::makeDirs;
using sl::test::makeSymlink;
using sl::test::Sentinel;
using sl::test::writeFile;
using ::testing::Contains;
using ::testing::IsEmpty;
constexpr int E = sl::kLogLevelError;
constexpr char kMarker[] = "com.vantor.stowline.container_migrator.plist";

class HostileContainerTest : public MigratorTest {
 protected:
  // A fresh root and registry for the next case of a table.
  void reset() {
    TearDown();
    SetUp();
  }
  bool migrate() {
    std::unique_ptr<SLAppMigrator> migrator = SLAppMigrator::create();
    return migrator && migrator->performMigration();
  }
  static sl::Dictionary record(const std::string& container, const std::string& bundle) {
    return sl::Dictionary{{"ContainerPath", sl::String(container)},
                          {"BundlePath", sl::String(bundle)},
                          {"ContainerType", sl::String("App")},
                          {"BundleIdentifier", sl::String("com.forged")}};
  }
};

TEST_F(HostileContainerTest, HostileItemsInAContainer) {
  Sentinel sentinel;  // under /dev/shm, the volume of the root
  const std::string c = oldEntry("C");
  const struct {
    const char* name;
    std::function<void()> plant;  // after C/A.app (com.a) and C/Documents/doc.txt are made
    bool result;
    std::string line;  // a host-log line the case must log ("" for none)
  } cases[] = {
      {"data items that are absolute links to the sentinel",
       [&] {
         sl::test::forceRemove(c + "/Documents");
         makeSymlink(sentinel.path(), c + "/Documents");
         makeSymlink(sentinel / "secret.txt", c + "/Library/Preferences/p.plist");
       },
       true, ""},
      // A marker is used as it stands: one naming another container of the
      // root has that container migrated (and removed) under the marker's
      // identifier, while its own container stays: one item remains. (The
      // program refuses markers that lead outside the root before it loads
      // the plug-in.)
      {"forged marker naming another container of the root",
       [&] {
         makeBundle(oldEntry("D") + "/B.app", "com.d");
         writePlist(c + "/" + kMarker, record(oldEntry("D"), oldEntry("D") + "/B.app"));
       },
       false,
       "SLAppMigrator: Not removing " + u(below(kInstallMap)) + " because 1 items remain unmigrated."},
      // Two containers claiming one identifier would pour their data into
      // one data container, the later over the earlier: neither moves.
      {"another container claiming the same identifier",
       [&] {
         makeBundle(oldEntry("D") + "/B.app", "com.a");
         writeFile(oldEntry("D") + "/Documents/doc.txt", "the other doc");
       },
       false,
       "SLAppMigrator: Leaving " + oldEntry("D") + " in place: 2 containers claim the identifier com.a"},
      {"marker that is a fifo", [&] { ASSERT_EQ(mkfifo((c + "/" + kMarker).c_str(), 0600), 0); }, false,
       "SLAppMigrator: Failed to load migration marker file from " + u(c + "/" + kMarker)},
      {"sparse marker claiming 64 GiB",
       [&] {
         writeFile(c + "/" + kMarker, "");
         ASSERT_EQ(truncate((c + "/" + kMarker).c_str(), off_t{64} << 30), 0);
       },
       false, "SLAppMigrator: Failed to load migration marker file from " + u(c + "/" + kMarker)},
      {"marker that is a directory", [&] { makeDirs(c + "/" + kMarker); }, false,
       "SLAppMigrator: Failed to load migration marker file from " + u(c + "/" + kMarker, true)},
      {"marker that is a link to the sentinel", [&] { makeSymlink(sentinel / "secret.txt", c + "/" + kMarker); },
       false, "SLAppMigrator: Migration marker was symlink; skipping container " + u(c + "/" + kMarker)},
      {"bundle whose Info.plist is a fifo",
       [&] {
         sl::test::forceRemove(c + "/A.app/Info.plist");
         ASSERT_EQ(mkfifo((c + "/A.app/Info.plist").c_str(), 0600), 0);
       },
       true, "SLAppMigrator: Could not get identifier for bundle at " + u(c + "/A.app", true)},
      // The package is built in the container's own staging directory: a
      // link at its name, or at its Payload's, is removed first.
      {"staging directory that is a link to the sentinel",
       [&] {
         makeSymlink(sentinel.path(), c + "/Staging");
         writeFile(c + "/Manifest.plist", "store data");
       },
       true, "SLAppMigrator: Removing " + u(c + "/Staging", true) + " before staging: it is not a directory"},
      {"payload directory that is a link to the sentinel",
       [&] { makeSymlink(sentinel / "nested", c + "/Staging/Payload"); }, true,
       "SLAppMigrator: Removing " + u(c + "/Staging/Payload", true) + " before staging: it is not a directory"},
  };
  for (const auto& [name, plant, result, line] : cases) {
    SCOPED_TRACE(name);
    reset();
    makeBundle(c + "/A.app", "com.a");
    writeFile(c + "/Documents/doc.txt", "doc");
    plant();
    EXPECT_EQ(migrate(), result);
    if (!line.empty()) {
      EXPECT_THAT(hostLines(log_), Contains(std::pair(E, line)));
    }
    EXPECT_EQ(exists(c), !result);
    EXPECT_THAT(sentinel.changes(), IsEmpty());
  }
}

// Names planted at the marker's temporary name while it is written: the
// write never goes through them.
TEST_F(HostileContainerTest, NamesPlantedAtTheMarkersTemporaryName) {
  Sentinel sentinel;
  const std::string c = oldEntry("C");
  makeDirs(c);
  const sl::Dictionary marker = record(c, c + "/A.app");
  for (const char* kind : {"link", "fifo", "directory"}) {
    SCOPED_TRACE(kind);
    sl::UniqueFd watch(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    ASSERT_TRUE(watch);
    ASSERT_GE(inotify_add_watch(watch.get(), c.c_str(), IN_CREATE), 0);
    std::atomic<bool> stop{false};
    std::thread planter([&] {
      alignas(inotify_event) char buffer[4096];
      while (!stop) {
        ssize_t n = read(watch.get(), buffer, sizeof buffer);
        for (ssize_t at = 0; at < n;) {
          const auto* event = reinterpret_cast<const inotify_event*>(buffer + at);
          at += static_cast<ssize_t>(sizeof(inotify_event) + event->len);
          const std::string name = event->len ? event->name : "";
          if (name.rfind(std::string(".") + kMarker + ".", 0) != 0) continue;
          const std::string path = c + "/" + name;
          if (unlink(path.c_str()) != 0) continue;
          if (std::string(kind) == "link") (void)symlink((sentinel / "secret.txt").c_str(), path.c_str());
          if (std::string(kind) == "fifo") (void)mkfifo(path.c_str(), 0600);
          if (std::string(kind) == "directory") (void)mkdir(path.c_str(), 0700);
        }
      }
    });
    for (int i = 0; i < 100; ++i) (void)sl::writePropertyListToURL(marker, fileURL(c + "/" + kMarker));
    stop = true;
    planter.join();
    EXPECT_THAT(sentinel.changes(), IsEmpty());
  }
}

// A tmpfs mounted at a data item of a container holds the sentinel: the
// data item stays, and the container with it.
TEST_F(HostileContainerTest, MountInsideAContainer) {
  const std::string mountPoint = oldEntry("C") + "/Documents";
  makeBundle(oldEntry("C") + "/A.app", "com.a");
  makeDirs(mountPoint);
  sl::test::ScopedTmpfs mount(mountPoint);
  if (!mount.mounted()) GTEST_SKIP() << "cannot mount a tmpfs here: " << mount.error();
  Sentinel sentinel(mountPoint.c_str());
  EXPECT_FALSE(migrate());
  EXPECT_TRUE(exists(oldEntry("C") + "/A.app"));
  EXPECT_THAT(sentinel.changes(), IsEmpty());
}

}  // namespace
