#include <limits.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "FileManager/SLFileManager.h"
#include "Platform/UniqueFd.h"
#include "Support/Errors.h"
#include "Support/Log.h"
#include "TestSupport/TestSupport.h"

class SLFileManagerTestAccess {
 public:
  static bool validateSymlink(const sl::String& path, int32_t start, int32_t* end) {
    return SLFileManager::defaultManager()._validateSymlink(path, start, end);
  }
  static sl::URL realPathWhatExistsInPath(const sl::String& path) {
    return SLFileManager::defaultManager()._realPathWhatExistsInPath(path);
  }
};

namespace {

using Access = SLFileManagerTestAccess;
using sl::test::LogCapture;
using sl::test::TempDir;
using Lines = std::vector<LogCapture::Line>;

constexpr char kCreate[] = "-[SLFileManager createSymbolicLinkAtURL:withDestinationURL:error:]";
constexpr char kRead[] = "-[SLFileManager destinationOfSymbolicLinkAtURL:error:]";
constexpr char kRealPath[] = "-[SLFileManager _realPathForURL:allowNonExistentPathComponents:]";
constexpr char kPrefix[] = "-[SLFileManager _realPathWhatExistsInPath:]";
constexpr char kCheck[] = "-[SLFileManager realPathForURL:ifChildOfURL:]";

SLFileManager& fm() { return SLFileManager::defaultManager(); }
sl::URL fileURL(const std::string& path, bool isDirectory = false) {
  return sl::URL::fileURLWithPath(path, isDirectory);
}
LogCapture::Line line(int level, const char* function, const std::string& message) {
  return {level, "installer", function, message};
}
// A path as realpath gives it, so expected real paths are plain strings.
std::string realPathOf(const std::string& path) {
  char buffer[PATH_MAX];
  return realpath(path.c_str(), buffer) ? buffer : "";
}
void expectPOSIXRecord(const sl::Error& err, int code, const std::string& message, const char* function) {
  EXPECT_EQ(err, sl::Error(sl::kPOSIXErrorDomain, code, err.userInfo()));
  EXPECT_EQ(err.localizedDescription().str(), message);
  EXPECT_EQ(err.userInfo().get(SLFunctionNameErrorKey).asString().str(), function);
}

TEST(SymlinksAndContainment, CreateAndReadLinks) {
  TempDir tmp;
  sl::test::writeFile(tmp / "file");
  LogCapture log;
  sl::Error err;

  // The content is kept as given: a relative one is not resolved.
  ASSERT_TRUE(fm().createSymbolicLinkAtURL(fileURL(tmp / "rel"), fileURL("../x/y"), &err)) << err.description();
  EXPECT_EQ(fm().destinationOfSymbolicLinkAtURL(fileURL(tmp / "rel"), &err).path(), "../x/y");
  // Linux allows contents up to PATH_MAX - 1 bytes; all of it comes back.
  const std::string longContent(PATH_MAX - 1, 'a');
  sl::test::makeSymlink(longContent, tmp / "long");
  EXPECT_EQ(fm().destinationOfSymbolicLinkAtURL(fileURL(tmp / "long"), &err).path(), longContent);
  EXPECT_TRUE(err.isNull());

  EXPECT_FALSE(fm().createSymbolicLinkAtURL(fileURL(tmp / "file"), fileURL("/etc"), &err));
  expectPOSIXRecord(err, EEXIST, "Could not create symlink containing /etc at " + tmp / "file" + ": File exists",
                    kCreate);
  EXPECT_TRUE(fm().destinationOfSymbolicLinkAtURL(fileURL(tmp / "file"), &err).isNull());
  expectPOSIXRecord(err, EINVAL, "Could not readlink " + tmp / "file" + " : Invalid argument", kRead);
  EXPECT_EQ(log.installer(), Lines{});
}

TEST(SymlinksAndContainment, DepthWalk) {
  struct Case {
    const char* path;
    int32_t start, end;  // end -99: answers NO and leaves the slot alone
  } cases[] = {{"a/../..", 0, -99}, {"a/b/..", 0, 1}, {"/./a//./b", 3, 5}, {"/..", 2, -99}, {"", 4, 4}};
  for (const Case& c : cases) {
    SCOPED_TRACE(c.path);
    int32_t end = -99;
    EXPECT_EQ(Access::validateSymlink(sl::String(c.path), c.start, &end), c.end != -99);
    EXPECT_EQ(end, c.end);
  }
  EXPECT_FALSE(Access::validateSymlink(sl::String(), 0, nullptr));
}

TEST(SymlinksAndContainment, RealPathOfLongestExistingPrefix) {
  TempDir tmp;
  const std::string real = realPathOf(tmp.path());
  sl::test::makeDirs(tmp / "dir");
  sl::test::makeSymlink("dir", tmp / "link");
  sl::test::makeSymlink("nowhere", tmp / "dangling");
  LogCapture log;

  EXPECT_TRUE(Access::realPathWhatExistsInPath(sl::String("/")).isNull());
  // The existing prefix is resolved (through the link), the rest appended.
  EXPECT_EQ(Access::realPathWhatExistsInPath(sl::String(tmp / "link/missing/deeper")).path(),
            real + "/dir/missing/deeper");
  EXPECT_EQ(log.installer(), Lines{});  // the debug line needs a handle at 7

  sl::InstallerLogHandle debugHandle{sl::kLogLevelDebug};
  sl::InstallerLogHandle* const previousHandle = gLogHandle;
  gLogHandle = &debugHandle;
  const sl::URL viaLink = Access::realPathWhatExistsInPath(sl::String(tmp / "link/missing"));
  // A dangling prefix exists but does not resolve: the search goes on.
  const sl::URL viaDangling = Access::realPathWhatExistsInPath(sl::String(tmp / "dangling/x"));
  gLogHandle = previousHandle;

  EXPECT_EQ(viaLink.path(), real + "/dir/missing");
  EXPECT_EQ(viaDangling.path(), real + "/dangling/x");
  EXPECT_EQ(log.installer(),
            (Lines{
                line(7, kPrefix, "Realpathed " + real + "/dir ; appending non-existing components missing"),
                line(3, kRealPath,
                     "Failed to realpath " + tmp / "dangling" + " : No such file or directory at " + real + "/nowhere"),
                line(7, kPrefix, "Realpathed " + real + " ; appending non-existing components dangling/x"),
            }));
}

TEST(SymlinksAndContainment, ContainmentCheck) {
  TempDir tmp;
  const std::string t = realPathOf(tmp.path());
  const std::string base = t + "/var/base";
  sl::test::writeFile(base + "/a/file");
  sl::test::makeDirs(base + "/b");
  sl::test::makeSymlink("../b", base + "/a/inside");
  sl::test::makeSymlink("../../x", base + "/a/climbs");
  sl::test::makeSymlink(".", base + "/dot");
  sl::test::makeSymlink("..", base + "/dotdot");
  sl::test::makeSymlink(base + "/a/file", base + "/absolute");
  sl::test::makeSymlink("../..", base + "/up");  // a directory link above the base
  sl::test::writeFile(t + "/file");
  sl::test::writeFile(t + "/var/basement/x");

  struct Case {
    const char* name;
    std::string suspicious;
    std::string base;
    std::string result;  // empty: rejected
    Lines lines;
  } cases[] = {
      {"ordinary file", base + "/a/file", base, base + "/a/file", {}},
      {"the base itself", base, base, base, {}},
      {"missing trailing components", base + "/a/new/deeper", base, base + "/a/new/deeper", {}},
      {"relative link ../b", base + "/a/inside", base, base + "/b", {}},
      {"link to .", base + "/dot", base, base, {}},
      {"/private before the item", "/private" + base + "/a/file", base, base + "/a/file", {}},
      {"/private before the base", base + "/a/file", "/private" + base, base + "/a/file", {}},
      {"not below the base", t + "/var/other", base, "",
       {line(3, kCheck, "supiscious path " + t + "/var/other does not contain base path " + base + " as a prefix")}},
      {"'..' component", base + "/nothing/../a/file", base, "",
       {line(3, kCheck, "The suspicious path " + base + "/nothing/../a/file contains '..' paths, which are invalid")}},
      {"absolute link", base + "/absolute", base, "",
       {line(3, kCheck, "Rejecting " + base + "/absolute -> " + base + "/a/file, as absolute symlinks are not allowed")}},
      {"relative link ../../x", base + "/a/climbs", base, "",
       {line(3, kCheck, "Rejecting " + base + "/a/climbs -> /a/../../x, as it is points outside or to the base " + base)}},
      {"link to ..", base + "/dotdot", base, "",
       {line(3, kCheck, "Rejecting " + base + "/dotdot -> /.., as it is points outside or to the base " + base)}},
      {"prefix-sharing sibling", t + "/var/basement/x", base, "",
       {line(3, kCheck, "Rejecting " + t + "/var/basement/x with base " + base + " (reals " + t + "/var/basement/x ; " +
                            base + ") because components diverge at base != basement")}},
      {"directory link leading above the base", base + "/up/file", base, "",
       {line(3, kCheck, "Rejecting " + base + "/up/file with base " + base +
                            " because base component count is greater than child component count (reals " + t +
                            "/file ; " + base + ")")}},
      {"missing base", t + "/var/nobase/x", t + "/var/nobase", "",
       {line(3, kRealPath,
             "Failed to realpath " + t + "/var/nobase : No such file or directory at " + t + "/var/nobase"),
        line(3, kCheck, "Failed to retrieve realpath for base path " + t + "/var/nobase ")}},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture log;
    EXPECT_EQ(fm().realPathForURL(fileURL(c.suspicious), fileURL(c.base, true)).path(), c.result);
    EXPECT_EQ(log.installer(), c.lines);
  }

  LogCapture log;
  EXPECT_TRUE(fm().realPathForURL(nullptr, fileURL(base, true)).isNull());
  EXPECT_EQ(log.installer(), (Lines{line(3, kCheck, "The base path file://" + base +
                                                        "/ and/or suspicious path (null) were nil")}));
}

// Real paths that begin with /private need a /private at the root. A child
// process gets one without touching the real root: it chroots into a tree
// where var leads to private/var, as on the system the layout comes from.
// Under srv, a directory link leads into /private/srv, which the comparison
// takes for the same tree as /srv.
TEST(SymlinksAndContainment, PrivateComponentSkippedInRealPaths) {
  TempDir tmp;
  sl::test::writeFile(tmp / "private/var/base/a/file");
  sl::test::makeSymlink("private/var", tmp / "var");
  sl::test::writeFile(tmp / "private/srv/base/f");
  sl::test::makeSymlink("../../private", tmp / "srv/base/up");
  int fds[2];
  ASSERT_EQ(pipe(fds), 0);
  sl::UniqueFd readEnd(fds[0]), writeEnd(fds[1]);

  pid_t child = fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    std::string out;
    if (chroot(tmp.path().c_str()) != 0 || chdir("/") != 0) {
      out = std::string("chroot: ") + strerror(errno);
    } else {
      LogCapture log;
      const sl::URL base = fileURL("/var/base", true);
      out = fm().realPathForURL(fileURL("/private/var/base/a/file"), base).path() + " " +
            fm().realPathForURL(fileURL("/var/base/a/file"), base).path() + " " +
            fm().realPathForURL(fileURL("/srv/base/up/srv/base/f"), fileURL("/srv/base", true)).path() + " " +
            std::to_string(log.installer().size());
    }
    ssize_t written = write(writeEnd.get(), out.data(), out.size());
    _exit(written == static_cast<ssize_t>(out.size()) ? 0 : 1);  // no destructors in the child
  }
  writeEnd.reset();
  std::string out;
  char buffer[512];
  for (ssize_t n; (n = read(readEnd.get(), buffer, sizeof buffer)) > 0;) out.append(buffer, n);
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  if (out.starts_with("chroot: Operation not permitted")) GTEST_SKIP() << "chroot refused: " << out;
  EXPECT_EQ(out, "/private/var/base/a/file /private/var/base/a/file /private/srv/base/f 0");
}

}  // namespace
