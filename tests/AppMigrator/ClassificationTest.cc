// The classification of old containers, answered from tables: what the
// migrator's tests on real trees cannot arrange (the listing order, and
// which entries get read at all).
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "AppMigrator/Classification.h"
#include "Platform/Log.h"

namespace {

using namespace sl::migrator;
const std::string kC = "/old/C";
const std::string kM = std::string(kMigrationMarkerName);

// An entry of the fake container: its identifier ("" for none) and, for
// the marker, whether it validates.
struct Entry {
  std::string name;
  std::string identifier;
  bool validMarker = false;
};

class TableProbe : public ContainerProbe {
 public:
  std::vector<Entry> entries;
  std::vector<std::string> asked;  // names whose identifier or marker was read

  std::optional<std::vector<sl::URL>> listContainer(const sl::URL& container, sl::Error*) override {
    std::vector<sl::URL> urls;
    for (const Entry& e : entries) urls.push_back(container.URLByAppendingPathComponent(e.name, false));
    return urls;
  }
  int lstatEntry(const sl::URL& url, bool* isLink) override {
    find(url);
    *isLink = false;
    return 0;
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

std::string u(const std::string& name) { return "file://" + kC + "/" + name; }

TEST(ClassificationTest, MarkerStopsTheExaminationAndLinesKeepTheirOrder) {
  // A valid marker ends the examination: the bundle after it is never read,
  // and the early flag follows the marker's type.
  TableProbe probe;
  probe.entries = {{"P.vpnplugin", "com.p"}, {kM, "", true}, {"A.app", "com.a"}};
  Decision d = classifyContainer(sl::URL::fileURLWithPath(kC, true), probe);
  EXPECT_EQ(d.kind, DecisionKind::MarkerFound);
  EXPECT_EQ(d.record.get(kContainerPathKey).description(), "/else");
  EXPECT_EQ(d.early, true);
  EXPECT_EQ(probe.asked, (std::vector<std::string>{"P.vpnplugin", kM}));

  // An invalid marker: the validation's own line comes between the
  // introspection's two, under its own function.
  probe.entries = {{kM, ""}, {"A.app", "com.a"}};
  d = classifyContainer(sl::URL::fileURLWithPath(kC, true), probe);
  EXPECT_EQ(d.kind, DecisionKind::LeaveInPlace);
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
