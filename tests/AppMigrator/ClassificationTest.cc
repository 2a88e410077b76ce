// The classification of old containers, answered from tables: no file
// system, no migrator.
#include <gtest/gtest.h>

#include <cerrno>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "AppMigrator/Classification.h"
#include "Platform/Log.h"

namespace {

using namespace sl::migrator;
const std::string kC = "/old/C";
const std::string kM = std::string(kMigrationMarkerName);

// An entry of the fake container: its lstat answer and, for bundles, its
// identifier ("" for none); for the marker, whether it validates.
struct Entry {
  Entry(std::string n, int e = 0, bool l = false, std::string id = "", bool valid = false)  // NOLINT
      : name(std::move(n)), statErrno(e), link(l), identifier(std::move(id)), validMarker(valid) {}
  std::string name;
  int statErrno;
  bool link;
  std::string identifier;
  bool validMarker;
};

class TableProbe : public ContainerProbe {
 public:
  int listErrno = 0;
  std::vector<Entry> entries;
  std::vector<std::string> asked;  // names whose identifier or marker was read

  std::optional<std::vector<sl::URL>> listContainer(const sl::URL& container, sl::Error* error) override {
    if (listErrno) {
      *error = sl::Error::posix(listErrno);
      return std::nullopt;
    }
    std::vector<sl::URL> urls;
    for (const Entry& e : entries) urls.push_back(container.URLByAppendingPathComponent(e.name, false));
    return urls;
  }
  int lstatEntry(const sl::URL& url, bool* isLink) override {
    const Entry& e = find(url);
    *isLink = e.link;
    return e.statErrno;
  }
  sl::String bundleIdentifier(const sl::URL& url) override {
    const Entry& e = find(url);
    asked.push_back(e.name);
    return e.identifier.empty() ? sl::String() : sl::String(e.identifier);
  }
  MarkerValidation validateMarker(const sl::URL& url) override {
    asked.push_back(find(url).name);
    if (find(url).validMarker) {
      return {sl::Dictionary{{kContainerPathKey, sl::String("/else")}, {kContainerTypeKey, sl::String("App")}}, {}};
    }
    return {nullptr, {{sl::kLogLevelError, kValidateMarkerFunctionName, "invalid"}}};
  }

 private:
  const Entry& find(const sl::URL& url) {
    for (const Entry& e : entries)
      if (e.name == url.lastPathComponent()) return e;
    ADD_FAILURE() << "unexpected " << url.path();
    return entries.front();
  }
};

std::string u(const std::string& name) { return "file://" + kC + (name.empty() ? "/" : "/" + name); }

TEST(ClassificationTest, DecisionTable) {
  struct Row {
    const char* title;
    int listErrno;
    std::vector<Entry> entries;
    DecisionKind kind;
    std::string reason;
  };
  const Row rows[] = {
      {"not a directory", ENOTDIR, {}, DecisionKind::Delete, "Found regular file at " + u("") + " ; removing"},
      {"vanished",
       ENOENT,
       {},
       DecisionKind::Vanished,
       "Got ENOENT when introspecting " + u("") + " ; ignoring (likely raced with stowd)"},
      {"listing failed", EACCES, {}, DecisionKind::LeaveInPlace, "Failed to get URLs in container " + u("") + " : "},
      {"empty", 0, {}, DecisionKind::Delete, "No app or vpn bundle found in container " + u("") + " ; removing it"},
      {"data only, bundle without identifier",
       0,
       {{"Documents"}, {"A.app"}},
       DecisionKind::Delete,
       "No app or vpn bundle found in container " + u("") + " ; removing it"},
      {"entry cannot be stat'ed",
       0,
       {{"A.app", 0, false, "com.a"}, {".x", EACCES}},
       DecisionKind::LeaveInPlace,
       "Failed to stat path " + kC + "/.x : Permission denied"},
      {"app link",
       0,
       {{"A.app", 0, true}},
       DecisionKind::LeaveInPlace,
       "Skipping container with app symlink at " + u("A.app")},
      {"plug-in link",
       0,
       {{"P.vpnplugin", 0, true}},
       DecisionKind::LeaveInPlace,
       "VPN plugin was symlink; skipping container " + u("P.vpnplugin")},
      {"marker link",
       0,
       {{kM, 0, true}},
       DecisionKind::LeaveInPlace,
       "Migration marker was symlink; skipping container " + u(kM)},
      {"invalid marker, bundle",
       0,
       {{kM}, {"A.app", 0, false, "com.a"}},
       DecisionKind::LeaveInPlace,
       "Failed to load migration marker file from " + u(kM)},
      {"invalid marker alone",
       0,
       {{kM}},
       DecisionKind::Delete,
       "No app or vpn bundle found in container " + u("") + " ; removing it"},
      {"plug-in only",
       0,
       {{"P.vpnplugin", 0, false, "com.p"}},
       DecisionKind::RecordBuilt,
       "Found vpn plugin " + u("P.vpnplugin")},
      {"plug-in then app",
       0,
       {{"P.vpnplugin", 0, false, "com.p"}, {"A.app", 0, false, "com.a"}},
       DecisionKind::RecordBuilt,
       "Found app " + u("A.app")},
      {"valid marker first",
       0,
       {{"Q.vpnplugin", 0, false, "com.q"}, {kM, 0, false, "", true}, {"A.app"}},
       DecisionKind::MarkerFound,
       "Found migration marker " + u(kM)},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE(row.title);
    TableProbe probe;
    probe.listErrno = row.listErrno;
    probe.entries = row.entries;
    const Decision d = classifyContainer(sl::URL::fileURLWithPath(kC, true), probe);
    EXPECT_EQ(d.kind, row.kind);
    EXPECT_TRUE(d.reason.text.starts_with("SLAppMigrator: " + row.reason)) << d.reason.text;
    EXPECT_EQ(d.record.isNull(), row.kind != DecisionKind::RecordBuilt && row.kind != DecisionKind::MarkerFound);
    ASSERT_FALSE(d.messages.empty());
    EXPECT_EQ(d.messages.front().function, std::string(kIntrospectFunctionName));
  }
}

TEST(ClassificationTest, RecordsFlagsAndMessages) {
  // Application and plug-in: the application is principal, the plug-in second.
  TableProbe probe;
  probe.entries = {{"P.vpnplugin", 0, false, "com.p"}, {"Documents"}, {"A.app", 0, false, "com.a"}};
  Decision d = classifyContainer(sl::URL::fileURLWithPath(kC, true), probe);
  EXPECT_EQ(d.record.description(), (sl::Dictionary{{kContainerPathKey, sl::String(kC)},
                                                    {kBundlePathKey, sl::String(kC + "/A.app")},
                                                    {kContainerTypeKey, sl::String("App")},
                                                    {kBundleIdentifierKey, sl::String("com.a")},
                                                    {kSecondBundlePathKey, sl::String(kC + "/P.vpnplugin")}})
                                        .description());
  EXPECT_EQ(d.early, true);

  // A valid marker ends the examination: the bundle after it is never read,
  // and the early flag follows the marker's type.
  probe.asked.clear();
  probe.entries = {{"P.vpnplugin", 0, false, "com.p"}, {kM, 0, false, "", true}, {"A.app", 0, false, "com.a"}};
  d = classifyContainer(sl::URL::fileURLWithPath(kC, true), probe);
  EXPECT_EQ(d.record.get(kContainerPathKey).description(), "/else");
  EXPECT_EQ(d.early, true);
  EXPECT_EQ(probe.asked, (std::vector<std::string>{"P.vpnplugin", kM}));

  // An invalid marker: the validation's own line comes between the
  // introspection's two, under its own function.
  probe.entries = {{kM}, {"A.app", 0, false, "com.a"}};
  d = classifyContainer(sl::URL::fileURLWithPath(kC, true), probe);
  const int E = sl::kLogLevelError, N = sl::kLogLevelNotice;
  EXPECT_EQ(d.messages,
            (std::vector<Message>{
                {N, kIntrospectFunctionName, "SLAppMigrator: Found migration marker " + u(kM)},
                {E, kValidateMarkerFunctionName, "invalid"},
                {E, kIntrospectFunctionName, "SLAppMigrator: Failed to load migration marker file from " + u(kM)},
                {N, kIntrospectFunctionName, "SLAppMigrator: Found app " + u("A.app")},
            }));
}

}  // namespace
