#include "Platform/SystemVersion.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cstdlib>
#include <optional>
#include <string>

#include "Platform/SystemRoot.h"
#include "Platform/TemporaryDirectory.h"
#include "TestSupport/TestSupport.h"

namespace sl {
namespace {

// The system root of the scope, back to undecided ("") at its end.
struct ScopedRoot {
  explicit ScopedRoot(const std::string& path) { setSystemRoot(path); }
  ~ScopedRoot() { setSystemRoot(""); }
};

// TMPDIR as the scope sets it (nothing: unset), restored at its end.
class ScopedTmpdir {
 public:
  explicit ScopedTmpdir(const char* value) {
    if (const char* old = ::getenv("TMPDIR")) old_ = old;
    value ? ::setenv("TMPDIR", value, 1) : ::unsetenv("TMPDIR");
  }
  ~ScopedTmpdir() { old_ ? ::setenv("TMPDIR", old_->c_str(), 1) : ::unsetenv("TMPDIR"); }

 private:
  std::optional<std::string> old_;
};

TEST(SystemVersion, ReadsOsRelease) {
  test::TempDir tmp;
  ScopedRoot root(tmp.path());
  struct Case {
    const char* name;
    const char* text;
    Dictionary expected;
  };
  const Case cases[] = {
      {"quotes, escapes, comments, BUILD_ID",
       "# a comment\n"
       "\n"
       "  NAME=\"Stow \\\"Line\\\" \\$1 \\n\"\n"
       "VERSION_ID='2.0 \"x\"'\n"
       "BUILD_ID=20A123   \n"
       "NOT A KEY=1\n"
       "PRETTY_NAME=\"never closed\n",
       Dictionary{{kSystemProductNameKey, String("Stow \"Line\" $1 \\n")},
                  {kSystemProductVersionKey, String("2.0 \"x\"")},
                  {kSystemBuildVersionKey, String("20A123")}}},
      {"no BUILD_ID: the version stands in; a later line wins",
       "VERSION_ID=1\nVERSION_ID=\"12.1\"\nBUILD_ID=\n",
       Dictionary{{kSystemProductVersionKey, String("12.1")}, {kSystemBuildVersionKey, String("12.1")}}},
      {"none of the keys", "ID=debian\n", Dictionary::create()},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.name);
    test::writeFile(tmp / "etc/os-release", c.text);
    EXPECT_EQ(copySystemVersionDictionary(), c.expected);
  }

  // ---- Missing or unreadable: null ----
  test::forceRemove(tmp / "etc/os-release");
  EXPECT_TRUE(copySystemVersionDictionary().isNull());
  test::makeDirs(tmp / "etc/os-release");
  EXPECT_TRUE(copySystemVersionDictionary().isNull());
}

TEST(TemporaryDirectory, TmpdirElseRootTmp) {
  test::TempDir tmp;
  ScopedRoot root(tmp / "root");
  test::makeDirs(tmp / "root");
  test::makeDirs(tmp / "scratch");
  {
    ScopedTmpdir env((tmp / "scratch").c_str());
    EXPECT_EQ(perProcessTemporaryDirectory(), URL::fileURLWithPath(tmp / "scratch", true));
    EXPECT_FALSE(test::exists(tmp / "root/tmp"));
  }
  // ---- Unset, or naming no directory: ROOT/tmp, made shared and sticky ----
  for (const char* value : {static_cast<const char*>(nullptr), "relative"}) {
    SCOPED_TRACE(value ? value : "unset");
    ScopedTmpdir env(value);
    const URL url = perProcessTemporaryDirectory();
    EXPECT_EQ(url, URL::fileURLWithPath(tmp / "root/tmp", true));
    struct stat st;
    ASSERT_EQ(::stat((tmp / "root/tmp").c_str(), &st), 0);
    EXPECT_TRUE(S_ISDIR(st.st_mode));
    EXPECT_EQ(st.st_mode & 07777, 01777u);
  }
}

}  // namespace
}  // namespace sl
