#include "FileManager/StowlineAdditions.h"

#include <gtest/gtest.h>

namespace {

TEST(StowlineAdditions, ContainsDotDotPathComponents) {
  const struct {
    const char* path;
    bool expected;
  } kCases[] = {
      {"a/../b", true}, {"..", true},      {"/a/b/..", true},  {"../a", true},
      {"a/..b", false}, {"a/.../b", false}, {"a../b", false}, {"/a/./b", false}, {"", false},
  };
  for (const auto& c : kCases) {
    SCOPED_TRACE(c.path);
    EXPECT_EQ(StowlineAdditions::containsDotDotPathComponents(sl::String(c.path)), c.expected);
  }
}

TEST(StowlineAdditions, FileSystemRepresentationKeepsBytes) {
  // Not UTF-8: kept byte for byte, not replaced.
  const char kName[] = "caf\xe9\xff";
  EXPECT_EQ(StowlineAdditions::stringWithFileSystemRepresentation(kName).str(), std::string(kName));
  // The length is what counts, not a terminator.
  EXPECT_EQ(StowlineAdditions::stringWithFileSystemRepresentation("abcdef", 3).str(), "abc");
  EXPECT_TRUE(StowlineAdditions::stringWithFileSystemRepresentation(nullptr).isNull());
}

}  // namespace
