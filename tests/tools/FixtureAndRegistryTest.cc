// stowline fixture and stowline registry, run as the real program on roots
// under /dev/shm.

#include <gtest/gtest.h>

#include <regex>
#include <string>
#include <vector>

#include "Platform/PropertyList.h"
#include "TestSupport/TestSupport.h"
#include "tools/ProgramRunner.h"

namespace {

using sl::test::ProgramResult;
using sl::test::stowline;
using sl::test::TempDir;

size_t countEnding(const std::map<std::string, std::string>& tree, const std::string& suffix) {
  size_t n = 0;
  for (const auto& [path, item] : tree) n += path.ends_with(suffix);
  return n;
}

std::string quoted(const std::string& text) {
  return std::regex_replace(text, std::regex(R"([.^$|()\[\]{}*+?\\])"), R"(\$&)");
}

TEST(FixtureTest, SameSeedGivesTheSameTreeAndOtherSeedsDiffer) {
  TempDir dir(TempDir::kShm);
  const std::string root = dir / "root";
  int run = 0;
  auto fixture = [&](const char* seed) {
    sl::test::makeDirs(root);
    const ProgramResult result = stowline({"fixture", "--root", root, "--apps", "12", "--vpn-only", "2", "--groups",
                                           "3", "--files-per-app", "5", "--bytes-per-file", "100", "--seed", seed});
    EXPECT_EQ(result.status, 0) << result.err;
    std::map<std::string, std::string> tree = sl::test::listTree(root);
    tree.erase(".");  // written at a different time by each run
    std::filesystem::rename(root, root + "." + std::to_string(run++));
    return tree;
  };
  // Paths inside the maps are absolute, so every run writes into the same path.
  const auto first = fixture("9");
  const auto again = fixture("9");
  const auto other = fixture("10");
  EXPECT_EQ(first, again);
  EXPECT_NE(first, other);

  EXPECT_EQ(countEnding(first, ".app"), 12u);
  EXPECT_EQ(countEnding(first, ".vpnplugin"), 2u);
  EXPECT_EQ(countEnding(first, "Icon.png"), 12u);
  EXPECT_EQ(countEnding(first, ".dat"), 12u * 5 + 3 + countEnding(first, "harbor.dat"));
  EXPECT_TRUE(first.contains("private/var/mobile/Applications/WhereDidMyApplicationsGo.txt"));

  // The maps name directories of the tree.
  const std::string kept = root + ".0";
  const auto relative = [&](const sl::Value& path) { return path.asString().str().substr(root.size() + 1); };
  const sl::Dictionary groups =
      sl::dictionaryWithContentsOfURL(
          sl::URL::fileURLWithPath(kept + "/private/var/mobile/Library/Caches/com.vantor.stowline.plist", false))
          .get("GroupContainers")
          .asDictionary();
  ASSERT_EQ(groups.count(), 3u);
  for (const auto& [group, record] : groups) {
    EXPECT_TRUE(first.at(relative(record.asDictionary().get("Container"))).starts_with("40755 ")) << group;
  }

  // Below a root whose name is not UTF-8, the maps naming its paths take the
  // binary form, and the layout is whole.
  const std::string odd = dir / "r\xff";
  sl::test::makeDirs(odd);
  const ProgramResult result = stowline({"fixture", "--root", odd, "--apps", "2", "--groups", "1"});
  EXPECT_EQ(result.status, 0) << result.err;
  for (const char* map : {"/private/var/mobile/Library/Caches/com.vantor.stowline.plist",
                          "/private/var/stowd/Library/Stowline/SafeHarbor.plist"}) {
    EXPECT_FALSE(sl::dictionaryWithContentsOfURL(sl::URL::fileURLWithPath(odd + map, false)).isNull()) << map;
  }
}

TEST(FixtureTest, RefusesWhatItMustNotWriteInto) {
  TempDir dir(TempDir::kShm);
  const std::string used = dir / "used";
  sl::test::writeFile(used + "/private/var/mobile/Applications/Keep", "mine");
  sl::test::writeFile(dir / "file", "");
  // Mistakes in the command line get a hint at --help; what must be fixed
  // outside it gets one line.
  struct Case {
    std::vector<std::string> args;
    std::string message;
    bool hint;
  };
  const Case cases[] = {
      {{"--root", dir / "missing", "--apps", "1"}, "root " + dir / "missing" + " does not exist", false},
      {{"--root", dir / "file", "--apps", "1"}, "root " + dir / "file" + " is not a directory", false},
      {{"--root", used, "--apps", "1"},
       "the old container root " + used + "/private/var/mobile/Applications is not empty", false},
      {{"--root", dir.path()}, "--apps N is required", true},
      {{"--root", dir.path(), "--apps", "-1"}, "--apps takes a whole number of 0 or more, not '-1'", true},
      {{"--apps", "1"}, "--root DIR is required", true},
      {{"--root", dir.path(), "--apps", "1", "--colour"}, "unknown option '--colour'", true},
      {{"--root", dir.path(), "--apps"}, "--apps needs a number", true},
  };
  for (const Case& c : cases) {
    std::vector<std::string> args = c.args;
    args.insert(args.begin(), "fixture");
    const ProgramResult result = stowline(args);
    SCOPED_TRACE(c.message);
    EXPECT_EQ(result.status, 2);
    EXPECT_EQ(result.err, "stowline fixture: " + c.message + "\n" + (c.hint ? "Try 'stowline fixture --help'.\n" : ""));
    EXPECT_EQ(result.out, "");
  }
  EXPECT_EQ(sl::test::readFile(used + "/private/var/mobile/Applications/Keep"), "mine");
  EXPECT_FALSE(sl::test::exists(used + "/private/var/stowd"));
  EXPECT_FALSE(sl::test::exists(dir / "private"));
}

// An application bundle directory with an identifier and a group.
void writeBundle(const std::string& path, const std::string& identifier) {
  sl::test::makeDirs(path);
  sl::Array groups = sl::Array::create();
  groups.append(sl::String("group.shared"));
  ASSERT_TRUE(sl::writePropertyListToURL(
      sl::Dictionary{{"PBBundleIdentifier", sl::String(identifier)}, {"PBApplicationGroups", groups}},
      sl::test::fileURL(path + "/Info.plist")));
}

TEST(RegistryCommandTest, ListsShowsAndInstalls) {
  TempDir dir(TempDir::kShm);
  const std::string root = dir / "root";
  sl::test::makeDirs(root);
  ProgramResult result = stowline({"registry", "--root", root, "list", "--json"});
  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_EQ(result.out, "[]\n");
  result = stowline({"registry", "--root", root, "harbors", "--json"});
  EXPECT_EQ(result.out, "[]\n");
  result = stowline({"registry", "--root", root, "show", "com.example.none"});
  EXPECT_EQ(result.status, 1);
  EXPECT_EQ(result.err, "stowline registry: no application with the identifier com.example.none\n");
  for (const std::vector<std::string>& args : {std::vector<std::string>{"registry", "--root", root},
                                               {"registry", "--root", root, "list", "extra"},
                                               {"registry", "--root", root, "show"},
                                               {"registry", "--root", root, "list", "--placeholder"}}) {
    EXPECT_EQ(stowline(args).status, 2) << args.back();
  }

  const std::string uuid = "[0-9A-F]{8}-[0-9A-F]{4}-4[0-9A-F]{3}-[89AB][0-9A-F]{3}-[0-9A-F]{12}";
  const std::string base = quoted(root) + "/private/var/";
  const std::string shared = base + "mobile/Containers/Shared/" + uuid;
  writeBundle(dir / "package/Payload/A.app", "com.example.a");
  writeBundle(dir / "P.app", "com.example.p");
  result = stowline({"registry", "--root", root, "install", dir / "package"});
  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_TRUE(std::regex_match(
      result.out,
      std::regex("Installing com\\.example\\.a from " + quoted(dir / "package") +
                 "\n  0% Validating\n(.*\n)*100% Complete\nInstalled com\\.example\\.a \\(User\\): bundle " + base +
                 "stowd/Containers/Bundle/" + uuid + "/A\\.app, data container " + base + "mobile/Containers/Data/" +
                 uuid + "\n")))
      << result.out;
  EXPECT_FALSE(sl::test::exists(dir / "package"));
  result = stowline({"registry", "--root", root, "install", dir / "P.app", "--placeholder"});
  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_FALSE(sl::test::exists(dir / "P.app"));

  auto application = [&](const std::string& identifier, const char* type, const char* bundle, const char* placeholder) {
    return "\\{\"bundleIdentifier\":\"" + quoted(identifier) + "\",\"bundleType\":\"" + type + "\",\"bundleURL\":\"" +
           base + "stowd/Containers/Bundle/" + uuid + "/" + bundle + "\",\"bundleContainerURL\":\"" + base +
           "stowd/Containers/Bundle/" + uuid + "\",\"dataContainerURL\":\"(" + base + "mobile/Containers/Data/" + uuid +
           ")\",\"groupContainerURLs\":\\{\"group.shared\":\"(" + shared +
           ")\"\\},\"installType\":1,\"isPlaceholder\":" + placeholder + "\\}";
  };
  result = stowline({"registry", "--root", root, "list", "--json"});
  EXPECT_EQ(result.status, 0) << result.err;
  std::smatch match;
  ASSERT_TRUE(std::regex_match(result.out, match,
                               std::regex("\\[" + application("com.example.a", "User", "A.app", "false") + "," +
                                          application("com.example.p", "Placeholder", "P.app", "true") + "\\]\n")))
      << result.out;
  EXPECT_TRUE(std::filesystem::is_directory(match.str(1) + "/Documents"));
  EXPECT_EQ(match.str(2), match.str(4));  // one container for the shared group
  EXPECT_NE(match.str(1), match.str(3));

  result = stowline({"registry", "--root", root, "show", "com.example.p", "--json"});
  EXPECT_EQ(result.status, 0) << result.err;
  EXPECT_TRUE(
      std::regex_match(result.out, std::regex(application("com.example.p", "Placeholder", "P.app", "true") + "\n")))
      << result.out;

  sl::test::makeDirs(dir / "empty/Payload");
  result = stowline({"registry", "--root", root, "install", dir / "empty"});
  EXPECT_EQ(result.status, 2);
  EXPECT_EQ(result.err, "stowline registry: " + dir / "empty" + "/Payload holds no application bundle\n");
}

// After a migration of a fixture root the registry names, for each
// application, the data container that now holds its documents, and the
// harbors of the fixture's map.
TEST(RegistryCommandTest, NamesTheDataContainersThatAMigrationFilled) {
  TempDir dir(TempDir::kShm);
  const std::string root = dir.path();
  ProgramResult result = stowline({"fixture", "--root", root, "--apps", "4", "--groups", "2", "--seed", "3"});
  ASSERT_EQ(result.status, 0) << result.err;
  std::map<std::string, std::string> documents;  // identifier -> content of Documents/file0.dat
  for (const auto& entry : std::filesystem::directory_iterator(root + "/private/var/mobile/Applications")) {
    for (int k = 1; k <= 4; ++k) {
      if (std::filesystem::exists(entry.path() / ("App" + std::to_string(k) + ".app"))) {
        documents["com.example.fixture.app" + std::to_string(k)] =
            sl::test::readFile(entry.path() / "Documents/file0.dat");
      }
    }
  }
  ASSERT_EQ(documents.size(), 4u);

  result = stowline({"migrate", "--root", root, "--no-progress"});
  ASSERT_EQ(result.status, 0) << result.err;
  result = stowline({"registry", "--root", root, "list", "--json"});
  ASSERT_EQ(result.status, 0) << result.err;
  for (const auto& [identifier, content] : documents) {
    std::smatch match;
    ASSERT_TRUE(std::regex_search(result.out, match,
                                  std::regex("\"bundleIdentifier\":\"" + quoted(identifier) +
                                             "\",\"bundleType\":\"User\",[^}]*\"dataContainerURL\":\"([^\"]+)\"")))
        << identifier << "\n"
        << result.out;
    EXPECT_EQ(sl::test::readFile(match.str(1) + "/Documents/file0.dat"), content) << identifier;
  }
  result = stowline({"registry", "--root", root, "harbors", "--json"});
  EXPECT_TRUE(std::regex_match(
      result.out, std::regex("\\[\\{\"identifier\":\"com\\.example\\.fixture\\.harbor1\",\"path\":\"" + quoted(root) +
                             "/private/var/stowd/Library/SafeHarbors/[0-9A-F-]{36}\",\"containerType\":2\\}"
                             "(,\\{\"identifier\":\"com\\.example\\.fixture\\.harbor2\",[^}]*\\})?\\]\n")))
      << result.out;
}

}  // namespace
