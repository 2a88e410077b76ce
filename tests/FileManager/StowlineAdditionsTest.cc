#include "FileManager/StowlineAdditions.h"

#include <gtest/gtest.h>

namespace {

TEST(StowlineAdditions, ContainsDotDotPathComponents) {
  const std::pair<const char*, bool> kCases[] = {
      {"a/../b", true}, {"..", true}, {"/a/b/..", true}, {"a/..b", false}, {"a/.../b", false}, {"a../b", false},
  };
  for (const auto& [path, expected] : kCases) {
    SCOPED_TRACE(path);
    EXPECT_EQ(StowlineAdditions::containsDotDotPathComponents(sl::String(path)), expected);
  }
}

TEST(StowlineAdditions, FileSystemRepresentationKeepsBytes) {
  EXPECT_EQ(StowlineAdditions::stringWithFileSystemRepresentation("caf\xe9\xff").str(), "caf\xe9\xff");
  EXPECT_EQ(StowlineAdditions::stringWithFileSystemRepresentation("abcdef", 3).str(), "abc");  // length, not NUL
}

}  // namespace
