#include "Platform/Bundle.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "Platform/PropertyList.h"
#include "TestSupport/TestSupport.h"

namespace sl {
namespace {

using test::fileURL;

TEST(Bundle, InfoDictionaryFilteredReadAndCreation) {
  test::TempDir tmp;
  // ---- Both encodings; the info dictionary carries the file's URL, is kept
  // by the object, and a new object reads the file as it now is ----
  for (PropertyListFormat format : {PropertyListFormat::XML, PropertyListFormat::Binary}) {
    const std::string path = tmp / (format == PropertyListFormat::XML ? "X.app" : "B.app");
    SCOPED_TRACE(path);
    test::makeDirs(path);
    ASSERT_TRUE(writePropertyListToURL(Dictionary{{"PBBundleIdentifier", String("com.example.x")}, {"C", Number(3)}},
                                       fileURL(path + "/Info.plist"), format));
    std::shared_ptr<Bundle> bundle = Bundle::createUnique(fileURL(path, true));
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->identifier(), "com.example.x");
    const Dictionary expected{{"PBBundleIdentifier", String("com.example.x")},
                              {"C", Number(3)},
                              {kBundleInfoPlistURLKey, fileURL(path + "/Info.plist")}};
    EXPECT_EQ(bundle->infoDictionary(), expected);
    // Only the listed keys, and nothing added.
    EXPECT_EQ(bundle->createFilteredInfoPlist(Array{String("C"), String("Missing"), Number(1)}, 1),
              (Dictionary{{"C", Number(3)}}));

    test::forceRemove(path + "/Info.plist");
    EXPECT_EQ(bundle->infoDictionary(), expected);
    EXPECT_TRUE(bundle->createFilteredInfoPlist(Array{String("C")}, 1).isNull());
    std::shared_ptr<Bundle> fresh = Bundle::createUnique(fileURL(path, true));
    ASSERT_TRUE(fresh);
    EXPECT_TRUE(fresh->infoDictionary().isNull());
  }

  // ---- Creation: a directory, through links; nothing else ----
  test::makeSymlink(tmp / "X.app", tmp / "Link.app");
  test::writeFile(tmp / "File.app");
  EXPECT_TRUE(Bundle::createUnique(fileURL(tmp / "Link.app", true)));
  EXPECT_FALSE(Bundle::createUnique(fileURL(tmp / "Missing.app", true)));
  EXPECT_FALSE(Bundle::createUnique(fileURL(tmp / "File.app")));
}

}  // namespace
}  // namespace sl
