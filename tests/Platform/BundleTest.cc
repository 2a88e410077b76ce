#include "Platform/Bundle.h"

#include <gtest/gtest.h>

#include <string>

#include "Platform/PropertyList.h"
#include "TestSupport/TestSupport.h"

namespace sl {
namespace {

URL dirURL(const std::string& path) { return URL::fileURLWithPath(path, true); }

void writeInfoPlist(const std::string& bundle, const Value& top, PropertyListFormat format = PropertyListFormat::XML) {
  test::makeDirs(bundle);
  ASSERT_TRUE(writePropertyListToURL(top, URL::fileURLWithPath(bundle + "/Info.plist", false), format));
}

TEST(Bundle, InfoDictionaryFilteredReadAndCreation) {
  test::TempDir tmp;
  // ---- Both encodings; the info dictionary carries the file's URL, is kept
  // by the object, and a new object reads the file as it now is ----
  for (PropertyListFormat format : {PropertyListFormat::XML, PropertyListFormat::Binary}) {
    const std::string path = tmp / (format == PropertyListFormat::XML ? "X.app" : "B.app");
    SCOPED_TRACE(path);
    writeInfoPlist(path, Dictionary{{"PBBundleIdentifier", String("com.example.x")}, {"C", Number(3)}}, format);
    std::shared_ptr<Bundle> bundle = Bundle::createUnique(dirURL(path));
    ASSERT_TRUE(bundle);
    EXPECT_EQ(bundle->identifier(), "com.example.x");
    const Dictionary expected{{"PBBundleIdentifier", String("com.example.x")},
                              {"C", Number(3)},
                              {kBundleInfoPlistURLKey, URL::fileURLWithPath(path + "/Info.plist", false)}};
    EXPECT_EQ(bundle->infoDictionary(), expected);
    // Only the listed keys, and nothing added.
    EXPECT_EQ(bundle->createFilteredInfoPlist(Array{String("C"), String("Missing"), Number(1)}, 1),
              (Dictionary{{"C", Number(3)}}));

    test::forceRemove(path + "/Info.plist");
    EXPECT_EQ(bundle->infoDictionary(), expected);
    EXPECT_TRUE(bundle->createFilteredInfoPlist(Array{String("C")}, 1).isNull());
    std::shared_ptr<Bundle> fresh = Bundle::createUnique(dirURL(path));
    ASSERT_TRUE(fresh);
    EXPECT_NE(fresh.get(), bundle.get());
    EXPECT_TRUE(fresh->infoDictionary().isNull());
  }

  // ---- A top level that is not a dictionary comes back as it is ----
  writeInfoPlist(tmp / "Array.app", Array{String("C")});
  EXPECT_EQ(Bundle::createUnique(dirURL(tmp / "Array.app"))->createFilteredInfoPlist(Array{String("C")}, 1),
            (Array{String("C")}));

  // ---- Creation: a directory, through links; nothing else ----
  test::makeSymlink(tmp / "Array.app", tmp / "Link.app");
  test::writeFile(tmp / "File.app");
  EXPECT_TRUE(Bundle::createUnique(dirURL(tmp / "Link.app")));
  EXPECT_FALSE(Bundle::createUnique(dirURL(tmp / "Missing.app")));
  EXPECT_FALSE(Bundle::createUnique(URL::fileURLWithPath(tmp / "File.app", false)));
}

}  // namespace
}  // namespace sl
