#include <unistd.h>

#include <map>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "TestSupport/TestSupport.h"

namespace sl {
// Called after each directory of a removal walk has been listed (Platform/Removefile.cc).
extern void (*removefile_test_hook_after_listing)(int dirFd, const char* path);
}  // namespace sl

namespace {

using namespace sl::test;
using Lines = std::vector<LogCapture::Line>;

constexpr char kRemove[] = "-[SLFileManager removeItemAtURL:error:]";
constexpr char kCallback[] = "_removefile_error_callback";
constexpr char kList[] = "-[SLFileManager urlsForItemsInDirectoryAtURL:ignoringSymlinks:error:]";

SLFileManager& fm() { return SLFileManager::defaultManager(); }
std::string gVanishingIn;  // the directory whose entry "gone" the hook removes once it is listed

TEST(ListingAndRemoval, RemoveTreesVanishedAbsentAndNull) {
  TempDir tmp;
  writeFile(tmp / "tree/a/b/file");
  writeFile(tmp / "tree/gone");
  LogCapture log;
  sl::Error err;

  // An entry that vanishes under the walk is neither a failure nor worth a
  // line.
  gVanishingIn = tmp / "tree";
  sl::removefile_test_hook_after_listing = [](int fd, const char* path) {
    if (path == gVanishingIn) {
      EXPECT_EQ(unlinkat(fd, "gone", 0), 0);
    }
  };
  const bool removed = fm().removeItemAtURL(fileURL(tmp / "tree", true), &err);
  sl::removefile_test_hook_after_listing = nullptr;
  EXPECT_TRUE(removed) << err.description();
  EXPECT_FALSE(exists(tmp / "tree"));

  // Nothing there: success, and the slot keeps what the caller put in it.
  const sl::Error sentinel("Sentinel", 42);
  err = sentinel;
  EXPECT_TRUE(fm().removeItemAtURL(fileURL(tmp / "tree", true), &err));
  EXPECT_EQ(err, sentinel);
  // A path that cannot name anything is not "nothing there".
  writeFile(tmp / "file");
  EXPECT_FALSE(fm().removeItemAtURL(fileURL(tmp / "file/x"), &err));
  expectPOSIXRecord(err, ENOTDIR, "removefile of file://" + tmp / "file/x" + " failed: Not a directory", kRemove);
  EXPECT_TRUE(exists(tmp / "file"));

  EXPECT_FALSE(fm().removeItemAtURL(nullptr, &err));
  expectPOSIXRecord(err, EFAULT, "nil url passed to -removeItemAtURL:error:", kRemove);
  EXPECT_EQ(log.installer(), Lines{});
}

TEST(ListingAndRemoval, RemoveUnreadableSubdirectoryFailsWithFirstError) {
  TempDir tmp;
  // box and tree belong to nobody, so nobody may remove what they hold;
  // locked is root's 0700, so nobody can neither read nor empty it.
  const std::string tree = tmp / "box/tree";
  writeFile(tree + "/file");
  writeFile(tree + "/locked/inner");
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
  // then cannot be removed either. The walk went on past the failure.
  EXPECT_EQ(log.installer(),
            (Lines{installerLine(3, kCallback, "removefile hit error for " + tree + "/locked : Permission denied"),
                   installerLine(3, kCallback, "removefile hit error for " + tree + " : Directory not empty")}));
  EXPECT_FALSE(exists(tree + "/file"));
  EXPECT_TRUE(exists(tree + "/locked/inner"));
}

// name -> isDirectory, so that the stream's order does not matter.
std::map<std::string, bool> listing(const std::string& dir, bool ignoringSymlinks) {
  std::map<std::string, bool> out;
  const auto urls = fm().urlsForItemsInDirectoryAtURL(fileURL(dir, true), ignoringSymlinks);
  EXPECT_TRUE(urls) << dir;
  for (const sl::URL& url : urls.value_or(std::vector<sl::URL>{})) {
    EXPECT_TRUE(exists(url.path())) << url.path();
    out[url.lastPathComponent()] = url.isDirectory();
  }
  return out;
}

TEST(ListingAndRemoval, ListingAndExistence) {
  TempDir tmp;
  const std::string dir = tmp / "dir", odd = "odd\xff\xfe";  // not UTF-8
  writeFile(dir + "/file");
  writeFile(dir + "/sub/inner");
  writeFile(dir + "/" + odd);
  makeSymlink(dir + "/sub", dir + "/linkToSub");
  makeSymlink(dir, tmp / "link");
  makeSymlink(tmp / "nowhere", tmp / "dangling");
  makeDirs(tmp / "empty");
  makeDirs(tmp / "locked/child", 0700);  // root's: nobody cannot search it
  LogCapture log;

  // Links kept (listed as non-directories and not followed), or left out
  // with one notice each.
  EXPECT_EQ(listing(dir, false),
            (std::map<std::string, bool>{{"file", false}, {"linkToSub", false}, {odd, false}, {"sub", true}}));
  EXPECT_EQ(listing(tmp / "empty", false), (std::map<std::string, bool>{}));
  EXPECT_EQ(log.installer(), Lines{});
  EXPECT_EQ(listing(dir, true), (std::map<std::string, bool>{{"file", false}, {odd, false}, {"sub", true}}));
  EXPECT_EQ(log.installer(), Lines{installerLine(5, kList, "Ignoring symlink at " + dir + "/linkToSub")});
  log.clear();

  // With O_NOFOLLOW|O_DIRECTORY Linux refuses a link as a non-directory.
  sl::Error err;
  EXPECT_FALSE(fm().urlsForItemsInDirectoryAtURL(fileURL(tmp / "link", true), false, &err));
  expectPOSIXRecord(err, ENOTDIR, "_IterateDirectory for " + tmp / "link" + " returned Not a directory", kList);
  EXPECT_FALSE(fm().urlsForItemsInDirectoryAtURL(fileURL(dir + "/file"), false, &err));
  expectPOSIXRecord(err, ENOTDIR, "_IterateDirectory for " + dir + "/file returned Not a directory", kList);

  // A dangling link exists. Undeterminable (an unsearchable parent): both
  // tests answer no, each with one line.
  EXPECT_TRUE(fm().itemExistsAtURL(fileURL(tmp / "dangling")));
  EXPECT_FALSE(fm().itemDoesNotExistAtURL(fileURL(tmp / "dangling")));
  EXPECT_FALSE(fm().itemExistsAtURL(fileURL(tmp / "missing")));
  EXPECT_TRUE(fm().itemDoesNotExistAtURL(fileURL(tmp / "missing")));
  EXPECT_EQ(log.installer(), Lines{});
  {
    ScopedUnprivileged nobody;
    EXPECT_FALSE(fm().itemExistsAtURL(fileURL(tmp / "locked/child")));
    EXPECT_FALSE(fm().itemDoesNotExistAtURL(fileURL(tmp / "locked/child")));
  }
  const std::string message = "Failed to determine if file://" + tmp / "locked/child" + " exists: Permission denied";
  EXPECT_EQ(log.installer(), (Lines{installerLine(3, "-[SLFileManager itemExistsAtURL:]", message),
                                    installerLine(3, "-[SLFileManager itemDoesNotExistAtURL:]", message)}));
}

}  // namespace
