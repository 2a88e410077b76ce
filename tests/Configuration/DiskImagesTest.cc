#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <optional>
#include <string>
#include <vector>

#include "Configuration/SLGlobalConfiguration.h"
#include "Platform/DeviceRegistry.h"
#include "Platform/Preferences.h"
#include "Platform/SystemRoot.h"
#include "Support/Log.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::test::LogCapture;
using sl::test::TempDir;
using Paths = std::vector<std::string>;

// A system root of its own, a made-up sysfs tree and mount table, and a log
// handle that lets debug lines through; all undone at the end.
struct DiskImageWorld {
  DiskImageWorld() {
    sl::test::makeDirs(block + "/vda");
    sl::test::makeDirs(root);
    sl::setSystemRoot(root);
    sl::preferencesResetForTesting();
    sl::setDeviceRegistryLocations(dir / "sys", mountInfo);
    gLogHandle = &debugHandle;
  }
  ~DiskImageWorld() {
    gLogHandle = nullptr;
    sl::setDeviceRegistryLocations("/sys", "/proc/self/mountinfo");
    sl::setSystemRoot("");
  }
  // Attaches an image to loopN, optionally with a partition loopNp1.
  void attach(int n, bool partitioned = false) const {
    const std::string device = block + "/loop" + std::to_string(n);
    sl::test::writeFile(device + "/loop/backing_file", "/images/" + std::to_string(n) + ".img\n");
    if (partitioned) sl::test::makeDirs(device + "/loop" + std::to_string(n) + "p1");
  }
  // Writes the mount table: the root, then one line per {source, mount point}.
  void mount(const std::vector<std::pair<std::string, std::string>>& mounts) const {
    std::string text = "21 1 8:1 / / rw shared:1 - ext4 /dev/vda1 rw\n";
    for (const auto& [source, point] : mounts) text += "40 21 7:0 / " + point + " rw - ext4 " + source + " rw\n";
    sl::test::writeFile(mountInfo, text);
  }

  TempDir dir;
  const std::string root = dir / "root", block = dir / "sys/block", mountInfo = dir / "mountinfo";
  sl::InstallerLogHandle debugHandle{sl::kLogLevelDebug};
};

template <class T>
Paths paths(const std::vector<T>& values) {
  Paths out;
  for (const T& v : values) out.push_back(v.asURL() ? v.asURL().path() : v.asString().str());
  return out;
}

TEST(DiskImages, MountPointsAndApplicationsDirectories) {
  DiskImageWorld world;
  SLGlobalConfiguration configuration;
  const std::string developerApps = world.root + "/Developer/Applications";
  const size_t handlesBefore = sl::dvOutstandingHandles();
  LogCapture log;

  // No loop device: no controller, just the developer directory, no error.
  EXPECT_TRUE(configuration.diskImageMountPoints().empty());
  EXPECT_EQ(paths(configuration.diskImageApplicationsDirectories()), Paths{developerApps});
  EXPECT_EQ(log.installer(), std::vector{sl::test::installerLine(
                                 sl::kLogLevelDebug, "-[SLGlobalConfiguration diskImageApplicationsDirectories]",
                                 sl::format("returning: %@", sl::Array{sl::test::fileURL(developerApps, true)}))});

  // loop1 has only its partition mounted (/dev/loop10 is not loop1, and the
  // blank comes escaped); loop2 and loop3 sit at the debug mount; loop4 is
  // not mounted (no line for it); of loop5's two mounts the first counts.
  // The developer directory comes last.
  for (int n : {2, 3, 4, 5}) world.attach(n);
  world.attach(1, true);
  world.mount({{"/dev/loop10", "/mnt/ten"},
               {"/dev/loop1p1", "/Volumes/My\\040Img"},
               {"/dev/loop2", "/private/var/debug_mount"},
               {"/dev/loop3", "/private/var/debug_mount2"},
               {"/dev/loop5", "/mnt/first"},
               {"/dev/loop5", "/mnt/second"}});
  log.clear();
  EXPECT_EQ(paths(configuration.diskImageMountPoints()),
            (Paths{"/Volumes/My Img", "/private/var/debug_mount", "/private/var/debug_mount2", "/mnt/first"}));
  EXPECT_EQ(paths(configuration.diskImageApplicationsDirectories()),
            (Paths{"/Volumes/My Img/Applications", "/mnt/first/Applications", developerApps}));
  EXPECT_EQ(log.installer().size(), 1u);  // just "returning: ..."

  // An image mounted on the developer root gives the developer directory,
  // held once, in mount order.
  world.attach(0);
  world.mount({{"/dev/loop0", world.root + "/Developer"}, {"/dev/loop5", "/mnt/first"}});
  EXPECT_EQ(paths(configuration.diskImageApplicationsDirectories()), (Paths{developerApps, "/mnt/first/Applications"}));

  // Unreadable mount table: one error line per drive asked (loop0 to loop5).
  sl::test::forceRemove(world.mountInfo);
  log.clear();
  EXPECT_TRUE(configuration.diskImageMountPoints().empty());
  EXPECT_EQ(log.installer(),
            std::vector(6, sl::test::installerLine(sl::kLogLevelError, "-[SLGlobalConfiguration mountPointForDevice:]",
                                                   "getmntinfo failed: No such file or directory")));
  EXPECT_EQ(sl::dvOutstandingHandles(), handlesBefore);
}

// Runs a shell command; its standard output, or none when it fails.
std::optional<std::string> run(const std::string& command) {
  FILE* pipe = ::popen((command + " 2>/dev/null").c_str(), "r");
  if (pipe == nullptr) return std::nullopt;
  std::string out;
  char buffer[256];
  while (size_t n = std::fread(buffer, 1, sizeof buffer, pipe)) out.append(buffer, n);
  if (::pclose(pipe) != 0) return std::nullopt;
  while (!out.empty() && out.back() == '\n') out.pop_back();
  return out;
}

struct RunAtExit {
  std::string command;
  ~RunAtExit() { (void)run(command); }
};

// The real registry and mount table, with an image attached to a real loop
// device and mounted below the test's directory.
TEST(DiskImages, RealLoopDevice) {
  if (::geteuid() != 0) GTEST_SKIP() << "attaching a loop device needs root";
  for (const char* tool : {"losetup", "mount", "umount", "truncate", "mkfs.ext4"}) {
    if (!run(std::string("command -v ") + tool)) GTEST_SKIP() << tool << " is not installed";
  }
  TempDir dir(TempDir::kShm);
  const std::string image = dir / "image", mountPoint = dir / "mnt";
  sl::test::makeDirs(mountPoint);
  if (!run("truncate -s 4M " + image + " && mkfs.ext4 -q -F " + image)) GTEST_SKIP() << "mkfs.ext4 failed";
  std::optional<std::string> device = run("losetup -f --show " + image);
  if (!device || device->empty()) GTEST_SKIP() << "losetup cannot attach a loop device here";
  RunAtExit detach{"losetup -d " + *device};
  if (!run("mount " + *device + " " + mountPoint)) GTEST_SKIP() << "cannot mount " << *device << " here";
  RunAtExit unmount{"umount " + mountPoint};  // runs before the detach

  sl::setSystemRoot(dir.path());
  const Paths mountPoints = paths(SLGlobalConfiguration().diskImageMountPoints());
  sl::setSystemRoot("");
  EXPECT_NE(std::find(mountPoints.begin(), mountPoints.end(), mountPoint), mountPoints.end()) << *device;
}

}  // namespace
