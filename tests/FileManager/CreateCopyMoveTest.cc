#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <filesystem>
#include <regex>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "Platform/DataProtection.h"
#include "Platform/Mutations.h"
#include "Platform/UniqueFd.h"
#include "Support/Errors.h"
#include "TestSupport/TestSupport.h"

namespace {

using namespace sl::test;
using Lines = std::vector<LogCapture::Line>;

constexpr char kCreate[] = "-[SLFileManager createDirectoryAtURL:withIntermediateDirectories:mode:class:error:]";
constexpr char kCopy[] = "-[SLFileManager _copyItemAtURL:toURL:failIfSrcMissing:error:]";
constexpr char kMove[] = "-[SLFileManager _moveItemAtURL:toURL:failIfSrcMissing:error:]";
constexpr char kTemp[] = "-[SLFileManager createTemporaryDirectoryInDirectoryURL:error:]";

SLFileManager& fm() { return SLFileManager::defaultManager(); }
std::string url(const std::string& path) { return "file://" + path; }
struct stat lstatOf(const std::string& path) {
  struct stat st {};
  EXPECT_EQ(lstat(path.c_str(), &st), 0) << path;
  return st;
}
int protectionClassOf(const std::string& path) {
  sl::UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  return sl::protectionClassFcntl(fd.get(), sl::F_GETPROTECTIONCLASS);
}

TEST(CreateCopyMove, CreateDirectory) {
  TempDir tmp;
  writeFile(tmp / "file");
  auto dir = [&](const std::string& relative) { return fileURL(tmp / relative, true); };
  LogCapture log;
  sl::Error err;

  // The form without a class reports under the class form's name.
  EXPECT_FALSE(fm().createDirectoryAtURL(dir("a/b"), false, 0755, &err));
  expectPOSIXRecord(err, ENOENT, "mkdir of " + tmp / "a/b" + " failed: No such file or directory", kCreate);
  EXPECT_TRUE(fm().createDirectoryAtURL(dir("a/b"), true, 0750, &err));
  EXPECT_EQ(lstatOf(tmp / "a/b").st_mode, S_IFDIR | 0750);
  for (bool intermediates : {false, true})
    EXPECT_TRUE(fm().createDirectoryAtURL(dir("a/b"), intermediates, 0755, &err));

  // The class goes on new and existing directories alike.
  EXPECT_TRUE(fm().createDirectoryAtURL(dir("c"), false, 0755, 4, &err));
  EXPECT_EQ(protectionClassOf(tmp / "c"), 4);
  EXPECT_TRUE(fm().createDirectoryAtURL(dir("c"), true, 0755, 3, &err));
  EXPECT_EQ(protectionClassOf(tmp / "c"), 3);
  EXPECT_FALSE(fm().createDirectoryAtURL(dir("c"), false, 0755, 9, &err));
  expectPOSIXRecord(err, EINVAL, "Failed to setclass(9) on directory " + tmp / "c" + ": Invalid argument", kCreate);

  // A file in the way: mkdir's EEXIST passes it, the class step does not.
  EXPECT_TRUE(fm().createDirectoryAtURL(dir("file"), false, 0755, &err));
  EXPECT_FALSE(fm().createDirectoryAtURL(dir("file"), false, 0755, 4, &err));
  expectPOSIXRecord(err, ENOTDIR, "opendir of " + tmp / "file" + " failed: Not a directory", kCreate);
  EXPECT_FALSE(fm().createDirectoryAtURL(dir("file/x/y"), true, 0755, &err));
  expectPOSIXRecord(err, ENOTDIR, "mkpath_np of " + tmp / "file/x/y" + " failed: Not a directory", kCreate);
  EXPECT_EQ(log.installer(), Lines{});
}

TEST(CreateCopyMove, OneVolume) {
  TempDir shm(TempDir::kShm);
  writeFile(shm / "src/sub/inner", "data");
  makeSymlink("nowhere", shm / "dangling");
  LogCapture log;
  sl::Error err;

  // Copied trees are new inodes; the source stays.
  ASSERT_TRUE(fm().copyItemAtURL(fileURL(shm / "src", true), fileURL(shm / "copy", true), &err)) << err.description();
  EXPECT_EQ(readFile(shm / "copy/sub/inner"), "data");
  EXPECT_NE(lstatOf(shm / "copy/sub/inner").st_ino, lstatOf(shm / "src/sub/inner").st_ino);

  // A move is one rename: the tree keeps its inode.
  const ino_t inode = lstatOf(shm / "src").st_ino;
  ASSERT_TRUE(fm().moveItemAtURL(fileURL(shm / "src", true), fileURL(shm / "moved", true), &err));
  EXPECT_EQ(lstatOf(shm / "moved").st_ino, inode);
  EXPECT_FALSE(exists(shm / "src"));

  // A link is copied as the link itself.
  EXPECT_TRUE(fm().copyItemAtURL(fileURL(shm / "dangling"), fileURL(shm / "linkCopy"), &err));
  EXPECT_TRUE(S_ISLNK(lstatOf(shm / "linkCopy").st_mode));
  EXPECT_EQ(log.installer(), Lines{});
}

TEST(CreateCopyMove, MissingOrUnreachableSource) {
  TempDir tmp;
  writeFile(tmp / "locked/item");  // root's 0700 below: nobody cannot search it
  ASSERT_EQ(chmod((tmp / "locked").c_str(), 0700), 0);
  const sl::URL missing = fileURL(tmp / "missing"), to = fileURL(tmp / "to");
  const sl::Error sentinel("Sentinel", 42);
  sl::Error err = sentinel;

  EXPECT_TRUE(fm().copyItemIfExistsAtURL(missing, to, &err));
  EXPECT_TRUE(fm().moveItemIfExistsAtURL(missing, to, &err));
  EXPECT_EQ(err, sentinel);
  EXPECT_FALSE(exists(tmp / "to"));

  // A plain move of a missing source fails at the rename: only EXDEV falls
  // back to copying.
  const std::string both = url(tmp / "missing") + " to " + url(tmp / "to") + " failed: No such file or directory";
  EXPECT_FALSE(fm().copyItemAtURL(missing, to, &err));
  expectPOSIXRecord(err, ENOENT, "copyfile of " + both, kCopy);
  EXPECT_FALSE(fm().moveItemAtURL(missing, to, &err));
  expectPOSIXRecord(err, ENOENT, "rename of " + both, kMove);

  // A source whose state cannot be known is no "missing source".
  const std::string statMessage = "stat of " + url(tmp / "locked/item") + " failed: Permission denied";
  ScopedUnprivileged nobody;
  EXPECT_FALSE(fm().copyItemIfExistsAtURL(fileURL(tmp / "locked/item"), to, &err));
  expectPOSIXRecord(err, EACCES, statMessage, kCopy);
  EXPECT_FALSE(fm().moveItemIfExistsAtURL(fileURL(tmp / "locked/item"), to, &err));
  expectPOSIXRecord(err, EACCES, statMessage, kMove);
}

class CrossVolume : public testing::Test {
 protected:
  void SetUp() override {
    if (lstatOf(shm.path()).st_dev == lstatOf(disk.path()).st_dev)
      GTEST_SKIP() << shm.path() << " and " << disk.path() << " are on one volume";
  }
  TempDir shm{TempDir::kShm};
  TempDir disk{"/tmp"};
};

TEST_F(CrossVolume, MoveCopiesThenRemovesOrLogsSource) {
  // Modes, a link inside, a fifo, an extended attribute and a chain of
  // directories deeper than any walk would recurse come along.
  const std::string src = shm / "src";
  std::string deep = src;
  for (int i = 0; i < 300; ++i) deep += "/d";
  writeFile(deep + "/bottom", "deep");
  writeFile(src + "/file", "data", 0640);
  makeDirs(src + "/sub", 0700);
  makeSymlink("../file", src + "/sub/link");
  ASSERT_EQ(mkfifo((src + "/fifo").c_str(), 0600), 0);
  ASSERT_EQ(setxattr((src + "/file").c_str(), "user.test", "v", 1, 0), 0);
  makeSymlink("nowhere", shm / "dangling");
  LogCapture log;
  sl::Error err;

  ASSERT_TRUE(fm().moveItemAtURL(fileURL(src, true), fileURL(disk / "dst", true), &err)) << err.description();
  EXPECT_FALSE(exists(src));
  EXPECT_EQ(readFile(disk / "dst/file"), "data");
  EXPECT_EQ(lstatOf(disk / "dst/file").st_mode, S_IFREG | 0640);
  EXPECT_EQ(lstatOf(disk / "dst/sub").st_mode, S_IFDIR | 0700);
  EXPECT_EQ(lstatOf(disk / "dst/fifo").st_mode, S_IFIFO | 0600);
  char value[8] = {};
  EXPECT_EQ(getxattr((disk / "dst/file").c_str(), "user.test", value, sizeof value), 1);
  EXPECT_STREQ(value, "v");
  EXPECT_EQ(std::filesystem::read_symlink(disk / "dst/sub/link"), "../file");
  EXPECT_EQ(readFile(disk / "dst" + deep.substr(src.size()) + "/bottom"), "deep");

  // A dangling link travels as itself (following it would fail).
  EXPECT_TRUE(fm().moveItemAtURL(fileURL(shm / "dangling"), fileURL(disk / "dangling"), &err));
  EXPECT_TRUE(S_ISLNK(lstatOf(disk / "dangling").st_mode));
  EXPECT_FALSE(exists(shm / "dangling"));
  // So does a socket, which cannot be opened to be flushed.
  {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string socketPath = shm / "socket";
    ASSERT_LT(socketPath.size(), sizeof address.sun_path);
    socketPath.copy(address.sun_path, socketPath.size());
    sl::UniqueFd listening(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    ASSERT_EQ(::bind(listening.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
  }
  EXPECT_TRUE(fm().moveItemAtURL(fileURL(shm / "socket"), fileURL(disk / "socket"), &err)) << err.description();
  EXPECT_TRUE(S_ISSOCK(lstatOf(disk / "socket").st_mode));
  EXPECT_EQ(log.installer(), Lines{});

  // A source that cannot be removed afterwards stays and is logged: nobody
  // owns box/src and the destination's parent, but cannot unlink src from
  // root's box.
  const std::string stuck = shm / "box/src";
  writeFile(stuck + "/file", "data");
  makeDirs(disk / "out");
  for (const std::string& p : {stuck, stuck + "/file", disk / "out"})
    ASSERT_EQ(lchown(p.c_str(), ScopedUnprivileged::kUid, ScopedUnprivileged::kGid), 0);
  sl::Error removal;
  {
    ScopedUnprivileged nobody;
    EXPECT_TRUE(fm().moveItemAtURL(fileURL(stuck, true), fileURL(disk / "out/dst", true), &err));
    // The same refusal again, for the record the move logged.
    EXPECT_FALSE(fm().removeItemAtURL(fileURL(stuck, true), &removal));
  }
  EXPECT_EQ(readFile(disk / "out/dst/file"), "data");
  EXPECT_TRUE(exists(stuck));
  // The removal logs its own refusal each time; the move adds one line.
  const auto refused =
      installerLine(3, "_removefile_error_callback", "removefile hit error for " + stuck + " : Permission denied");
  EXPECT_EQ(log.installer(),
            (Lines{refused,
                   installerLine(3, kMove,
                                 "Failed to remove move source after copy at " + stuck + " : " + removal.description()),
                   refused}));
}

// A move that is made but cannot be flushed, or whose fallback copy cannot
// be made or flushed, fails; a source that was copied stays until its copy
// is on disk.
TEST_F(CrossVolume, MovesThatFailHalfwayKeepTheCopiedSource) {
  if (!sl::mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  makeDirs(shm / "to");
  const std::string eio = " failed: Input/output error";
  const struct {
    const char* plan;
    std::string from, to;
    bool sourceStays;
    int code;
    const char* function;
    std::string message;
  } cases[] = {
      // One volume: the rename stands; the destination's directory is
      // flushed first, then the source's.
      {"EIO@1:sync", shm / "a", shm / "to/a", false, EIO, kMove,
       "rename of " + url(shm / "a") + " to " + url(shm / "to/a") + " is not durable: fsync of " + shm / "to" + eio},
      {"EIO@2:sync", shm / "b", shm / "to/b", false, EIO, kMove,
       "rename of " + url(shm / "b") + " to " + url(shm / "to/b") + " is not durable: fsync of " + shm.path() + eio},
      // Across volumes: the copy is made but not flushed.
      {"EIO@1:sync", shm / "c", disk / "c", true, EIO, kMove,
       "copy of " + url(shm / "c") + " to " + url(disk / "c") + " is not durable: syncfs of " + disk / "c" + eio},
      // The fallback copy itself fails: its record is the move's.
      {"EXDEV@1:rename", shm / "d", shm / "missing/d", true, ENOENT, kCopy,
       "copyfile of " + url(shm / "d") + " to " + url(shm / "missing/d") + " failed: No such file or directory"},
  };
  LogCapture log;
  for (const auto& c : cases) {
    SCOPED_TRACE(c.message);
    writeFile(c.from, "data");
    sl::Error err;
    ASSERT_TRUE(sl::mut::setPlanForTesting(c.plan));
    EXPECT_FALSE(fm().moveItemAtURL(fileURL(c.from), fileURL(c.to), &err));
    sl::mut::setPlanForTesting("");
    expectPOSIXRecord(err, c.code, c.message, c.function);
    EXPECT_EQ(exists(c.from), c.sourceStays);
    EXPECT_EQ(exists(c.to), c.code == EIO);
  }
  EXPECT_EQ(log.installer(), Lines{});
}

TEST(CreateCopyMove, TemporaryDirectories) {
  TempDir tmp;
  LogCapture log;
  sl::Error err("Sentinel", 42);

  const sl::URL a = fm().createTemporaryDirectoryInDirectoryURL(fileURL(tmp.path(), true), &err);
  const sl::URL b = fm().createTemporaryDirectoryInDirectoryURL(fileURL(tmp.path(), true), &err);
  EXPECT_TRUE(err.isNull());  // cleared on entry
  for (const sl::URL& made : {a, b}) {
    ASSERT_FALSE(made.isNull());
    EXPECT_TRUE(made.isDirectory());
    EXPECT_EQ(made.URLByDeletingLastPathComponent().path(), tmp.path());
    EXPECT_TRUE(std::regex_match(made.lastPathComponent(), std::regex(R"(temp\.[^/]{6})"))) << made.path();
    EXPECT_EQ(lstatOf(made.path()).st_mode, S_IFDIR | 0700);
  }
  EXPECT_NE(a.path(), b.path());
  EXPECT_EQ(log.installer(), Lines{});

  EXPECT_TRUE(fm().createTemporaryDirectoryInDirectoryURL(fileURL(tmp / "missing", true), &err).isNull());
  // The path as mkdtemp left it: the X's may have been replaced.
  const std::string message = err.localizedDescription().str(), made = tmp / "missing/temp.XXXXXX";
  EXPECT_TRUE(message.starts_with("Failed to create temp dir at path " + tmp / "missing/temp.")) << message;
  expectRecord(err, SLInstallerErrorDomain, 4, message, kTemp);
  EXPECT_EQ(message.size(), ("Failed to create temp dir at path " + made).size());
  EXPECT_EQ(err.underlyingError(), sl::Error::posix(ENOENT));
  EXPECT_EQ(err.userInfo().get(SLPathArgumentErrorKey), fileURL(made, true));
  const std::string lineNumber = err.userInfo().get(SLSourceFileLineErrorKey).description();
  EXPECT_EQ(
      log.installer(),
      (Lines{installerLine(3, kTemp, lineNumber + ": " + message + " (" + err.underlyingError().description() + ")")}));
}

}  // namespace
