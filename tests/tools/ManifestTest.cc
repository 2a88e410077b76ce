// stowline manifest and stowline verify, run as the real program on fixture
// roots under /dev/shm.

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <string>
#include <vector>

#include "TestSupport/TestSupport.h"
#include "tools/ProgramRunner.h"

namespace {

using sl::test::ProgramResult;
using sl::test::stowline;
using sl::test::TempDir;

// The first directory below `parent`.
std::string firstChild(const std::string& parent) {
  for (const auto& entry : std::filesystem::directory_iterator(parent)) return entry.path();
  return {};
}

TEST(ManifestTest, ManifestChangesNothingAndVerifyFindsWhatMigrateLost) {
  TempDir dir(TempDir::kShm);
  const std::string root = dir / "root", manifest = dir / "manifest.json";
  sl::test::makeDirs(root);
  ASSERT_EQ(stowline({"fixture", "--root", root, "--apps", "3", "--groups", "2", "--seed", "5"}).status, 0);
  // A name that is not UTF-8 travels through the manifest as \xHH.
  const std::string oldContainers = root + "/private/var/mobile/Applications";
  std::string oldContainer;
  for (const auto& entry : std::filesystem::directory_iterator(oldContainers)) {
    if (entry.is_directory()) oldContainer = entry.path();
  }
  ASSERT_FALSE(oldContainer.empty());
  sl::test::writeFile(oldContainer + "/Documents/caf\xff", "bytes");
  ASSERT_EQ(::symlink("../Library", (oldContainer + "/Documents/link").c_str()), 0);

  const auto before = sl::test::listTree(root);
  ProgramResult result = stowline({"manifest", "--root", root, "--output", manifest});
  ASSERT_EQ(result.status, 0) << result.err;
  EXPECT_EQ(sl::test::listTree(root), before);
  const std::string json = sl::test::readFile(manifest);
  EXPECT_NE(json.find(R"("path":"Documents/caf\\xff","type":"file","size":5)"), std::string::npos) << json;
  EXPECT_NE(json.find(R"("path":"Documents/link","type":"link")"), std::string::npos);
  EXPECT_NE(json.find(R"("target":"../Library")"), std::string::npos);
  EXPECT_NE(json.find(R"("group.com.example.fixture.group2":[{"path":)"), std::string::npos);
  EXPECT_EQ(stowline({"manifest", "--root", root}).out, json);

  result = stowline({"migrate", "--root", root});
  ASSERT_EQ(result.status, 0) << result.err;
  result = stowline({"verify", "--root", root, manifest});
  EXPECT_EQ(result.status, 0) << result.out << result.err;
  EXPECT_NE(result.out.find(" 0 missing, 0 changed, 0 duplicated\n"), std::string::npos) << result.out;

  // One moved file changed, one deleted, one group file changed, and one
  // item standing in the old place as well.
  const std::string data = root + "/private/var/mobile/Containers/Data";
  std::vector<std::string> containers;
  for (const auto& entry : std::filesystem::directory_iterator(data)) containers.push_back(entry.path());
  ASSERT_EQ(containers.size(), 3u);
  sl::test::writeFile(containers[0] + "/Documents/file0.dat", "changed");
  ASSERT_EQ(::unlink((containers[1] + "/Library/file1.dat").c_str()), 0);
  ASSERT_EQ(::chmod((firstChild(root + "/private/var/mobile/Containers/Shared") + "/Shared.dat").c_str(), 0600), 0);
  sl::test::writeFile(oldContainer + "/tmp/file2.dat", "again");

  result = stowline({"verify", "--root", root, manifest});
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.out.find(": Documents/file0.dat: size 64 became 7, content changed"), std::string::npos)
      << result.out;
  EXPECT_NE(result.out.find("missing: application "), std::string::npos);
  EXPECT_NE(result.out.find(": Library/file1.dat: not in " + containers[1] + "\n"), std::string::npos);
  EXPECT_NE(result.out.find(": Shared.dat: mode 0644 became 0600\n"), std::string::npos);
  EXPECT_NE(result.out.find(": tmp/file2.dat: still in " + oldContainer + "\n"), std::string::npos);
  EXPECT_NE(result.out.find(" 1 missing, 2 changed, 1 duplicated\n"), std::string::npos) << result.out;
  result = stowline({"verify", "--json", "--root", root, manifest});
  EXPECT_EQ(result.status, 1);
  EXPECT_NE(result.out.find(R"({"kind":"missing","owner":"application )"), std::string::npos) << result.out;
}

TEST(ManifestTest, UsageErrorsAndMalformedManifests) {
  TempDir dir(TempDir::kShm);
  const std::string bad = dir / "bad.json";
  struct Case {
    std::vector<std::string> args;
    const char* manifest;  // written to bad.json first when not null
    std::string err;
  };
  const std::vector<Case> cases = {
      {{"manifest", "--output"}, nullptr, "stowline manifest: --output needs a file\n"},
      {{"manifest", "--bogus"}, nullptr, "stowline manifest: unknown option '--bogus'\n"},
      {{"verify"}, nullptr, "stowline verify: a manifest is needed\n"},
      {{"verify", bad, bad}, nullptr, "stowline verify: only one manifest can be given\n"},
      {{"verify", bad}, R"({"applications":{},"groups":{},})", "is not a manifest: malformed JSON at offset 31: expected a member name\n"},
      {{"verify", bad}, R"({"applications":{},"groups":{}} x)", "text after the value"},
      {{"verify", bad}, R"({"applications":[01]})", "bad number"},
      {{"verify", bad}, R"({"a":"\ud800"})", "unpaired surrogate"},
      {{"verify", bad}, R"({"applications":{}})", "\"applications\" or \"groups\" is missing"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.err);
    if (c.manifest) sl::test::writeFile(bad, c.manifest);
    const ProgramResult result = stowline(c.args);
    EXPECT_EQ(result.status, 2);
    EXPECT_NE(result.err.find(c.err), std::string::npos) << result.err;
  }
}

}  // namespace
