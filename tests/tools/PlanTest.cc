// stowline plan, run as a subprocess: it changes nothing, classifies every
// entry, and agrees with what migrate then does.
#include <dirent.h>
#include <gtest/gtest.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <sys/xattr.h>

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "../AppMigrator/MigratorTestSupport.h"
#include "ProgramRunner.h"

namespace {

using sl::test::exists;
using sl::test::fileURL;

std::string sha256(const std::string& bytes) {
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int size = 0;
  EVP_Digest(bytes.data(), bytes.size(), digest, &size, EVP_sha256(), nullptr);
  std::string hex;
  char two[3];
  for (unsigned int i = 0; i < size; ++i) hex += (std::snprintf(two, sizeof two, "%02x", digest[i]), two);
  return hex;
}

// Every item below `path`: type and mode, owner, size, change and
// modification times in nanoseconds, extended attributes with their values,
// the link target or the SHA-256 of the contents.
void snapshot(const std::string& path, std::map<std::string, std::string>& out) {
  struct stat st;
  ASSERT_EQ(::lstat(path.c_str(), &st), 0) << path;
  std::string line = std::to_string(st.st_mode) + " " + std::to_string(st.st_uid) + ":" + std::to_string(st.st_gid) +
                     " " + std::to_string(st.st_size) + " m" + std::to_string(st.st_mtim.tv_sec) + "." +
                     std::to_string(st.st_mtim.tv_nsec) + " c" + std::to_string(st.st_ctim.tv_sec) + "." +
                     std::to_string(st.st_ctim.tv_nsec);
  char names[4096];
  const ssize_t n = ::llistxattr(path.c_str(), names, sizeof names);
  for (ssize_t i = 0; i < n; i += static_cast<ssize_t>(std::strlen(names + i)) + 1) {
    char value[4096];
    const ssize_t size = ::lgetxattr(path.c_str(), names + i, value, sizeof value);
    line +=
        std::string(" x:") + (names + i) + "=" + std::string(value, static_cast<size_t>(std::max<ssize_t>(size, 0)));
  }
  if (S_ISREG(st.st_mode)) line += " " + sha256(sl::test::readFile(path));
  if (S_ISLNK(st.st_mode)) {
    char target[4096];
    const ssize_t size = ::readlink(path.c_str(), target, sizeof target);
    line += " -> " + std::string(target, static_cast<size_t>(std::max<ssize_t>(size, 0)));
  }
  out[path] = line;
  if (!S_ISDIR(st.st_mode)) return;
  std::unique_ptr<DIR, int (*)(DIR*)> dir(::opendir(path.c_str()), ::closedir);
  ASSERT_TRUE(dir) << path;
  while (const dirent* entry = ::readdir(dir.get())) {
    const std::string name = entry->d_name;
    if (name != "." && name != "..") snapshot(path + "/" + name, out);
  }
}

std::map<std::string, std::string> snapshotOf(const std::string& root) {
  std::map<std::string, std::string> out;
  snapshot(root, out);
  return out;
}

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
  ASSERT_TRUE(sl::writePropertyListToURL(sl::Dictionary{{"ContainerPath", sl::String(entry("Marked"))},
                                                        {"BundlePath", sl::String(entry("Marked/B.app"))},
                                                        {"ContainerType", sl::String("App")},
                                                        {"BundleIdentifier", sl::String("com.plan.m")}},
                                         fileURL(entry("Marked/com.vantor.stowline.container_migrator.plist"))));
  mgtest::makeBundle(mgtest::below("/tmp/placeholder/B.app"), "com.plan.m");
  sl::Error error;
  ASSERT_TRUE(registry_->installApplication(fileURL(mgtest::below("/tmp/placeholder/B.app"), true),
                                            sl::Dictionary{{RGInstallTypeKey, sl::Number(6u)},
                                                           {RGPackageTypeKey, sl::String(RGPackageTypePlaceholder)},
                                                           {RGSkipBlacklistOptionKey, sl::Boolean(true)},
                                                           {RGBundleIdentifierOptionKey, sl::String("com.plan.m")}},
                                            &error))
      << error.description();
  sl::test::writeFile(entry("stray.txt"), "x");
  sl::test::makeDirs(entry("Empty"));
  mgtest::makeBundle(mgtest::below("/Real.app"), "com.plan.l");
  sl::test::makeDirs(entry("Linked"));
  sl::test::makeSymlink(mgtest::below("/Real.app"), entry("Linked/L.app"));

  // The registry stays open: what it recorded is still in its write-ahead
  // log, which plan must read without touching it.
  const auto before = snapshotOf(root);
  const sl::test::ProgramResult text = sl::test::runProgram({SL_STOWLINE_PATH, "plan", "--root", root});
  const sl::test::ProgramResult json = sl::test::runProgram({SL_STOWLINE_PATH, "plan", "--root", root, "--json"});
  EXPECT_EQ(snapshotOf(root), before);
  ASSERT_EQ(text.status, 0) << text.err;
  ASSERT_EQ(json.status, 0) << json.err;
  EXPECT_NE(text.out.find("  identifier: com.plan.a\n  container type: App (migrated early)"), std::string::npos)
      << text.out;

  const std::pair<std::string, std::string> expected[] = {
      {"App", "recordBuilt"},  {"VPN", "recordBuilt"}, {"Marked", "markerFound"},
      {"stray.txt", "delete"}, {"Empty", "delete"},    {"Linked", "leaveInPlace"},
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
           "\"staysBecause\":\"the registry does not know it and only applications get a placeholder\""}) {
    EXPECT_NE(json.out.find(fact), std::string::npos) << fact << "\n" << json.out;
  }

  // Then migrate: the program when it is built, else the migrator in this
  // process. What plan expected to go is gone, what it expected to stay
  // stays.
  RGApplicationWorkspace::setDefaultWorkspace(nullptr);
  SLInstallerLibrary::setDefaultLibrary(nullptr);
  registry_.reset();
  const sl::test::ProgramResult migrate = sl::test::runProgram({SL_STOWLINE_PATH, "migrate", "--root", root});
  if (migrate.err.find("not built yet") != std::string::npos) {
    registry_ = EmbeddedRegistry::open(SLGlobalConfiguration::sharedInstance(), &error);
    ASSERT_TRUE(registry_) << error.description();
    RGApplicationWorkspace::setDefaultWorkspace(registry_);
    SLInstallerLibrary::setDefaultLibrary(registry_);
    std::unique_ptr<SLAppMigrator> migrator = SLAppMigrator::create();
    ASSERT_TRUE(migrator);
    EXPECT_FALSE(migrator->performMigration());
  } else {
    EXPECT_EQ(migrate.status, 1) << migrate.err;
  }
  for (const auto& [name, classification] : expected) {
    const std::string after = field(json.out, entry(name), "afterMigration");
    EXPECT_EQ(after, exists(entry(name)) ? "stays" : "gone") << name;
  }
  EXPECT_TRUE(exists(entry("VPN")));
  EXPECT_FALSE(exists(mgtest::below("/oldgroup")));
}

TEST(PlanUsageTest, ExitStatuses) {
  const std::pair<std::vector<std::string>, int> cases[] = {
      {{"--help"}, 0}, {{"--bogus"}, 2}, {{"--root"}, 2}, {{"--root", "/nonexistent/root"}, 2}, {{"--json", "x"}, 2}};
  for (const auto& [args, status] : cases) {
    std::vector<std::string> argv{SL_STOWLINE_PATH, "plan"};
    argv.insert(argv.end(), args.begin(), args.end());
    const sl::test::ProgramResult result = sl::test::runProgram(argv);
    EXPECT_EQ(result.status, status) << args.front();
    EXPECT_EQ(result.out.empty(), status != 0) << args.front();
  }
}

}  // namespace
