#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "Support/Digest.h"
#include "TestSupport/TestSupport.h"

namespace {

using sl::test::LogCapture;
using sl::test::TempDir;
using Line = LogCapture::Line;

// What the sha256sum program says about path.
std::string sha256sum(const std::string& path) {
  struct Pclose {
    void operator()(FILE* f) const { pclose(f); }
  };
  std::unique_ptr<FILE, Pclose> pipe(popen(("sha256sum -- '" + path + "'").c_str(), "r"));
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
  TempDir dir(TempDir::kShm);
  const std::vector<std::vector<size_t>> chunkings = {{}, {100}, {65536}, {65536, 1}, {65536, 65536, 65536, 3392}};
  for (const auto& expectedChunks : chunkings) {
    size_t size = 0;
    for (size_t c : expectedChunks) size += c;
    SCOPED_TRACE(size);
    std::string path = dir / std::to_string(size);
    sl::test::writeFile(path, pattern(size));

    LogCapture log;
    std::string digest = SLCreateSHA256Digest(sl::URL::fileURLWithPath(path, false)).str();
    EXPECT_EQ(digest, sha256sum(path));
    EXPECT_EQ(digest.find_first_not_of("0123456789abcdef"), std::string::npos);
    EXPECT_TRUE(size > 0 || digest == "e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855");

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
  TempDir dir(TempDir::kShm);
  LogCapture log;

  // The reader's line, then the digest's with the reader's errno.
  std::string missing = dir / "missing";
  sl::URL url = sl::URL::fileURLWithPath(missing, false);
  EXPECT_TRUE(SLCreateSHA256Digest(url).isNull());
  EXPECT_EQ(
      log.installer(),
      (std::vector<Line>{{3, "installer", "_ReadFile", "failed to open " + missing + " : No such file or directory"},
                         {3, "installer", "SLCreateSHA256Digest",
                          "Failed to read " + url.absoluteString() + " : No such file or directory"}}));
  log.clear();

  // A directory opens and has a size, but cannot be read.
  url = sl::URL::fileURLWithPath(dir.path(), true);
  EXPECT_TRUE(SLCreateSHA256Digest(url).isNull());
  EXPECT_EQ(log.installerMessages(),
            (std::vector<std::string>{"read failed for " + dir.path() + " : Is a directory",
                                      "Failed to read " + url.absoluteString() + " : Is a directory"}));
  log.clear();

  // A file that shrinks while it is read ends before its size.
  std::string shrinking = dir / "shrinking";
  sl::test::writeFile(shrinking, pattern(65537));
  EXPECT_FALSE(
      _ReadFile(shrinking.c_str(), [&](const uint8_t*, size_t) { return truncate(shrinking.c_str(), 10) == 0; }));
  EXPECT_EQ(log.installerMessages(), (std::vector<std::string>{"read failed for " + shrinking + ", got 0 bytes"}));
  log.clear();

  // A consumer that stops the read fails it without a message.
  EXPECT_FALSE(_ReadFile(shrinking.c_str(), [](const uint8_t*, size_t) { return false; }));
  EXPECT_TRUE(log.installer().empty());
}

}  // namespace
