// stowline plan, run as a subprocess: it changes nothing, classifies every
// entry, and agrees with what migrate then does.
#include <gtest/gtest.h>
#include <sys/xattr.h>

#include <string>
#include <vector>

#include "../AppMigrator/MigratorTestSupport.h"
#include "ProgramRunner.h"

namespace {

using sl::test::exists;

// The JSON member of the item for `path`: the writer puts "path" first and
// "classification" right after it.
bool hasItem(const std::string& json, const std::string& path, const std::string& classification) {
  return json.find("{\"path\":\"" + path + "\",\"classification\":\"" + classification + "\"") != std::string::npos;
}

// The string member `key` of the item for `path` (the first after it).
std::string field(const std::string& json, const std::string& path, const std::string& key) {
  const size_t item = json.find("{\"path\":\"" + path + "\"");
  const size_t at = item == std::string::npos ? item : json.find("\"" + key + "\":\"", item);
  if (at == std::string::npos) return "(absent)";
  const size_t begin = at + key.size() + 4;
  return json.substr(begin, json.find('"', begin) - begin);
}

class PlanTest : public mgtest::MigratorTest {};

TEST_F(PlanTest, ChangesNothingAndAgreesWithMigrate) {
  const std::string root = mgtest::root(), old = mgtest::below(mgtest::kOldRoot);
  auto entry = [&](const std::string& name) { return old + "/" + name; };
  // An application with data, a group and a leftover-free container.
  mgtest::makeBundle(entry("App/A.app"), "com.plan.a", "1.0", {"group.plan"});
  sl::test::writeFile(entry("App/Documents/doc.txt"), "document");
  sl::test::makeDirs(entry("App/Library"));
  ASSERT_EQ(::setxattr(entry("App/Documents/doc.txt").c_str(), "user.plan", "v", 1, 0), 0);
  sl::test::writeFile(mgtest::below("/oldgroup/shared.txt"), "shared");
  mgtest::writeInstallMap({{"group.plan", mgtest::below("/oldgroup")}});
  // A VPN plug-in alone, unknown to the registry: its migration fails.
  mgtest::makeBundle(entry("VPN/P.vpnplugin"), "com.plan.p");
  // A container that a previous run began: its marker is the record, and the
  // registry already holds the placeholder.
  mgtest::makeBundle(entry("Marked/B.app"), "com.plan.m");
  mgtest::writePlist(entry("Marked/com.vantor.stowline.container_migrator.plist"),
                     sl::Dictionary{{"ContainerPath", sl::String(entry("Marked"))},
                                    {"BundlePath", sl::String(entry("Marked/B.app"))},
                                    {"ContainerType", sl::String("App")},
                                    {"BundleIdentifier", sl::String("com.plan.m")}});
  mgtest::installInRegistry(*registry_, "com.plan.m", RGPackageTypePlaceholder);
  sl::test::writeFile(entry("stray.txt"), "x");
  sl::test::makeDirs(entry("Empty"));
  mgtest::makeBundle(mgtest::below("/Real.app"), "com.plan.l");
  sl::test::makeDirs(entry("Linked"));
  sl::test::makeSymlink(mgtest::below("/Real.app"), entry("Linked/L.app"));
  // Two containers claiming one identifier: both stay.
  mgtest::makeBundle(entry("Twin1/T.app"), "com.plan.t");
  mgtest::makeBundle(entry("Twin2/T.app"), "com.plan.t");

  // The registry stays open: what it recorded is still in its write-ahead
  // log, which plan must read without touching it.
  const auto before = sl::test::listTree(root, nullptr, true);
  const sl::test::ProgramResult text = sl::test::stowline({"plan", "--root", root});
  const sl::test::ProgramResult json = sl::test::stowline({"plan", "--root", root, "--json"});
  EXPECT_EQ(sl::test::listTree(root, nullptr, true), before);
  ASSERT_EQ(text.status, 0) << text.err;
  ASSERT_EQ(json.status, 0) << json.err;
  EXPECT_NE(text.out.find("  identifier: com.plan.a\n  container type: App (migrated early)"), std::string::npos)
      << text.out;

  const std::pair<std::string, std::string> expected[] = {
      {"App", "recordBuilt"},  {"VPN", "recordBuilt"}, {"Marked", "markerFound"},
      {"stray.txt", "delete"}, {"Empty", "delete"},    {"Linked", "leaveInPlace"},
      {"Twin1", "recordBuilt"}, {"Twin2", "recordBuilt"},
  };
  for (const auto& [name, classification] : expected)
    EXPECT_TRUE(hasItem(json.out, entry(name), classification)) << name;
  for (const std::string& fact : std::vector<std::string>{
           "\"identifier\":\"com.plan.m\",\"containerType\":\"App\",\"early\":true,\"registryKnows\":true,"
           "\"registryType\":\"Placeholder\"",
           "\"identifier\":\"com.plan.a\",\"containerType\":\"App\",\"early\":true,\"registryKnows\":false",
           "\"dataItems\":[\"" + entry("App/Documents") + "\",\"" + entry("App/Library") + "\"]",
           "\"groupContainers\":[{\"group\":\"group.plan\",\"path\":\"" + mgtest::below("/oldgroup") +
               "\",\"exists\":true}],\"leftovers\":[]",
           "\"staysBecause\":\"the registry does not know it and only applications get a placeholder\"",
           "\"staysBecause\":\"2 containers claim the identifier com.plan.t\""}) {
    EXPECT_NE(json.out.find(fact), std::string::npos) << fact << "\n" << json.out;
  }

  // Then migrate: what plan expected to go is gone, what it expected to
  // stay stays.
  RGApplicationWorkspace::setDefaultWorkspace(nullptr);
  SLInstallerLibrary::setDefaultLibrary(nullptr);
  registry_.reset();
  const sl::test::ProgramResult migrate = sl::test::stowline({"migrate", "--root", root});
  EXPECT_EQ(migrate.status, 1) << migrate.err;
  for (const auto& [name, classification] : expected) {
    const std::string after = field(json.out, entry(name), "afterMigration");
    EXPECT_EQ(after, exists(entry(name)) ? "stays" : "gone") << name;
  }
  EXPECT_TRUE(exists(entry("VPN")));
  EXPECT_TRUE(exists(entry("Twin1/T.app")) && exists(entry("Twin2/T.app")));
  EXPECT_FALSE(exists(mgtest::below("/oldgroup")));
}

TEST(PlanUsageTest, ExitStatuses) {
  const std::pair<std::vector<std::string>, int> cases[] = {
      {{"--help"}, 0}, {{"--bogus"}, 2}, {{"--root"}, 2}, {{"--root", "/nonexistent/root"}, 2}, {{"--json", "x"}, 2}};
  for (const auto& [args, status] : cases) {
    std::vector<std::string> argv{"plan"};
    argv.insert(argv.end(), args.begin(), args.end());
    const sl::test::ProgramResult result = sl::test::stowline(argv);
    EXPECT_EQ(result.status, status) << args.front();
    EXPECT_EQ(result.out.empty(), status != 0) << args.front();
  }
}

}  // namespace
