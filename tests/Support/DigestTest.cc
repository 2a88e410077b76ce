#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "Support/Digest.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::test::fileURL;
using Messages = std::vector<std::string>;

// What the sha256sum program says about path.
std::string sha256sum(const std::string& path) {
  std::unique_ptr<FILE, int (*)(FILE*)> pipe(popen(("sha256sum -- '" + path + "'").c_str(), "r"), pclose);
  char line[128] = {};
  if (!pipe || fgets(line, sizeof line, pipe.get()) == nullptr) return "no output";
  return std::string(line, 64);
}

std::string pattern(size_t size) {
  std::string bytes(size, '\0');
  for (size_t i = 0; i < size; ++i) bytes[i] = static_cast<char>((i * 2654435761u) >> 13);
  return bytes;
}

TEST(DigestTest, DigestsMatchSha256sumAndChunksAreBounded) {
  sl::test::TempDir dir(sl::test::TempDir::kShm);
  for (const std::vector<size_t>& expectedChunks :
       std::vector<std::vector<size_t>>{{}, {100}, {65536}, {65536, 1}, {65536, 65536, 65536, 3392}}) {
    size_t size = 0;
    for (size_t c : expectedChunks) size += c;
    SCOPED_TRACE(size);
    const std::string path = dir / std::to_string(size);
    sl::test::writeFile(path, pattern(size));
    sl::test::LogCapture log;
    EXPECT_EQ(SLCreateSHA256Digest(fileURL(path)).str(), sha256sum(path));
    std::vector<size_t> chunks;
    EXPECT_TRUE(_ReadFile(path.c_str(), [&](const uint8_t*, size_t length) {
      chunks.push_back(length);
      return true;
    }));
    EXPECT_EQ(chunks, expectedChunks);
    EXPECT_TRUE(log.installer().empty());
  }
}

TEST(DigestTest, FailuresAreLoggedAndYieldNull) {
  sl::test::TempDir dir(sl::test::TempDir::kShm);
  sl::test::LogCapture log;

  // The reader's line, then the digest's with the reader's errno.
  const std::string missing = dir / "missing";
  EXPECT_TRUE(SLCreateSHA256Digest(fileURL(missing)).isNull());
  EXPECT_EQ(log.installer(),
            (std::vector{
                sl::test::installerLine(3, "_ReadFile", "failed to open " + missing + " : No such file or directory"),
                sl::test::installerLine(
                    3, "SLCreateSHA256Digest",
                    "Failed to read " + fileURL(missing).absoluteString() + " : No such file or directory")}));
  log.clear();

  // A directory opens and has a size, but cannot be read.
  EXPECT_TRUE(SLCreateSHA256Digest(fileURL(dir.path(), true)).isNull());
  EXPECT_EQ(log.installerMessages(), (Messages{"read failed for " + dir.path() + " : Is a directory",
                                               "Failed to read " + fileURL(dir.path(), true).absoluteString() +
                                                   " : Is a directory"}));
  log.clear();

  // A file that shrinks while it is read ends before its size; a consumer
  // that stops the read fails it without a message.
  const std::string shrinking = dir / "shrinking";
  sl::test::writeFile(shrinking, pattern(65537));
  EXPECT_FALSE(
      _ReadFile(shrinking.c_str(), [&](const uint8_t*, size_t) { return truncate(shrinking.c_str(), 10) == 0; }));
  EXPECT_FALSE(_ReadFile(shrinking.c_str(), [](const uint8_t*, size_t) { return false; }));
  EXPECT_EQ(log.installerMessages(), Messages{"read failed for " + shrinking + ", got 0 bytes"});
}

}  // namespace
