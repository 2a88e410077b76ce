// Trees prepared by an attacker, handed to the file manager's removal,
// listing, ownership walk, copy and move. Every case keeps a sentinel tree
// outside the tree under test, and the sentinel must come out unchanged.

#include <fcntl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <functional>
#include <thread>
#include <tuple>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "Platform/UniqueFd.h"
#include "Support/Errors.h"
#include "TestSupport/Sentinel.h"
#include "TestSupport/TestSupport.h"

namespace {

using namespace sl::test;
using ::testing::Contains;
using ::testing::IsEmpty;

constexpr char kStandardize[] = "-[SLFileManager standardizeOwnershipAtURL:toUID:GID:validateSymlinks:error:]";
constexpr uid_t kNobody = ScopedUnprivileged::kUid;

SLFileManager& fm() { return SLFileManager::defaultManager(); }
sl::URL dirURL(const std::string& path) { return fileURL(path, true); }

// While it lives, a thread swaps `a` and `b` (a directory of the tree and a
// link to the sentinel) with renameat2(RENAME_EXCHANGE) as fast as it can.
// The constructor returns once the thread is swapping.
class Swapper {
 public:
  Swapper(std::string a, std::string b)
      : a_(std::move(a)), b_(std::move(b)), thread_([this] {
          while (!stop_.load(std::memory_order_relaxed)) {
            if (::renameat2(AT_FDCWD, a_.c_str(), AT_FDCWD, b_.c_str(), RENAME_EXCHANGE) == 0) ++swaps_;
            else if (swaps_ == 0) swaps_ = -1;  // nothing to swap: do not keep the constructor waiting
          }
        }) {
    while (swaps_ == 0) std::this_thread::yield();
  }
  ~Swapper() { stop_ = true; thread_.join(); }

 private:
  std::string a_, b_;
  std::atomic<bool> stop_{false};
  std::atomic<int> swaps_{0};
  std::thread thread_;
};

TEST(HostileTree, DirectorySwappedForALinkWhileTheOperationRuns) {
  const struct {
    const char* name;
    std::function<void(const std::string& tree)> operation;
  } cases[] = {
      {"removal", [](const std::string& tree) { (void)fm().removeItemAtURL(dirURL(tree)); }},
      {"listing", [](const std::string& tree) { (void)fm().urlsForItemsInDirectoryAtURL(dirURL(tree + "/d"), false); }},
      {"ownership walk",
       [](const std::string& tree) { (void)fm().standardizeOwnershipAtURL(dirURL(tree), kNobody, kNobody, false); }},
      {"copy", [](const std::string& tree) { (void)fm().copyItemAtURL(dirURL(tree + "/d"), dirURL(tree + "/copy")); }},
  };
  for (const auto& [name, operation] : cases) {
    SCOPED_TRACE(name);
    Sentinel sentinel;
    TempDir tmp(TempDir::kShm);
    LogCapture log;  // the walk's refusals are logged, not printed
    for (int i = 0; i < 200; ++i) {
      const std::string tree = tmp / std::to_string(i);
      // tree/d (0700, 0600 files, a subdirectory) and tree/.swap, a link to
      // the sentinel, for the swapper.
      makeDirs(tree + "/d/sub", 0700);
      for (const char* name : {"d/a", "d/b", "d/sub/c"}) writeFile(tree + "/" + name, "data", 0600);
      makeSymlink(sentinel.path(), tree + "/.swap");
      {
        Swapper swapper(tree + "/d", tree + "/.swap");
        operation(tree);
      }
      forceRemove(tree);
    }
    EXPECT_THAT(sentinel.changes(), IsEmpty());
  }
}

TEST(HostileTree, HardLinkToASentinelFileIsNotStandardised) {
  Sentinel sentinel;
  TempDir tmp(TempDir::kShm);  // the sentinel's volume, so the hard link can be made
  const std::string tree = tmp / "tree";
  writeFile(tree + "/own", "x", 0600);
  ASSERT_EQ(::link((sentinel / "secret.txt").c_str(), (tree + "/hard").c_str()), 0) << strerror(errno);
  LogCapture log;
  EXPECT_TRUE(fm().standardizeOwnershipAtURL(dirURL(tree), kNobody, kNobody, false));
  EXPECT_THAT(sentinel.changes(), IsEmpty());
  for (const char* change : {"chown", "chmod"}) {
    const std::string line = std::string("Could not ") + change + " " + tree + "/hard: Too many links";
    EXPECT_THAT(log.installer(), Contains(installerLine(3, kStandardize, line)));
  }
  struct stat st {};
  EXPECT_EQ(lstat((tree + "/own").c_str(), &st), 0);
  EXPECT_EQ(std::pair(st.st_uid, st.st_mode & 07777), std::pair(kNobody, 0644u));
}

TEST(HostileTree, LinksOutOfTheTreeLoopsAndChains) {
  Sentinel sentinel;
  TempDir tmp(TempDir::kShm);
  const struct {
    const char* name;
    std::vector<std::pair<std::string, std::string>> links;  // name in the tree -> content
    std::string refused;                                     // the link the validation stops at
  } cases[] = {
      {"absolute", {{"abs", sentinel / "secret.txt"}}, "abs"},
      {"climbing", {{"sub/up", "../../../../../.." + sentinel.path() + "/nested"}}, "sub/up"},
      {"loop", {{"sub/loop1", "loop2"}, {"sub/loop2", "loop1"}}, ""},
      // The first hop stays inside; the walk stops at the one that leaves.
      {"chain", {{"sub/chain", "../hop"}, {"hop", sentinel.path()}}, "hop"},
  };
  for (const auto& [name, links, refused] : cases) {
    SCOPED_TRACE(name);
    const std::string tree = tmp / name;
    writeFile(tree + "/sub/file", "x", 0600);
    for (const auto& [link, content] : links) makeSymlink(content, tree + "/" + link);
    LogCapture log;

    sl::Error error;
    EXPECT_FALSE(fm().standardizeOwnershipAtURL(dirURL(tree), kNobody, kNobody, true, &error));
    EXPECT_EQ(error.domain(), SLInstallerErrorDomain);
    EXPECT_EQ(error.code(), kSLInstallerInvalidSymlinkError);
    if (!refused.empty()) {
      EXPECT_EQ(error.localizedDescription().str(), "invalid symlink at " + tree + "/" + refused);
    }
    EXPECT_TRUE(fm().standardizeOwnershipAtURL(dirURL(tree), kNobody, kNobody, false));
    // The links travel and go as links.
    EXPECT_TRUE(fm().copyItemAtURL(dirURL(tree), dirURL(tree + ".copy")));
    for (const auto& link : links) EXPECT_EQ(std::filesystem::read_symlink(tree + ".copy/" + link.first), link.second);
    EXPECT_TRUE(fm().removeItemAtURL(dirURL(tree + ".copy")));
    EXPECT_TRUE(fm().removeItemAtURL(dirURL(tree)));
    EXPECT_THAT(sentinel.changes(), IsEmpty());
  }
}

TEST(HostileTree, DestinationsThatAreLinks) {
  Sentinel sentinel;
  TempDir shm(TempDir::kShm);
  TempDir disk;  // another volume: the move copies and removes
  for (const std::string& sourceBase : {shm.path(), disk.path()}) {
    SCOPED_TRACE(sourceBase);
    const std::string source = sourceBase + "/source", dir = sourceBase + "/sourceDir";
    writeFile(source, "new content");
    makeDirs(dir);
    makeSymlink(sentinel / "secret.txt", shm / "toFile");
    makeSymlink(sentinel / "nested", shm / "toDir");

    // A file replaces the link itself, by move and by copy.
    EXPECT_TRUE(fm().copyItemAtURL(fileURL(source), fileURL(shm / "toFile")));
    EXPECT_EQ(readFile(shm / "toFile"), "new content");
    EXPECT_TRUE(fm().moveItemAtURL(fileURL(source), fileURL(shm / "toDir")));
    EXPECT_EQ(readFile(shm / "toDir"), "new content");
    // A directory onto a link to a directory is refused, never merged into it.
    makeSymlink(sentinel / "nested", shm / "toDir2");
    sl::Error error;
    EXPECT_FALSE(fm().moveItemAtURL(dirURL(dir), fileURL(shm / "toDir2"), &error));
    EXPECT_TRUE(error.isPOSIX(ENOTDIR)) << error.description();
    for (const char* name : {"toFile", "toDir", "toDir2"}) forceRemove(shm / name);
    forceRemove(dir);
    EXPECT_THAT(sentinel.changes(), IsEmpty());
  }
}

TEST(HostileTree, LongOddNamesAndDeepPaths) {
  Sentinel sentinel;
  TempDir tmp(TempDir::kShm);
  const std::string tree = tmp / "tree";
  const std::string longName(255, 'n');
  const std::string odd[] = {"bad\xff\xfe", "new\nline", longName};
  for (const std::string& name : odd) writeFile(tree + "/" + name, "x", 0600);
  // A chain of directories whose path passes 4096 bytes, with a link to the
  // sentinel at the bottom.
  std::string deep = tree;
  const std::string level(200, 'd');
  sl::UniqueFd fd(::open(tree.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  for (int i = 0; i < 30; ++i) {
    ASSERT_EQ(::mkdirat(fd.get(), level.c_str(), 0700), 0);
    fd = sl::UniqueFd(::openat(fd.get(), level.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    deep += "/" + level;
  }
  ASSERT_EQ(::symlinkat(sentinel.path().c_str(), fd.get(), "out"), 0);
  ASSERT_GT(deep.size(), 4096u);
  LogCapture log;

  // Listing keeps the bytes of every name.
  auto listed = fm().urlsForItemsInDirectoryAtURL(dirURL(tree), false);
  ASSERT_TRUE(listed);
  std::vector<std::string> names;
  for (const sl::URL& url : *listed) names.push_back(url.lastPathComponent());
  EXPECT_THAT(names, ::testing::UnorderedElementsAre(odd[0], odd[1], odd[2], level));
  // A directory whose path is too long to name is refused with the errno.
  sl::Error error;
  EXPECT_FALSE(fm().urlsForItemsInDirectoryAtURL(dirURL(deep), false, &error));
  EXPECT_EQ(error.code(), ENAMETOOLONG);
  // The walk stops where paths get too long; nothing beyond is touched.
  EXPECT_FALSE(fm().standardizeOwnershipAtURL(dirURL(tree), kNobody, kNobody, true, &error));
  // Copy and removal work on descriptors, whatever the depth.
  EXPECT_TRUE(fm().copyItemAtURL(dirURL(tree), dirURL(tmp / "copy"), &error)) << error.description();
  EXPECT_TRUE(fm().removeItemAtURL(dirURL(tmp / "copy")));
  EXPECT_TRUE(fm().removeItemAtURL(dirURL(tree)));
  EXPECT_FALSE(exists(tree));
  EXPECT_THAT(sentinel.changes(), IsEmpty());
}

// A tmpfs mounted inside the tree holds the sentinel: the ownership walk
// changes the mount point (an entry of the walk) but does not enter it, and
// removal fails at the mount point (EBUSY).
TEST(HostileTree, MountInsideTheTreeIsNotEntered) {
  TempDir tmp(TempDir::kShm);
  const std::string tree = tmp / "tree", mountPoint = tree + "/mnt";
  makeDirs(mountPoint);
  sl::test::ScopedTmpfs mount(mountPoint);
  if (!mount.mounted()) GTEST_SKIP() << "cannot mount a tmpfs here: " << mount.error();
  Sentinel sentinel(mountPoint.c_str());
  writeFile(tree + "/own", "x", 0600);
  LogCapture log;
  EXPECT_TRUE(fm().standardizeOwnershipAtURL(dirURL(tree), kNobody, kNobody, true));
  struct stat own {}, mounted {};
  EXPECT_EQ(lstat((tree + "/own").c_str(), &own), 0);
  EXPECT_EQ(lstat(mountPoint.c_str(), &mounted), 0);
  EXPECT_EQ(std::tuple(own.st_uid, own.st_gid, own.st_mode & 07777), std::tuple(kNobody, kNobody, 0644u));
  EXPECT_EQ(std::tuple(mounted.st_uid, mounted.st_gid, mounted.st_mode & 07777), std::tuple(kNobody, kNobody, 0755u));
  sl::Error error;
  EXPECT_FALSE(fm().removeItemAtURL(dirURL(tree), &error));
  EXPECT_TRUE(error.isPOSIX(EBUSY)) << error.description();
  EXPECT_THAT(sentinel.changes(), IsEmpty());
}

}  // namespace
