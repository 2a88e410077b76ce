#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "Platform/InstallerLog.h"
#include "Platform/UniqueFd.h"
#include "Support/Errors.h"
#include "TestSupport/TestSupport.h"

class SLFileManagerTestAccess {
 public:
  static bool traverse(const sl::URL& url, sl::Error* error, const SLFileManager::TraversalCallback& block) {
    return SLFileManager::defaultManager()._traverseDirectory(url, error, block);
  }
};

namespace {

using namespace sl::test;
using Lines = std::vector<LogCapture::Line>;

constexpr char kStandardize[] = "-[SLFileManager standardizeOwnershipAtURL:toUID:GID:validateSymlinks:error:]";
constexpr uid_t kNobody = ScopedUnprivileged::kUid;

SLFileManager& fm() { return SLFileManager::defaultManager(); }
struct stat lstatOf(const std::string& path) {
  struct stat st {};
  EXPECT_EQ(lstat(path.c_str(), &st), 0) << path << ": " << strerror(errno);
  return st;
}
// Owner, group and the permission bits, e.g. "65534:65534 644".
std::string ownerAndMode(const std::string& path) {
  struct stat st = lstatOf(path);
  char buffer[64];
  snprintf(buffer, sizeof buffer, "%u:%u %o", st.st_uid, st.st_gid, st.st_mode & 07777);
  return buffer;
}
void setMode(const std::string& path, mode_t mode) { ASSERT_EQ(chmod(path.c_str(), mode), 0) << path; }

struct ScopeExit {
  std::function<void()> run;
  ~ScopeExit() { run(); }
};

TEST(TraversalAndOwnership, TraversalStopsAndMissingRoot) {
  TempDir tmp;
  // A stop without a record leaves the slot as the caller set it.
  const sl::Error sentinel("Sentinel", 1);
  sl::Error err = sentinel;
  EXPECT_FALSE(
      SLFileManagerTestAccess::traverse(fileURL(tmp.path(), true), &err, [](FTSENT*, sl::Error*) { return false; }));
  EXPECT_EQ(err, sentinel);

  LogCapture log;
  EXPECT_FALSE(fm().standardizeOwnershipAtURL(fileURL(tmp / "absent", true), 0, 0, true, &err));
  expectPOSIXRecord(err, ENOENT, "Error for path " + tmp / "absent" + ": No such file or directory",
                    "-[SLFileManager _traverseDirectory:error:withBlock:]");
  EXPECT_EQ(log.installer(), Lines{});
}

// chown and chmod bump an item's ctime even when they change nothing, so an
// unchanged ctime shows that neither was called.
TEST(TraversalAndOwnership, StandardTreeIsNotTouched) {
  TempDir tmp;
  const std::string root = tmp / "root";
  writeFile(root + "/d/f");
  writeFile(root + "/d/wrong", "", 0600);  // the control: it must change
  makeSymlink("f", root + "/d/inside");
  for (const std::string& dir : {root, root + "/d"}) setMode(dir, 0755);
  const std::vector<std::string> standard = {root, root + "/d", root + "/d/f", root + "/d/inside"};
  auto ctimeOf = [](const std::string& path) {
    const timespec t = lstatOf(path).st_ctim;
    return std::pair(t.tv_sec, t.tv_nsec);
  };
  std::vector<std::pair<time_t, long>> before;
  for (const std::string& path : standard) before.push_back(ctimeOf(path));
  // Let the clock that stamps ctimes move past the newest one, so that a
  // change now would show.
  const auto newest = *std::max_element(before.begin(), before.end());
  for (timespec now{}; clock_gettime(CLOCK_REALTIME_COARSE, &now) == 0 && std::pair(now.tv_sec, now.tv_nsec) <= newest;)
    usleep(1000);

  LogCapture log;
  sl::Error err;
  EXPECT_TRUE(fm().standardizeOwnershipAtURL(fileURL(root, true), 0, 0, true, &err)) << err.description();
  for (size_t i = 0; i < standard.size(); ++i) EXPECT_EQ(ctimeOf(standard[i]), before[i]) << standard[i];
  EXPECT_EQ(ownerAndMode(root + "/d/wrong"), "0:0 644");
  EXPECT_EQ(log.installer(), Lines{});
}

// validateSymlinks off: links leading out are given the owner like any other
// entry (they have no mode), and their targets are not touched. On: the first
// such link stops the walk.
TEST(TraversalAndOwnership, OwnersModesAndLinksLeadingOut) {
  TempDir tmp;
  const std::string root = tmp / "root";
  writeFile(tmp / "outside", "", 0600);
  writeFile(root + "/exec", "", 0755);
  writeFile(root + "/setuid", "", 04644);
  writeFile(root + "/groupOnly");
  ASSERT_EQ(chown((root + "/groupOnly").c_str(), kNobody, 0), 0);
  makeDirs(root + "/closed");
  setMode(root + "/closed", 0700);
  struct Link {
    const char* name;
    std::string content, rejection;
  } links[] = {
      {"absolute", tmp / "outside",
       "Rejecting " + root + "/absolute -> " + tmp / "outside" + ", as absolute symlinks are not allowed"},
      {"climbs", "../outside",
       "Rejecting " + root + "/climbs -> /../outside, as it is points outside or to the base " + root},
  };
  for (const Link& link : links) makeSymlink(link.content, root + "/" + link.name);
  LogCapture log;
  sl::Error err;

  EXPECT_TRUE(fm().standardizeOwnershipAtURL(fileURL(root, true), kNobody, kNobody, false, &err)) << err.description();
  for (const char* name : {"/exec", "/setuid", "/groupOnly"}) EXPECT_EQ(ownerAndMode(root + name), "65534:65534 644");
  EXPECT_EQ(ownerAndMode(root + "/closed"), "65534:65534 755");
  for (const char* name : {"/absolute", "/climbs"}) EXPECT_EQ(ownerAndMode(root + name), "65534:65534 777");
  EXPECT_EQ(ownerAndMode(tmp / "outside"), "0:0 600");
  EXPECT_EQ(log.installer(), Lines{});

  for (const Link& link : links) {
    SCOPED_TRACE(link.name);
    for (const Link& other : links) forceRemove(root + "/" + other.name);
    makeSymlink(link.content, root + "/" + link.name);
    log.clear();
    EXPECT_FALSE(fm().standardizeOwnershipAtURL(fileURL(root, true), 0, 0, true, &err));
    const std::string message = "invalid symlink at " + root + "/" + link.name;
    expectRecord(err, SLInstallerErrorDomain, 70, message, kStandardize);
    EXPECT_EQ(err.userInfo().get("LegacyErrorString"), sl::Number(70));
    const std::string site = err.userInfo().get(SLSourceFileLineErrorKey).description();
    EXPECT_EQ(log.installer(), (Lines{installerLine(3, "-[SLFileManager realPathForURL:ifChildOfURL:]", link.rejection),
                                      installerLine(3, kStandardize, site + ": " + message)}));
  }
}

// Even root cannot change an immutable file, which gives a failing change on
// a disk file system (tmpfs does not take the attribute).
TEST(TraversalAndOwnership, FailedChangeDoesNotStopTheWalk) {
  TempDir tmp("/tmp");
  const std::string root = tmp / "root", locked = root + "/locked";
  writeFile(locked, "", 0755);
  writeFile(root + "/sub/other", "", 0755);
  sl::UniqueFd fd(open(locked.c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_TRUE(fd);
  int flags = 0;
  if (ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) != 0) GTEST_SKIP() << "no inode flags here: " << strerror(errno);
  flags |= FS_IMMUTABLE_FL;
  if (ioctl(fd.get(), FS_IOC_SETFLAGS, &flags) != 0) GTEST_SKIP() << "cannot set immutable: " << strerror(errno);
  ScopeExit unlock{[&] {
    flags &= ~FS_IMMUTABLE_FL;
    ioctl(fd.get(), FS_IOC_SETFLAGS, &flags);
  }};
  LogCapture log;
  sl::Error err;

  EXPECT_TRUE(fm().standardizeOwnershipAtURL(fileURL(root, true), kNobody, kNobody, false, &err)) << err.description();
  EXPECT_EQ(ownerAndMode(locked), "0:0 755");
  EXPECT_EQ(ownerAndMode(root + "/sub/other"), "65534:65534 644");
  EXPECT_EQ(log.installer(),
            (Lines{installerLine(3, kStandardize, "Could not chown " + locked + ": Operation not permitted"),
                   installerLine(3, kStandardize, "Could not chmod " + locked + ": Operation not permitted")}));
}

// The walk examines root/d, then d's only child, a dangling link; while the
// link is being validated (its realpath failure is logged) d is swapped for a
// link to a directory outside. d's second arrival still carries the status
// of the directory that was examined: it must not be changed through the
// link that now stands at its path.
TEST(TraversalAndOwnership, SwappedItemIsNotChangedThroughALink) {
  TempDir tmp;
  const std::string root = tmp / "root", elsewhere = tmp / "elsewhere";
  makeDirs(elsewhere);
  setMode(elsewhere, 0700);
  makeSymlink("missing", root + "/d/dangling");
  setMode(root + "/d", 0700);
  LogCapture log;
  sl::LogSink previous;  // assigned before the sink can run
  previous = sl::setInstallerLogSink([&](const sl::LogRecord& record) {
    if (std::string_view(record.message).starts_with("Failed to realpath") && !exists(root + "/d.moved")) {
      EXPECT_EQ(rename((root + "/d").c_str(), (root + "/d.moved").c_str()), 0);
      EXPECT_EQ(symlink(elsewhere.c_str(), (root + "/d").c_str()), 0);
    }
    previous(record);
  });
  ScopeExit restore{[&] { sl::setInstallerLogSink(previous); }};
  sl::Error err;

  EXPECT_TRUE(fm().standardizeOwnershipAtURL(fileURL(root, true), kNobody, kNobody, true, &err)) << err.description();
  EXPECT_EQ(ownerAndMode(root + "/d.moved"), "65534:65534 755");  // changed on its first arrival
  EXPECT_EQ(ownerAndMode(root + "/d"), "0:0 777");
  EXPECT_EQ(ownerAndMode(elsewhere), "0:0 700");
  const Lines& lines = log.installer();
  ASSERT_EQ(lines.size(), 3u);
  EXPECT_TRUE(lines[0].message.starts_with("Failed to realpath " + root + "/d/dangling"));
  EXPECT_EQ(lines[1], installerLine(3, kStandardize, "Could not chown " + root + "/d: Stale file handle"));
  EXPECT_EQ(lines[2], installerLine(3, kStandardize, "Could not chmod " + root + "/d: Stale file handle"));
}

}  // namespace
