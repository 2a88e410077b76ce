#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <map>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "Platform/UniqueFd.h"
#include "Support/Errors.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::test::LogCapture;
using sl::test::ScopedUnprivileged;
using sl::test::TempDir;
using Lines = std::vector<LogCapture::Line>;

constexpr char kRemove[] = "-[SLFileManager removeItemAtURL:error:]";
constexpr char kCallback[] = "_removefile_error_callback";
constexpr char kList[] = "-[SLFileManager urlsForItemsInDirectoryAtURL:ignoringSymlinks:error:]";
constexpr char kExists[] = "-[SLFileManager itemExistsAtURL:]";
constexpr char kDoesNotExist[] = "-[SLFileManager itemDoesNotExistAtURL:]";

SLFileManager& fm() { return SLFileManager::defaultManager(); }
sl::URL fileURL(const std::string& path, bool isDirectory = false) {
  return sl::URL::fileURLWithPath(path, isDirectory);
}
LogCapture::Line line(int level, const char* function, const std::string& message) {
  return {level, "installer", function, message};
}

void expectPOSIXRecord(const sl::Error& err, int code, const std::string& message, const char* function) {
  ASSERT_FALSE(err.isNull());
  EXPECT_EQ(err.domain(), sl::kPOSIXErrorDomain);
  EXPECT_EQ(err.code(), code);
  EXPECT_EQ(err.localizedDescription().str(), message);
  EXPECT_EQ(err.userInfo().get(SLFunctionNameErrorKey).asString().str(), function);
  EXPECT_TRUE(err.userInfo().contains(SLSourceFileLineErrorKey));
}

// name -> isDirectory, so that the stream's order does not matter.
std::map<std::string, bool> byName(const std::vector<sl::URL>& urls) {
  std::map<std::string, bool> out;
  for (const sl::URL& url : urls) out[url.lastPathComponent()] = url.isDirectory();
  return out;
}

TEST(ListingAndRemoval, RemoveTreesLinksAbsentAndNull) {
  TempDir tmp;
  sl::test::writeFile(tmp / "outside/keep", "kept");
  sl::test::writeFile(tmp / "tree/a/b/file");
  sl::test::makeSymlink(tmp / "outside", tmp / "tree/linkToDir");
  sl::test::makeSymlink(tmp / "outside/keep", tmp / "tree/a/linkToFile");
  LogCapture log;
  sl::Error err;

  // Links go, never what they point at.
  EXPECT_TRUE(fm().removeItemAtURL(fileURL(tmp / "tree", true), &err)) << err.description();
  EXPECT_TRUE(err.isNull());
  EXPECT_FALSE(sl::test::exists(tmp / "tree"));
  EXPECT_EQ(sl::test::readFile(tmp / "outside/keep"), "kept");

  // Nothing there: success, and the slot keeps what the caller put in it.
  const sl::Error sentinel("Sentinel", 42);
  err = sentinel;
  EXPECT_TRUE(fm().removeItemAtURL(fileURL(tmp / "tree", true), &err));
  EXPECT_EQ(err, sentinel);

  EXPECT_FALSE(fm().removeItemAtURL(nullptr, &err));
  expectPOSIXRecord(err, EFAULT, "nil url passed to -removeItemAtURL:error:", kRemove);
  EXPECT_EQ(log.installer(), Lines{});
}

TEST(ListingAndRemoval, RemoveUnreadableSubdirectoryFailsWithFirstError) {
  TempDir tmp;
  // box and tree belong to nobody, so nobody may remove what they hold;
  // locked is root's 0700, so nobody can neither read nor empty it.
  const std::string tree = tmp / "box/tree";
  sl::test::writeFile(tree + "/file");
  sl::test::writeFile(tree + "/locked/inner");
  ASSERT_EQ(chmod((tree + "/locked").c_str(), 0700), 0);
  for (const std::string& p : {tmp / "box", tree})
    ASSERT_EQ(lchown(p.c_str(), ScopedUnprivileged::kUid, ScopedUnprivileged::kGid), 0);
  LogCapture log;
  sl::Error err;
  {
    ScopedUnprivileged nobody;
    EXPECT_FALSE(fm().removeItemAtURL(fileURL(tree, true), &err));
  }
  expectPOSIXRecord(err, EACCES, "removefile of file://" + tree + "/ failed: Permission denied", kRemove);
  // locked is reported once, with why it could not be entered; its parent
  // then cannot be removed either.
  EXPECT_EQ(log.installer(), (Lines{
                                 line(3, kCallback, "removefile hit error for " + tree + "/locked : Permission denied"),
                                 line(3, kCallback, "removefile hit error for " + tree + " : Directory not empty"),
                             }));
  // The walk went on past the failure.
  EXPECT_FALSE(sl::test::exists(tree + "/file"));
  EXPECT_TRUE(sl::test::exists(tree + "/locked/inner"));
}

TEST(ListingAndRemoval, RemoveDeepTree) {
  TempDir shm(TempDir::kShm);
  // Built relative to descriptors: the path soon outgrows PATH_MAX.
  sl::UniqueFd fd(open(shm.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  for (int depth = 0; depth < 10000 && fd; ++depth) {
    ASSERT_EQ(mkdirat(fd.get(), "d", 0755), 0);
    fd = sl::UniqueFd(openat(fd.get(), "d", O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  }
  ASSERT_TRUE(fd);
  ASSERT_TRUE(sl::UniqueFd(openat(fd.get(), "leaf", O_WRONLY | O_CREAT | O_CLOEXEC, 0644)));
  fd.reset();
  sl::Error err;
  EXPECT_TRUE(fm().removeItemAtURL(fileURL(shm / "d", true), &err)) << err.description();
  EXPECT_FALSE(sl::test::exists(shm / "d"));
}

TEST(ListingAndRemoval, ListOneLevel) {
  TempDir tmp;
  const std::string dir = tmp / "dir";
  const std::string odd = "odd\xff\xfe";  // not UTF-8
  sl::test::writeFile(dir + "/file");
  sl::test::writeFile(dir + "/sub/inner");
  sl::test::writeFile(dir + "/" + odd, "bytes");
  sl::test::makeSymlink(dir + "/sub", dir + "/linkToSub");
  sl::test::makeDirs(tmp / "empty");
  LogCapture log;

  // Links kept: listed as non-directories and not followed.
  auto all = fm().urlsForItemsInDirectoryAtURL(fileURL(dir, true), false);
  ASSERT_TRUE(all);
  EXPECT_EQ(byName(*all), (std::map<std::string, bool>{{"file", false}, {"linkToSub", false}, {odd, false}, {"sub", true}}));
  for (const sl::URL& url : *all) {
    if (url.lastPathComponent() == odd) {
      EXPECT_EQ(sl::test::readFile(url.path()), "bytes");
    }
  }
  EXPECT_EQ(log.installer(), Lines{});

  // Links left out, one notice each.
  auto noLinks = fm().urlsForItemsInDirectoryAtURL(fileURL(dir, true), true);
  ASSERT_TRUE(noLinks);
  EXPECT_EQ(byName(*noLinks), (std::map<std::string, bool>{{"file", false}, {odd, false}, {"sub", true}}));
  EXPECT_EQ(log.installer(), Lines{line(5, kList, "Ignoring symlink at " + dir + "/linkToSub")});

  auto empty = fm().urlsForItemsInDirectoryAtURL(fileURL(tmp / "empty", true), false);
  ASSERT_TRUE(empty);
  EXPECT_TRUE(empty->empty());
}

TEST(ListingAndRemoval, ListRefusesLinksAndFiles) {
  TempDir tmp;
  sl::test::makeDirs(tmp / "dir");
  sl::test::makeSymlink(tmp / "dir", tmp / "link");
  sl::test::writeFile(tmp / "file");
  LogCapture log;
  sl::Error err;

  // Not followed: with O_NOFOLLOW|O_DIRECTORY Linux refuses a link as a
  // non-directory.
  EXPECT_FALSE(fm().urlsForItemsInDirectoryAtURL(fileURL(tmp / "link", true), false, &err));
  expectPOSIXRecord(err, ENOTDIR, "_IterateDirectory for " + tmp / "link" + " returned Not a directory", kList);
  EXPECT_FALSE(fm().urlsForItemsInDirectoryAtURL(fileURL(tmp / "file"), false, &err));
  expectPOSIXRecord(err, ENOTDIR, "_IterateDirectory for " + tmp / "file" + " returned Not a directory", kList);
  EXPECT_EQ(log.installer(), Lines{});
}

TEST(ListingAndRemoval, ExistsDanglingMissingAndUnsearchable) {
  TempDir tmp;
  sl::test::makeSymlink(tmp / "nowhere", tmp / "dangling");
  sl::test::makeDirs(tmp / "locked/child", 0700);  // root's: nobody cannot search it
  LogCapture log;

  EXPECT_TRUE(fm().itemExistsAtURL(fileURL(tmp / "dangling")));
  EXPECT_FALSE(fm().itemDoesNotExistAtURL(fileURL(tmp / "dangling")));
  EXPECT_FALSE(fm().itemExistsAtURL(fileURL(tmp / "missing")));
  EXPECT_TRUE(fm().itemDoesNotExistAtURL(fileURL(tmp / "missing")));
  EXPECT_EQ(log.installer(), Lines{});

  // Undeterminable: both answer no, each with one line.
  const sl::URL hidden = fileURL(tmp / "locked/child");
  {
    ScopedUnprivileged nobody;
    EXPECT_FALSE(fm().itemExistsAtURL(hidden));
    EXPECT_FALSE(fm().itemDoesNotExistAtURL(hidden));
  }
  const std::string message = "Failed to determine if file://" + tmp / "locked/child" + " exists: Permission denied";
  EXPECT_EQ(log.installer(), (Lines{line(3, kExists, message), line(3, kDoesNotExist, message)}));
}

TEST(ListingAndRemoval, DefaultManagerSameInstanceFromEveryThread) {
  std::vector<SLFileManager*> seen(8);
  std::vector<std::thread> threads;
  for (size_t i = 0; i < seen.size(); ++i)
    threads.emplace_back([&seen, i] { seen[i] = &SLFileManager::defaultManager(); });
  for (std::thread& t : threads) t.join();
  for (SLFileManager* m : seen) EXPECT_EQ(m, &SLFileManager::defaultManager());
}

}  // namespace
