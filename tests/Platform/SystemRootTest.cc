#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <string>
#include <utility>

#include <gtest/gtest.h>

#include "Platform/SystemRoot.h"

namespace {

TEST(SystemRoot, NormalisationPathsBelowAndEnvironment) {
  char cwd[PATH_MAX];
  ASSERT_NE(getcwd(cwd, sizeof cwd), nullptr);
  const std::string here = std::string(cwd) == "/" ? "" : cwd;
  const std::string& first = sl::systemRoot();
  const std::string firstCopy = first;
  const std::pair<const char*, std::string> rows[] = {
      {"//", "/"}, {"/srv//./root//", "/srv/root"}, {"/srv/../root", "/srv/../root"}, {"rel/", here + "/rel"}};
  for (const auto& [given, root] : rows) {
    sl::setSystemRoot(given);
    EXPECT_EQ(sl::systemRoot(), root) << given;
  }
  EXPECT_EQ(first, firstCopy);  // references outlive a change of root

  sl::setSystemRoot("/");
  EXPECT_EQ(sl::pathBelowSystemRoot("/private/var/stowd/"), "/private/var/stowd/");
  sl::setSystemRoot("/srv/root/");
  EXPECT_EQ(sl::pathBelowSystemRoot("/private/var/stowd/"), "/srv/root/private/var/stowd/");
  EXPECT_EQ(sl::pathBelowSystemRoot("/"), "/srv/root/");
  EXPECT_EQ(sl::systemRootURL().absoluteString(), "file:///srv/root/");

  // "" hands the decision back to STOWLINE_ROOT, and then to "/".
  ASSERT_EQ(setenv("STOWLINE_ROOT", "/from/env/", 1), 0);
  sl::setSystemRoot("");
  EXPECT_EQ(sl::systemRoot(), "/from/env");
  ASSERT_EQ(unsetenv("STOWLINE_ROOT"), 0);
  sl::setSystemRoot("");
  EXPECT_EQ(sl::systemRoot(), "/");
}

}  // namespace
