#include "Platform/Copyfile.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>
#include <string>
#include <tuple>
#include <vector>

#include "Platform/Removefile.h"
#include "Platform/UniqueFd.h"
#include "TestSupport/TestSupport.h"

namespace sl {
// Defined in Copyfile.cc for tests only.
extern bool copyfile_test_buffered_data;
}  // namespace sl

namespace {

using sl::test::exists, sl::test::makeDirs, sl::test::makeSymlink, sl::test::readFile, sl::test::writeFile;
using sl::test::TempDir;
using Names = std::vector<std::string>;

constexpr sl::copyfile_flags_t kFlags =
    sl::COPYFILE_ALL | sl::COPYFILE_RECURSIVE | sl::COPYFILE_NOFOLLOW_SRC | sl::COPYFILE_NOFOLLOW_DST;
static_assert(kFlags == 0xC800F);

// copyfile's errno, or 0 when it succeeded.
int copy(const std::string& from, const std::string& to, sl::copyfile_flags_t flags = kFlags) {
  errno = 0;
  return sl::copyfile(from.c_str(), to.c_str(), nullptr, flags) == 0 ? 0 : errno;
}

struct stat lstatOf(const std::string& path) {
  struct stat st {};
  EXPECT_EQ(lstat(path.c_str(), &st), 0) << path << ": " << strerror(errno);
  return st;
}

std::string linkTarget(const std::string& path) {
  std::error_code ec;  // empty for anything but a link
  return std::filesystem::read_symlink(path, ec);
}

Names names(const std::string& dir) {
  Names out;
  for (const auto& entry : std::filesystem::directory_iterator(dir)) out.push_back(entry.path().filename());
  std::sort(out.begin(), out.end());
  return out;
}

// name=value of each extended attribute of the item itself (never a link's
// target).
Names attributes(const std::string& path) {
  Names out;
  char list[4096];
  ssize_t n = llistxattr(path.c_str(), list, sizeof list);
  for (ssize_t i = 0; i < n; i += static_cast<ssize_t>(strlen(list + i)) + 1) {
    std::string value(65536, '\0');
    ssize_t size = lgetxattr(path.c_str(), list + i, value.data(), value.size());
    out.push_back(std::string(list + i) + "=" + value.substr(0, static_cast<size_t>(std::max<ssize_t>(size, 0))));
  }
  std::sort(out.begin(), out.end());
  return out;
}

void setAttribute(const std::string& path, const char* name, const std::string& value) {
  ASSERT_EQ(setxattr(path.c_str(), name, value.data(), value.size(), 0), 0) << path << " " << name;
}

// An ACL in its attribute form (version 2, then tag, permissions, id in
// little-endian): owner rwx, user 1234 r-x, group r-x, mask r-x, other none.
const std::string kAcl("\2\0\0\0" "\1\0\7\0\xff\xff\xff\xff" "\2\0\5\0\xd2\4\0\0" "\4\0\5\0\xff\xff\xff\xff"
                       "\x10\0\5\0\xff\xff\xff\xff" "\x20\0\0\0\xff\xff\xff\xff", 44);

// A tree with every kind the copy knows except devices, and metadata that a
// careless copy loses.
void buildTree(const std::string& root) {
  std::string data(3 << 20, '\0');
  for (size_t i = 0; i < data.size(); ++i) data[i] = static_cast<char>(i * 7 + i / 4096);
  writeFile(root + "/data", data);
  setAttribute(root + "/data", "user.big", std::string(3000, 'v'));  // beyond a first small read
  setAttribute(root + "/data", "system.posix_acl_access", kAcl);
  {
    sl::UniqueFd fd(open((root + "/sparse").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0640));
    ASSERT_EQ(pwrite(fd.get(), "head", 4, 0), 4);
    ASSERT_EQ(pwrite(fd.get(), "tail", 4, (16 << 20) - 4), 4);
  }
  writeFile(root + "/d1/d2/file", "deep");
  ASSERT_EQ(chmod((root + "/d1/d2").c_str(), 0700), 0);
  setAttribute(root + "/d1", "user.dir", "on a directory");
  makeSymlink("d1/d2/file", root + "/rel");
  makeSymlink(root + "/data", root + "/abs");
  makeSymlink("nowhere", root + "/dangling");
  ASSERT_EQ(lchown((root + "/abs").c_str(), 4321, 8765), 0);
  ASSERT_EQ(mkfifo((root + "/fifo").c_str(), 0620), 0);
  writeFile(root + "/setuid", "#!/bin/sh\n", 04755);
  ASSERT_EQ(chown((root + "/setuid").c_str(), 1234, 5678), 0);
  ASSERT_EQ(chmod((root + "/setuid").c_str(), 06755), 0);  // after chown, which clears it
  writeFile(root + "/closed/inner", "i");
  for (const char* item : {"data", "rel", "fifo", "d1/d2", "d1", "closed/inner", ""}) {
    const time_t seconds = *item ? 1000 : 2000;
    const timespec times[2] = {{seconds, 123456789}, {seconds + 1, 123456790}};
    ASSERT_EQ(utimensat(AT_FDCWD, (root + "/" + item).c_str(), times, AT_SYMLINK_NOFOLLOW), 0) << item;
  }
  chmod((root + "/closed").c_str(), 0);
}

// b is an exact copy of a: kinds, modes, owners, devices, modification times,
// contents, link targets and attributes, all the way down.
void expectSameTree(const std::string& a, const std::string& b) {
  SCOPED_TRACE(b);
  struct stat sa = lstatOf(a), sb = lstatOf(b);
  auto metadata = [](const struct stat& s) {
    return std::tuple(s.st_mode, s.st_uid, s.st_gid, s.st_rdev, s.st_mtim.tv_sec, s.st_mtim.tv_nsec);
  };
  EXPECT_EQ(metadata(sa), metadata(sb)) << "mode, uid, gid, rdev, mtime";
  EXPECT_EQ(attributes(a), attributes(b));
  if (!S_ISDIR(sa.st_mode)) {
    EXPECT_EQ(sa.st_size, sb.st_size);
    EXPECT_EQ(linkTarget(a), linkTarget(b));
    EXPECT_TRUE(!S_ISREG(sa.st_mode) || readFile(a) == readFile(b)) << "contents differ";
    return;
  }
  EXPECT_EQ(names(a), names(b));
  for (const std::string& name : names(a)) expectSameTree(a + "/" + name, b + "/" + name);
}

TEST(Copyfile, TreeBetweenVolumesAndWithinOne) {
  // Data goes by copy_file_range within a volume, by sendfile between
  // volumes, and through a buffer where neither is taken.
  const std::tuple<const char*, const char*, bool> volumes[] = {  // source parent, destination parent, buffered
      {TempDir::kShm, nullptr, false}, {nullptr, TempDir::kShm, true}, {nullptr, nullptr, false}};
  for (const auto& [from, to, buffered] : volumes) {
    TempDir src(from), dst(to);
    buildTree(src / "tree");
    sl::copyfile_test_buffered_data = buffered;
    int err = copy(src / "tree", dst / "copy");
    sl::copyfile_test_buffered_data = false;
    ASSERT_EQ(err, 0);
    struct stat data = lstatOf(dst / "copy/data");  // before any read of it
    EXPECT_EQ(std::pair(data.st_atim.tv_sec, data.st_atim.tv_nsec), std::pair(time_t{1000}, 123456789L));
    EXPECT_LT(lstatOf(dst / "copy/sparse").st_blocks * 512, 1 << 20) << "holes filled in";
    expectSameTree(src / "tree", dst / "copy");
  }

  // An attribute that the destination refuses fails the copy: ext4 keeps
  // values of at most a block (unless made with large attributes).
  TempDir shm(TempDir::kShm), disk;
  const std::string big(10000, 'v');
  writeFile(shm / "big");
  writeFile(disk / "probe");
  setAttribute(shm / "big", "user.big", big);
  if (setxattr((disk / "probe").c_str(), "user.big", big.data(), big.size(), 0) != 0) {
    EXPECT_EQ(copy(shm / "big", disk / "big"), ENOSPC);
  }
}

TEST(Copyfile, DeviceNodesAndSockets) {
  TempDir tmp(TempDir::kShm);
  makeDirs(tmp / "src");
  if (mknod((tmp / "src/char").c_str(), S_IFCHR | 0640, makedev(1, 3)) != 0 && errno == EPERM)
    GTEST_SKIP() << "making device nodes needs CAP_MKNOD";
  ASSERT_EQ(mknod((tmp / "src/block").c_str(), S_IFBLK | 0600, makedev(7, 200)), 0);
  ASSERT_EQ(mknod((tmp / "src/socket").c_str(), S_IFSOCK | 0755, 0), 0);
  ASSERT_EQ(copy(tmp / "src", tmp / "dst"), 0);
  expectSameTree(tmp / "src", tmp / "dst");
}

TEST(Copyfile, LinksAtTheTopAndAtTheDestination) {
  TempDir tmp(TempDir::kShm);
  writeFile(tmp / "target/file", "t");
  makeSymlink("target", tmp / "link");
  // A link source is copied as the link; without NOFOLLOW_SRC it is followed.
  ASSERT_EQ(copy(tmp / "link", tmp / "linkCopy"), 0);
  EXPECT_EQ(linkTarget(tmp / "linkCopy"), "target");
  ASSERT_EQ(copy(tmp / "link", tmp / "followed", kFlags & ~sl::COPYFILE_NOFOLLOW_SRC), 0);
  EXPECT_EQ(readFile(tmp / "followed/file"), "t");

  // A link to a directory at the destination is not followed: a directory
  // source fails, any other source replaces the link.
  makeSymlink(tmp / "target", tmp / "dstLink");
  writeFile(tmp / "src", "new");
  EXPECT_EQ(copy(tmp / "followed", tmp / "dstLink"), ENOTDIR);
  EXPECT_EQ(copy(tmp / "src", tmp / "dstLink"), 0);
  EXPECT_EQ(readFile(tmp / "dstLink"), "new");
  EXPECT_EQ(names(tmp / "target"), Names{"file"});

  // Without NOFOLLOW_DST a link to a directory stands for the directory.
  writeFile(tmp / "more/added");
  ASSERT_EQ(copy(tmp / "more", tmp / "link", kFlags & ~sl::COPYFILE_NOFOLLOW_DST), 0);
  EXPECT_EQ(names(tmp / "target"), (Names{"added", "file"}));
}

TEST(Copyfile, MergeReplaceAndConflicts) {
  TempDir tmp(TempDir::kShm);
  writeFile(tmp / "src/file", "new");
  writeFile(tmp / "src/sub/new");
  makeSymlink("x", tmp / "src/link");
  writeFile(tmp / "dst/file", "old");
  writeFile(tmp / "dst/keep");
  writeFile(tmp / "dst/sub/old");
  writeFile(tmp / "dst/link", "a file until now");
  ASSERT_EQ(copy(tmp / "src", tmp / "dst"), 0);
  EXPECT_EQ(names(tmp / "dst"), (Names{"file", "keep", "link", "sub"}));  // no temporaries
  EXPECT_EQ(names(tmp / "dst/sub"), (Names{"new", "old"}));
  EXPECT_EQ(readFile(tmp / "dst/file"), "new");
  EXPECT_EQ(linkTarget(tmp / "dst/link"), "x");

  writeFile(tmp / "other/sub", "a file where dst has a directory");
  const std::tuple<const char*, const char*, int> rows[] = {
      {"src/file", "dst/sub", EISDIR}, {"other", "dst", EISDIR},   {"src/sub", "dst/keep", ENOTDIR},
      {"src/file/", "x", ENOTDIR},     {"missing", "x", ENOENT},   {"src/file", "missing/x", ENOENT},
      {"src/file", "src/file", 0}};
  const ino_t inode = lstatOf(tmp / "src/file").st_ino;
  for (const auto& [from, to, err] : rows) EXPECT_EQ(copy(tmp / from, tmp / to), err) << from << " " << to;
  EXPECT_EQ(lstatOf(tmp / "src/file").st_ino, inode) << "copied onto itself";

  // An ACL that the destination directory would hand down is not added.
  makeDirs(tmp / "inheriting");
  setAttribute(tmp / "inheriting", "system.posix_acl_default", kAcl);
  ASSERT_EQ(copy(tmp / "src", tmp / "inheriting/copy"), 0);
  ASSERT_EQ(copy(tmp / "src/file", tmp / "inheriting/file"), 0);
  for (const char* item : {"inheriting/copy", "inheriting/copy/file", "inheriting/file"})
    EXPECT_EQ(attributes(tmp / item), Names{}) << item;
}

TEST(Copyfile, UnprivilegedCaller) {
  TempDir src(TempDir::kShm), dst(TempDir::kShm);
  ASSERT_EQ(chmod(dst.path().c_str(), 0777), 0);
  writeFile(src / "ok/setid", "x", 06755);
  writeFile(src / "tree/a", "a");
  writeFile(src / "tree/unreadable", "b", 0600);
  sl::test::ScopedUnprivileged nobody;
  // Owner and group cannot be given: the copy is the caller's, without the
  // set-id bits.
  ASSERT_EQ(copy(src / "ok", dst / "ok"), 0);
  struct stat st = lstatOf(dst / "ok/setid");
  EXPECT_EQ(std::pair(st.st_mode & 07777, st.st_uid), std::pair(0755u, sl::test::ScopedUnprivileged::kUid));
  // A file that cannot be read fails the copy; what was made stays.
  EXPECT_EQ(copy(src / "tree", dst / "tree"), EACCES);
  EXPECT_TRUE(exists(dst / "tree"));
}

TEST(Copyfile, IntoItselfAndVeryDeep) {
  TempDir tmp(TempDir::kShm);
  // The trees here may be too deep for TempDir's own cleanup.
  struct RemoveDeep {
    const TempDir& tmp;
    ~RemoveDeep() {
      for (const char* tree : {"a", "deep", "deepCopy"})
        sl::removefile((tmp / tree).c_str(), nullptr, sl::REMOVEFILE_RECURSIVE);
    }
  } removeDeep{tmp};
  writeFile(tmp / "a/f", "f");
  writeFile(tmp / "a/sub/g", "g");
  // A copy that never ends would fill the volume: it runs in a child that an
  // alarm stops.
  pid_t child = fork();
  if (child == 0) {
    alarm(5);
    _exit(copy(tmp / "a", tmp / "a/sub/copy"));
  }
  int status = -1;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "status " << status;
  EXPECT_EQ(readFile(tmp / "a/sub/copy/f"), "f");
  EXPECT_EQ(readFile(tmp / "a/sub/copy/sub/g"), "g");
  EXPECT_FALSE(exists(tmp / "a/sub/copy/sub/copy"));

  // Far deeper than the descriptor budget and than PATH_MAX.
  constexpr int kDepth = 10000;
  sl::UniqueFd fd(open(tmp.path().c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  for (int i = 0; i < kDepth && fd; ++i) {
    ASSERT_EQ(mkdirat(fd.get(), i == 0 ? "deep" : "d", 0755), 0);
    fd = sl::UniqueFd(openat(fd.get(), i == 0 ? "deep" : "d", O_PATH | O_DIRECTORY | O_CLOEXEC));
  }
  ASSERT_TRUE(fd);
  ASSERT_TRUE(sl::UniqueFd(openat(fd.get(), "bottom", O_WRONLY | O_CREAT | O_CLOEXEC, 0644)));
  EXPECT_EQ(copy(tmp / "deep", tmp / "deepCopy"), 0);
  fd = sl::UniqueFd(open((tmp / "deepCopy").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
  for (int i = 1; i < kDepth && fd; ++i) fd = sl::UniqueFd(openat(fd.get(), "d", O_PATH | O_DIRECTORY | O_CLOEXEC));
  ASSERT_TRUE(fd);
  struct stat st;
  EXPECT_EQ(fstatat(fd.get(), "bottom", &st, AT_SYMLINK_NOFOLLOW), 0);
}

}  // namespace
