// stowline migrate, digest and config, run as a subprocess on roots built
// by hand, and the installed program.
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <regex>
#include <string>
#include <vector>

#include "Platform/PropertyList.h"
#include "TestSupport/Sentinel.h"
#include "TestSupport/TestSupport.h"
#include "tools/ProgramRunner.h"

namespace {

using sl::test::ProgramResult;
using sl::test::runProgram;
using sl::test::stowline;
using sl::test::TempDir;

const std::string kOldRoot = "/private/var/mobile/Applications";

void makeApp(const std::string& app, const char* identifier = "com.example.a") {
  sl::test::makeDirs(app);
  ASSERT_TRUE(sl::writePropertyListToURL(sl::Dictionary{{"PBBundleIdentifier", sl::String(identifier)},
                                                        {"PBBundleVersion", sl::String("1.0")},
                                                        {"PBBundleExecutable", sl::String("Exec")}},
                                         sl::test::fileURL(app + "/Info.plist")));
  sl::test::writeFile(app + "/Exec", "binary");
}

// An old container root with one application container, and the system
// version the migration records.
void makeOldLayout(const std::string& root) {
  makeApp(root + kOldRoot + "/C/A.app");
  sl::test::writeFile(root + kOldRoot + "/C/Documents/notes", "user data");
  sl::test::writeFile(root + "/etc/os-release", "NAME=Testix\nVERSION_ID=9.1\nBUILD_ID=21A42\n");
}

size_t lineCount(const std::string& text) { return static_cast<size_t>(std::count(text.begin(), text.end(), '\n')); }

bool hasLine(const std::string& text, const std::regex& pattern) {
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);)
    if (std::regex_match(line, pattern)) return true;
  return false;
}

TEST(MigrateTest, SummaryLogsAndExitStatus) {
  {
    SCOPED_TRACE("one application container: success, jsonl log");
    TempDir root(TempDir::kShm);
    makeOldLayout(root.path());
    const std::string log = root / "migrate.log";
    const ProgramResult r =
        stowline({"migrate", "--root", root.path(), "--json", "--log-file", log, "--log-format", "jsonl"});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_EQ(r.out.substr(0, r.out.find(",\"estimatedDuration\"")),
              "{\"result\":true,\"itemsToMigrate\":1,\"itemsMigrated\":1");
    EXPECT_NE(r.out.find(",\"estimatedDuration\":22.25,\"elapsedSeconds\":"), std::string::npos) << r.out;
    EXPECT_EQ(lineCount(r.out), 1u);
    // Only errors (the bundle has no icon) reach stderr, without the time.
    EXPECT_TRUE(std::regex_match(r.err, std::regex("(error Movanta [^\n]+\n)*"))) << r.err;
    EXPECT_TRUE(hasLine(sl::test::readFile(log),
                        std::regex(R"(\{"time":"[-0-9T:.]+Z","level":5,"category":"Movanta",)"
                                   R"("function":"-\[SLAppMigrator init\]","file":"[^"]+","line":[0-9]+,)"
                                   R"("message":"SLAppMigrator: 1 items to migrate"\})")));
    EXPECT_FALSE(sl::test::exists(root.path() + kOldRoot));
    EXPECT_EQ((r.out + r.err).find("\x1b["), std::string::npos) << "no colour escapes";
  }
  {
    SCOPED_TRACE("a link in the old container root: failure, text log, errors on stderr too");
    TempDir root(TempDir::kShm);
    makeOldLayout(root.path());
    // Its name holds a line break: the text log keeps one line per record.
    sl::test::makeSymlink("/nonexistent", root.path() + kOldRoot + "/link\nforged: line");
    const std::string log = root / "migrate.log";
    const ProgramResult r = stowline({"migrate", "--root", root.path(), "--json", "--log-file", log});
    EXPECT_EQ(r.status, 1) << r.err;
    EXPECT_EQ(r.out.substr(0, r.out.find(",\"estimatedDuration\"")),
              "{\"result\":false,\"itemsToMigrate\":1,\"itemsMigrated\":1");
    const std::string text = sl::test::readFile(log);
    EXPECT_TRUE(hasLine(text, std::regex(R"(\S+Z notice Movanta -\[SLAppMigrator init\]: )"
                                         R"(SLAppMigrator: 1 items to migrate)")));
    EXPECT_TRUE(hasLine(text, std::regex(R"(.* Ignoring symlink at .*/link\\nforged: line)"))) << text;
    EXPECT_FALSE(hasLine(text, std::regex("forged: line"))) << text;
    EXPECT_TRUE(hasLine(text, std::regex(R"(\S+Z error Movanta -\[SLAppMigrator performMigration\]: )"
                                         R"(SLAppMigrator: Not removing .* because 1 items remain unmigrated\.)")));
    EXPECT_TRUE(hasLine(r.err, std::regex(R"(error Movanta -\[SLAppMigrator performMigration\]: )"
                                          R"(SLAppMigrator: Not removing .*)")));
    EXPECT_EQ(r.err.find("notice"), std::string::npos);
    EXPECT_EQ((r.out + r.err).find("\x1b["), std::string::npos) << "no colour escapes";
  }
  {
    SCOPED_TRACE("nothing to migrate, human summary, --log-level error keeps notices out of stderr");
    TempDir root(TempDir::kShm);
    const ProgramResult r = stowline({"migrate", "--root", root.path(), "--log-level", "error", "--no-progress"});
    EXPECT_EQ(r.status, 0) << r.err;
    EXPECT_NE(r.out.find("0 items to migrate"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("Migrated 0 of 0 items in "), std::string::npos) << r.out;
    EXPECT_EQ(r.err.find("notice"), std::string::npos) << r.err;
  }
}

TEST(MigrateTest, UsageErrorsChangeNothing) {
  TempDir root(TempDir::kShm);
  makeOldLayout(root.path());
  const auto before = sl::test::listTree(root.path());
  struct Case {
    std::vector<std::string> args;
    std::string message;  // in the first line of standard error
    bool oneLine;         // no hint at --help follows
  };
  const std::string file = root.path() + kOldRoot + "/C/A.app/Exec";
  const std::vector<Case> cases = {
      {{"--bogus"}, "unknown option '--bogus'", false},
      {{"--root"}, "--root needs a directory", false},
      {{"--log-format", "xml"}, "unknown log format 'xml'", false},
      {{"--log-level", ""}, "--log-level needs error, notice or debug", false},
      {{"now"}, "unexpected argument 'now'", false},
      {{"--root", root / "missing"}, "does not exist", false},
      {{"--root", file}, "is not a directory", false},
      {{"--plugin", root / "missing.so"}, "cannot load the plug-in: ", true},
      {{"--plugin", SL_NOT_A_PLUGIN_PATH}, "not a migration plug-in: ", true},
      {{"--log-file", root / "missing/dir/log"}, "cannot open log file ", true},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.message);
    std::vector<std::string> args{"migrate"};
    if (c.args.front() != "--root") args.insert(args.end(), {"--root", root.path()});
    args.insert(args.end(), c.args.begin(), c.args.end());
    const ProgramResult r = stowline(args);
    EXPECT_EQ(r.status, 2);
    EXPECT_EQ(r.out, "");
    EXPECT_TRUE(r.err.starts_with("stowline migrate: ")) << r.err;
    EXPECT_NE(r.err.substr(0, r.err.find('\n')).find(c.message), std::string::npos) << r.err;
    EXPECT_TRUE(!c.oneLine || lineCount(r.err) == 1u) << r.err;
    EXPECT_EQ(sl::test::listTree(root.path()), before);
  }

  // The root may come from STOWLINE_ROOT: one that is not there is refused
  // by every command that reads the layout, and nothing is made below it.
  for (const char* command : {"migrate", "plan", "config", "registry"}) {
    SCOPED_TRACE(command);
    std::vector<std::string> args{SL_STOWLINE_PATH, command};
    if (std::string(command) == "registry") args.push_back("list");
    const ProgramResult r = sl::test::runProgram(args, {"STOWLINE_ROOT=" + (root / "missing")});
    EXPECT_EQ(r.status, 2);
    EXPECT_EQ(r.err, "stowline " + std::string(command) + ": root " + (root / "missing") + " does not exist\n");
    EXPECT_FALSE(sl::test::exists(root / "missing"));
  }
  // A registry that cannot be opened is the user's to fix: status 2.
  TempDir other(TempDir::kShm);
  sl::test::writeFile(other.path() + "/private/var/stowd/Library/Registry", "not a directory");
  const ProgramResult r = stowline({"registry", "--root", other.path(), "list"});
  EXPECT_EQ(r.status, 2);
  EXPECT_TRUE(r.err.starts_with("stowline registry: cannot open the registry: ")) << r.err;
}

TEST(MigrateTest, DigestAndConfig) {
  TempDir dir(TempDir::kShm);
  sl::test::writeFile(dir / "a", "alpha");
  sl::test::writeFile(dir / "b", std::string(70000, 'b'));  // more than one chunk
  const ProgramResult expected = runProgram({"/usr/bin/sha256sum", dir / "a", dir / "b"});
  ASSERT_EQ(expected.status, 0);
  const ProgramResult r = stowline({"digest", dir / "a", dir / "missing", dir / "b"});
  EXPECT_EQ(r.status, 1);
  EXPECT_EQ(r.out, expected.out);
  EXPECT_EQ(r.err, "stowline digest: failed to open " + (dir / "missing") + " : No such file or directory\n");

  const std::string data = dir.path() + "/private/var/stowd/Library/Stowline";
  const ProgramResult text = stowline({"config", "--root", dir.path()});
  const ProgramResult json = stowline({"config", "--root", dir.path(), "--json"});
  EXPECT_EQ(text.status, 0) << text.err;
  EXPECT_TRUE(hasLine(text.out, std::regex("  dataDirectory +" + data))) << text.out;
  EXPECT_NE(json.out.find("\"dataDirectory\":\"" + data + "\""), std::string::npos) << json.out;
}

// Writes a migration marker into the old container C below `root` with the
// paths it names ("" for no second bundle).
void writeMarker(const std::string& root, const std::string& container, const std::string& bundle,
                 const std::string& second = "") {
  sl::Dictionary marker{{"ContainerPath", sl::String(container)},
                        {"BundlePath", sl::String(bundle)},
                        {"ContainerType", sl::String("App")},
                        {"BundleIdentifier", sl::String("com.example.a")}};
  if (!second.empty()) marker.set("SecondBundlePath", sl::String(second));
  ASSERT_TRUE(sl::writePropertyListToURL(
      marker, sl::test::fileURL(root + kOldRoot + "/C/com.vantor.stowline.container_migrator.plist")));
}

// A marker whose paths lead outside the old layout stops migrate before
// anything changes; plan shows it; markers naming another container of the
// root stay allowed.
TEST(MigrateTest, ForgedMarkersAreRefusedBeforeAnythingChanges) {
  sl::test::Sentinel sentinel;
  // "$S" stands for the sentinel, "$O" for the old container root; the root
  // also holds D/B.app and a link L to the sentinel.
  const struct {
    const char *container, *bundle, *second;
    std::string key;  // of the finding; "" when migrate runs
  } cases[] = {
      {"$S", "$S/nested", "", "ContainerPath"},
      {"$O/L", "$O/L/nested", "", "ContainerPath"},
      {"$O/C", "$O/C/A.app", "$S/nested", "SecondBundlePath"},
      {"$O/D", "$O/D/B.app", "", ""},
  };
  for (const auto& [container, bundle, second, key] : cases) {
    SCOPED_TRACE(std::string(container) + " " + key);
    TempDir root(TempDir::kShm);
    makeOldLayout(root.path());
    const std::string old = root.path() + kOldRoot;
    makeApp(old + "/D/B.app", "com.example.d");
    sl::test::makeSymlink(sentinel.path(), old + "/L");
    const auto resolve = [&](std::string path) {
      if (path.starts_with("$")) path.replace(0, 2, path[1] == 'S' ? sentinel.path() : old);
      return path;
    };
    writeMarker(root.path(), resolve(container), resolve(bundle), resolve(second));
    const auto before = sl::test::listTree(root.path());

    const ProgramResult r = stowline({"migrate", "--root", root.path(), "--no-progress"});
    EXPECT_THAT(sentinel.changes(), ::testing::IsEmpty());
    if (key.empty()) {
      EXPECT_EQ(r.status, 1) << r.err;  // C, whose marker named D, stays, and so does L
      EXPECT_EQ(r.err.find("stowline migrate: "), std::string::npos) << r.err;
      EXPECT_FALSE(sl::test::exists(old + "/D"));
      continue;
    }
    const std::string marker = old + "/C/com.vantor.stowline.container_migrator.plist";
    const std::string path = resolve(key == "ContainerPath" ? container : second);
    const std::string within = key == "ContainerPath" ? old : old + "/C";
    const std::string finding = "migration marker " + marker + " names \"" + key + "\" " + path + ", which is not " +
                                (key == "ContainerPath" ? "a directory directly inside the old container root "
                                                        : "directly inside its container ") +
                                within;
    EXPECT_EQ(r.status, 2);
    EXPECT_EQ(r.out, "");
    EXPECT_EQ(r.err, "stowline migrate: " + finding +
                         "; nothing was changed (--trust-markers uses markers as they stand)\n");
    EXPECT_EQ(sl::test::listTree(root.path()), before);

    const ProgramResult text = stowline({"plan", "--root", root.path()});
    EXPECT_NE(text.out.find("\n  warning: " + finding + ": migrate refuses to run without --trust-markers\n"),
              std::string::npos)
        << text.out;
    const ProgramResult json = stowline({"plan", "--root", root.path(), "--json"});
    EXPECT_NE(json.out.find("\"untrustedMarker\":{\"marker\":\"" + marker + "\",\"key\":\"" + key +
                            "\",\"path\":\"" + path + "\",\"within\":\"" + within + "\"}"),
              std::string::npos)
        << json.out;
  }
}

// With --trust-markers the marker is used as it stands: the directory it
// names outside the root is emptied into the new layout and removed.
TEST(MigrateTest, TrustedMarkerIsUsedAsItStands) {
  TempDir root(TempDir::kShm);
  TempDir scratch(TempDir::kShm);
  makeOldLayout(root.path());
  makeApp(scratch / "A.app");
  sl::test::writeFile(scratch / "Documents/outside.txt", "outside");
  writeMarker(root.path(), scratch.path(), scratch / "A.app");
  const ProgramResult r = stowline({"migrate", "--root", root.path(), "--no-progress", "--trust-markers"});
  EXPECT_EQ(r.status, 1) << r.err;  // C itself stays: its marker named another directory
  EXPECT_FALSE(sl::test::exists(scratch.path()));
  const auto tree = sl::test::listTree(root.path());
  EXPECT_TRUE(std::any_of(tree.begin(), tree.end(), [](const auto& item) {
    return item.first.ends_with("/Documents/outside.txt") && item.second.ends_with(" outside");
  }));
}

// The installed program runs from its own directories and loads the plug-in
// installed beside it.
TEST(MigrateTest, InstalledProgramFindsItsPlugIn) {
  TempDir prefix(TempDir::kShm);
  const ProgramResult install =
      runProgram({SL_CMAKE_COMMAND, "--install", SL_BINARY_DIR, "--prefix", prefix.path()});
  ASSERT_EQ(install.status, 0) << install.out << install.err;
  const std::string lib = prefix / SL_INSTALL_LIBDIR;
  for (const std::string& path :
       {prefix / "bin/stowline", lib + "/libsl_platform.so", lib + "/libsl_host.so",
        lib + "/stowline/libstowline-appmigrator.so", prefix / "include/stowline/Platform/Value.h",
        prefix / "include/stowline/AppMigrator/AppMigrator.h", prefix / "share/man/man1/stowline.1"})
    EXPECT_TRUE(sl::test::exists(path)) << path;

  const ProgramResult version = runProgram({prefix / "bin/stowline", "--version"});
  EXPECT_EQ(version.status, 0) << version.err;
  EXPECT_TRUE(version.out.starts_with("stowline ")) << version.out;

  TempDir root(TempDir::kShm);
  makeOldLayout(root.path());
  const ProgramResult r = runProgram({prefix / "bin/stowline", "migrate", "--root", root.path()});
  EXPECT_EQ(r.status, 0) << r.err;
  EXPECT_NE(r.out.find("Plug-in: " + prefix.path() + "/bin/../" SL_INSTALL_LIBDIR "/stowline/libstowline-appmigrator.so\n"),
            std::string::npos)
      << r.out;
}

}  // namespace
