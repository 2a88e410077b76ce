#include "Platform/Mutations.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>

#include <cstdlib>
#include <string>

#include "Platform/UniqueFd.h"
#include "TestSupport/TestSupport.h"

namespace sl {
namespace {

using test::exists;
using test::TempDir;

// The program run again with a plan in its environment (see below) makes,
// in SL_MUTATIONS_CHILD, a.file, directory a, b.file, directory b, c.file,
// directory c, and exits 0 if nothing stops it.
[[maybe_unused]] const bool kChildRole = [] {
  const char* dir = std::getenv("SL_MUTATIONS_CHILD");
  if (dir == nullptr) return false;
  for (const std::string name : {"a", "b", "c"}) {
    const std::string path = std::string(dir) + "/" + name;
    ::close(mut::open((path + ".file").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
    mut::mkdir(path.c_str(), 0755);
  }
  ::_exit(0);
}();

// Runs this program in the child role with `plan`; answers its wait status.
int runChild(const std::string& dir, const char* plan, const std::string& trace, const std::string& errors) {
  const pid_t child = ::fork();
  if (child == 0) {
    ::setenv("SL_MUTATIONS_CHILD", dir.c_str(), 1);
    ::setenv("STOWLINE_FAULT", plan, 1);
    ::setenv("STOWLINE_FAULT_TRACE", trace.c_str(), 1);
    if (!std::freopen(errors.c_str(), "w", stderr)) ::_exit(120);
    ::execl("/proc/self/exe", "MutationsTest", static_cast<char*>(nullptr));
    ::_exit(121);
  }
  int status = -1;
  EXPECT_EQ(::waitpid(child, &status, 0), child);
  return status;
}

TEST(MutationsTest, PlansParseOrChangeNothing) {
  if (!mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  for (const char* good : {"", "kill@1", "EIO@3+", "ENOSPC@2+:write,sync", "EXDEV@1:rename", "ELOOP@7:mkdir"}) {
    EXPECT_TRUE(mut::setPlanForTesting(good)) << good;
  }
  ASSERT_TRUE(mut::setPlanForTesting("EIO@1:mkdir"));
  for (const char* bad : {"kill", "kill@", "kill@0", "kill@x", "kill@-1", "kill@1-", "kill@1++", "kill@1:",
                          "kill@1:rename,", "kill@1:,rename", "kill@1::rename", "kill@1:bogus", "@1", "EFOO@1",
                          "eio@1", "EIO@1 ", "kill@99999999999999999999"}) {
    EXPECT_FALSE(mut::setPlanForTesting(bad)) << bad;
  }
  // The plan set before the refused ones still holds.
  TempDir dir;
  errno = 0;
  EXPECT_EQ(mut::mkdir((dir / "d").c_str(), 0755), -1);
  EXPECT_EQ(errno, EIO);
  EXPECT_FALSE(exists(dir / "d"));
  mut::setPlanForTesting("");
}

TEST(MutationsTest, ErrnoPlansFailWithoutActing) {
  if (!mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  TempDir dir;
  const std::string a = dir / "a", b = dir / "b", c = dir / "c";

  // No plan: the call's own errno.
  ASSERT_TRUE(mut::setPlanForTesting(""));
  ASSERT_EQ(mut::mkdir(dir.path().c_str(), 0755), -1);
  EXPECT_EQ(errno, EEXIST);

  // Once, every kind counted.
  ASSERT_TRUE(mut::setPlanForTesting("EIO@2"));
  ASSERT_EQ(mut::mkdir(a.c_str(), 0755), 0);
  EXPECT_EQ(mut::rename(a.c_str(), b.c_str()), -1);
  EXPECT_EQ(errno, EIO);
  EXPECT_TRUE(exists(a) && !exists(b));
  EXPECT_EQ(mut::rename(a.c_str(), b.c_str()), 0);
  EXPECT_EQ(mut::admittedCount(), 3u);

  // Onward.
  ASSERT_TRUE(mut::setPlanForTesting("ENOSPC@2+"));
  ASSERT_EQ(mut::rmdir(b.c_str()), 0);
  for (const std::string& path : {a, c}) {
    errno = 0;
    EXPECT_EQ(mut::open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644), -1) << path;
    EXPECT_EQ(errno, ENOSPC);
    EXPECT_FALSE(exists(path));
  }
  // An open that creates nothing is no operation: it goes ahead.
  EXPECT_TRUE(UniqueFd(mut::open(dir.path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)));
  EXPECT_EQ(mut::admittedCount(), 3u);

  // Only the plan's kinds counted.
  ASSERT_TRUE(mut::setPlanForTesting("EXDEV@2:rename"));
  ASSERT_EQ(mut::mkdir(a.c_str(), 0755), 0);
  ASSERT_EQ(mut::rename(a.c_str(), b.c_str()), 0);
  ASSERT_EQ(mut::mkdir(a.c_str(), 0755), 0);
  EXPECT_EQ(mut::rename(b.c_str(), c.c_str()), -1);
  EXPECT_EQ(errno, EXDEV);
  EXPECT_TRUE(exists(b) && !exists(c));
  EXPECT_EQ(mut::admittedCount(), 4u);
  mut::setPlanForTesting("");
}

TEST(MutationsTest, EnvironmentPlanKillsAtTheNthOperationAndTraces) {
  if (!mut::kFaultInjectionBuilt) GTEST_SKIP() << "a build without fault plans";
  TempDir dir;
  const std::string trace = dir / "trace", errors = dir / "errors";
  test::makeDirs(dir / "tree");
  const std::string tree = dir / "tree";

  const int status = runChild(tree, "kill@2:mkdir", trace, errors);
  ASSERT_TRUE(WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL) << "status " << status;
  EXPECT_TRUE(exists(tree + "/a.file") && exists(tree + "/a") && exists(tree + "/b.file"));
  EXPECT_FALSE(exists(tree + "/b") || exists(tree + "/c.file"));
  // Every operation is traced, the one killed at included.
  EXPECT_EQ(test::readFile(trace), "1 create " + tree + "/a.file\n2 mkdir " + tree + "/a\n3 create " + tree +
                                       "/b.file\n4 mkdir " + tree + "/b\n");

  // A plan that does not parse stops the program before it changes anything.
  const int refused = runChild(tree, "kill@2:mkdirs", dir / "trace2", errors);
  EXPECT_TRUE(WIFSIGNALED(refused) && WTERMSIG(refused) == SIGABRT) << "status " << refused;
  EXPECT_EQ(test::readFile(errors), "stowline: STOWLINE_FAULT=\"kill@2:mkdirs\" is not <action>@<n>[+][:<kinds>]\n");
  EXPECT_FALSE(exists(tree + "/c.file") || exists(dir / "trace2"));
}

}  // namespace
}  // namespace sl
