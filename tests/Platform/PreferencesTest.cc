#include <sys/stat.h>

#include <cerrno>
#include <string>

#include <gtest/gtest.h>

#include "Platform/Preferences.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "TestSupport/TestSupport.h"

namespace {

constexpr char kDomain[] = "com.example.prefs";

TEST(Preferences, PendingChangesSynchroniseAtomicallyOrStayPending) {
  sl::test::TempDir root;
  sl::setSystemRoot(root.path());
  sl::preferencesResetForTesting();
  const std::string dir = root / "private/var/mobile/Library/Preferences";
  const sl::URL file = sl::preferencesFileURL(kDomain);
  EXPECT_EQ(file.path(), dir + "/com.example.prefs.plist");
  EXPECT_TRUE(sl::preferencesCopyValue("Flag", kDomain).isNull());  // no file yet

  // Another writer's file: a stored false is not an absent key.
  sl::test::makeDirs(dir);
  ASSERT_TRUE(
      sl::writePropertyListToURL(sl::Dictionary{{"Flag", sl::Boolean(false)}, {"Gone", sl::String("x")}}, file));
  EXPECT_EQ(sl::preferencesCopyValue("Flag", kDomain), sl::Boolean(false));

  // Pending changes win before they reach the file, and merge over it.
  sl::preferencesSetValue("Count", sl::Number(8), kDomain);
  sl::preferencesSetValue("Gone", nullptr, kDomain);
  EXPECT_EQ(sl::preferencesCopyValue("Count", kDomain), sl::Number(8));
  EXPECT_TRUE(sl::preferencesCopyValue("Gone", kDomain).isNull());
  EXPECT_EQ(sl::dictionaryWithContentsOfURL(file).count(), 2u);
  ASSERT_TRUE(sl::preferencesSynchronize(kDomain));
  EXPECT_EQ(sl::dictionaryWithContentsOfURL(file),
            (sl::Dictionary{{"Flag", sl::Boolean(false)}, {"Count", sl::Number(8)}}));

  // A file where the directory belongs: the change stays pending.
  sl::test::forceRemove(dir);
  sl::test::writeFile(dir, "in the way");
  sl::preferencesSetValue("Flag", sl::Boolean(true), kDomain);
  sl::Error error;
  EXPECT_FALSE(sl::preferencesSynchronize(kDomain, &error));
  sl::test::expectPOSIXRecord(error, ENOTDIR, "mkpath_np of " + dir + " failed: Not a directory", nullptr);
  EXPECT_EQ(sl::preferencesCopyValue("Flag", kDomain), sl::Boolean(true));

  // The next synchronise makes the directory (0755) and writes the change.
  sl::test::forceRemove(dir);
  ASSERT_TRUE(sl::preferencesSynchronize(kDomain));
  struct stat st{};
  EXPECT_TRUE(stat(dir.c_str(), &st) == 0 && (st.st_mode & 07777) == 0755) << std::oct << st.st_mode;
  EXPECT_EQ(sl::dictionaryWithContentsOfURL(file), (sl::Dictionary{{"Flag", sl::Boolean(true)}}));
}

}  // namespace
