#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

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
using namespace sl::test;
using Lines = std::vector<LogCapture::Line>;

constexpr char kRealPath[] = "-[SLFileManager _realPathForURL:allowNonExistentPathComponents:]";
constexpr char kPrefix[] = "-[SLFileManager _realPathWhatExistsInPath:]";
constexpr char kCheck[] = "-[SLFileManager realPathForURL:ifChildOfURL:]";

SLFileManager& fm() { return SLFileManager::defaultManager(); }
// A path as realpath gives it, so expected real paths are plain strings.
std::string realPathOf(const std::string& path) {
  char buffer[PATH_MAX];
  return realpath(path.c_str(), buffer) ? buffer : "";
}

TEST(SymlinksAndContainment, CreateAndReadLinks) {
  TempDir tmp;
  writeFile(tmp / "file");
  LogCapture log;
  sl::Error err;

  // The content is kept as given: a relative one is not resolved.
  ASSERT_TRUE(fm().createSymbolicLinkAtURL(fileURL(tmp / "rel"), fileURL("../x/y"), &err)) << err.description();
  EXPECT_EQ(fm().destinationOfSymbolicLinkAtURL(fileURL(tmp / "rel"), &err).path(), "../x/y");
  // Linux allows contents up to PATH_MAX - 1 bytes; all of it comes back.
  const std::string longContent(PATH_MAX - 1, 'a');
  makeSymlink(longContent, tmp / "long");
  EXPECT_EQ(fm().destinationOfSymbolicLinkAtURL(fileURL(tmp / "long"), &err).path(), longContent);
  EXPECT_TRUE(err.isNull());

  EXPECT_FALSE(fm().createSymbolicLinkAtURL(fileURL(tmp / "file"), fileURL("/etc"), &err));
  expectPOSIXRecord(err, EEXIST, "Could not create symlink containing /etc at " + tmp / "file" + ": File exists",
                    "-[SLFileManager createSymbolicLinkAtURL:withDestinationURL:error:]");
  EXPECT_TRUE(fm().destinationOfSymbolicLinkAtURL(fileURL(tmp / "file"), &err).isNull());
  expectPOSIXRecord(err, EINVAL, "Could not readlink " + tmp / "file" + " : Invalid argument",
                    "-[SLFileManager destinationOfSymbolicLinkAtURL:error:]");
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
  makeDirs(tmp / "dir");
  makeSymlink("dir", tmp / "link");
  makeSymlink("nowhere", tmp / "dangling");
  LogCapture log;
  sl::InstallerLogHandle debugHandle{sl::kLogLevelDebug}, *const previousHandle = gLogHandle;
  gLogHandle = &debugHandle;  // for the debug lines
  const bool rootIsNull = Access::realPathWhatExistsInPath(sl::String("/")).isNull();
  // The existing prefix is resolved (through the link), the rest appended.
  const sl::URL viaLink = Access::realPathWhatExistsInPath(sl::String(tmp / "link/missing/deeper"));
  // A dangling prefix exists but does not resolve: the search goes on.
  const sl::URL viaDangling = Access::realPathWhatExistsInPath(sl::String(tmp / "dangling/x"));
  gLogHandle = previousHandle;

  EXPECT_TRUE(rootIsNull);
  EXPECT_EQ(viaLink.path(), real + "/dir/missing/deeper");
  EXPECT_EQ(viaDangling.path(), real + "/dangling/x");
  EXPECT_EQ(
      log.installer(),
      (Lines{
          installerLine(7, kPrefix, "Realpathed " + real + "/dir ; appending non-existing components missing/deeper"),
          installerLine(
              3, kRealPath,
              "Failed to realpath " + tmp / "dangling" + " : No such file or directory at " + real + "/nowhere"),
          installerLine(7, kPrefix, "Realpathed " + real + " ; appending non-existing components dangling/x")}));
}

TEST(SymlinksAndContainment, ContainmentCheck) {
  TempDir tmp;
  const std::string t = realPathOf(tmp.path());
  const std::string base = t + "/var/base";
  writeFile(base + "/a/file");
  makeDirs(base + "/b");
  makeSymlink("../b", base + "/a/inside");
  makeSymlink("../../x", base + "/a/climbs");
  makeSymlink(".", base + "/dot");
  makeSymlink("..", base + "/dotdot");
  makeSymlink(base + "/a/file", base + "/absolute");
  makeSymlink("../..", base + "/up");  // a directory link above the base
  writeFile(t + "/file");
  writeFile(t + "/var/basement/x");

  struct Case {
    const char* name;
    std::string suspicious, base, result;  // result empty: rejected
    std::string rejection;                 // the one line a rejection logs
  } cases[] = {
      {"the base itself", base, base, base, ""},
      {"missing trailing components", base + "/a/new/deeper", base, base + "/a/new/deeper", ""},
      {"relative link ../b", base + "/a/inside", base, base + "/b", ""},
      {"link to .", base + "/dot", base, base, ""},
      {"/private before the item", "/private" + base + "/a/file", base, base + "/a/file", ""},
      {"/private before the base", base + "/a/file", "/private" + base, base + "/a/file", ""},
      {"not below the base", t + "/var/other", base, "",
       "supiscious path " + t + "/var/other does not contain base path " + base + " as a prefix"},
      {"'..' component", base + "/nothing/../a/file", base, "",
       "The suspicious path " + base + "/nothing/../a/file contains '..' paths, which are invalid"},
      {"absolute link", base + "/absolute", base, "",
       "Rejecting " + base + "/absolute -> " + base + "/a/file, as absolute symlinks are not allowed"},
      {"relative link ../../x", base + "/a/climbs", base, "",
       "Rejecting " + base + "/a/climbs -> /a/../../x, as it is points outside or to the base " + base},
      {"link to ..", base + "/dotdot", base, "",
       "Rejecting " + base + "/dotdot -> /.., as it is points outside or to the base " + base},
      {"prefix-sharing sibling", t + "/var/basement/x", base, "",
       "Rejecting " + t + "/var/basement/x with base " + base + " (reals " + t + "/var/basement/x ; " + base +
           ") because components diverge at base != basement"},
      {"directory link leading above the base", base + "/up/file", base, "",
       "Rejecting " + base + "/up/file with base " + base +
           " because base component count is greater than child component count (reals " + t + "/file ; " + base + ")"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    LogCapture log;
    EXPECT_EQ(fm().realPathForURL(fileURL(c.suspicious), fileURL(c.base, true)).path(), c.result);
    EXPECT_EQ(log.installer(), c.rejection.empty() ? Lines{} : Lines{installerLine(3, kCheck, c.rejection)});
  }

  LogCapture log;
  EXPECT_TRUE(fm().realPathForURL(fileURL(t + "/var/nobase/x"), fileURL(t + "/var/nobase", true)).isNull());
  EXPECT_TRUE(fm().realPathForURL(nullptr, fileURL(base, true)).isNull());
  EXPECT_EQ(
      log.installer(),
      (Lines{
          installerLine(3, kRealPath,
                        "Failed to realpath " + t + "/var/nobase : No such file or directory at " + t + "/var/nobase"),
          installerLine(3, kCheck, "Failed to retrieve realpath for base path " + t + "/var/nobase "),
          installerLine(3, kCheck, "The base path file://" + base + "/ and/or suspicious path (null) were nil")}));
}

// Real paths that begin with /private need a /private at the root. A child
// process gets one without touching the real root: it chroots into a tree
// where var leads to private/var, as on the system the layout comes from.
// Under srv, a directory link leads into /private/srv, which the comparison
// takes for the same tree as /srv.
TEST(SymlinksAndContainment, PrivateComponentSkippedInRealPaths) {
  TempDir tmp;
  writeFile(tmp / "private/var/base/a/file");
  makeSymlink("private/var", tmp / "var");
  writeFile(tmp / "private/srv/base/f");
  makeSymlink("../../private", tmp / "srv/base/up");
  // The child's report, through a descriptor that works inside the chroot too.
  sl::UniqueFd report(open((tmp / "report").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
  ASSERT_TRUE(report);
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
    ssize_t written = write(report.get(), out.data(), out.size());
    _exit(written == static_cast<ssize_t>(out.size()) ? 0 : 1);  // no destructors in the child
  }
  int status = 0;
  ASSERT_EQ(waitpid(child, &status, 0), child);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  const std::string out = readFile(tmp / "report");
  if (out.starts_with("chroot: Operation not permitted")) GTEST_SKIP() << "chroot refused: " << out;
  EXPECT_EQ(out, "/private/var/base/a/file /private/var/base/a/file /private/srv/base/f 0");
}

}  // namespace
