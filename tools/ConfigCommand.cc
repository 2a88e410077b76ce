// stowline config [--root DIR] [--json]: the settings, the persisted flags,
// every path and the item-name lists of the configuration, as the system
// sees them below the root.
//
// Every path is asked of SLGlobalConfiguration: the accessors that create
// their directory on each request (data, caches, staging, log and carrier
// bundles directories) create it here too, as any first use would.

#include <cstdio>
#include <algorithm>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Configuration/SLGlobalConfiguration.h"
#include "Platform/SystemRoot.h"
#include "tools/CommandLine.h"
#include "tools/Commands.h"
#include "tools/Json.h"

namespace stowline {

namespace {

constexpr char kHelp[] =
    "usage: stowline config [--root DIR] [--json]\n"
    "\n"
    "Prints the settings, the persisted flags, every path and the item-name lists\n"
    "of the configuration below the root.\n"
    "\n"
    "  --root DIR   the system root (default: $STOWLINE_ROOT, else /)\n"
    "  --json       print one JSON object\n";

// One entry of the listing: a name and its value as JSON and as text.
struct Entry {
  std::string name;
  std::string json;
  std::string text;
};

Entry boolean(std::string name, bool value) {
  return {std::move(name), value ? "true" : "false", value ? "true" : "false"};
}
Entry integer(std::string name, int64_t value) {
  return {std::move(name), std::to_string(value), std::to_string(value)};
}
Entry string(std::string name, const sl::String& value) {
  if (value.isNull()) return {std::move(name), "null", "(none)"};
  return {std::move(name), jsonString(value.str()), value.str()};
}
Entry path(std::string name, const sl::URL& url) {
  return {std::move(name), jsonString(url.path()), url.path()};
}
template <class Range, class Text>
Entry list(std::string name, const Range& range, Text text) {
  JsonWriter json;
  json.beginArray();
  std::string joined;
  for (const auto& item : range) {
    const std::string t = text(item);
    json.string(t);
    joined += (joined.empty() ? "" : ", ") + t;
  }
  json.endArray();
  return {std::move(name), json.str(), joined};
}

struct Section {
  const char* name;
  std::vector<Entry> entries;
};

std::vector<Section> collect(SLGlobalConfiguration& c) {
  const auto same = [](const std::string& s) { return s; };
  const auto plain = [](const sl::URL& u) { return u.path(); };
  return {
      {"settings",
       {
           boolean("LowerInstallPriority", c.lowerInstallPriority()),
           boolean("SkipDeviceFamilyCheck", c.skipDeviceFamilyCheck()),
           boolean("SkipThinningCheck", c.skipThinningCheck()),
           integer("SimultaneousInstallsNumber", c.nSimultaneousInstallations()),
           integer("uid", c.uid()),
           integer("gid", c.gid()),
           boolean("codeSigningEnforcementIsDisabled", c.codeSigningEnforcementIsDisabled()),
           boolean("UpdatedPluginContainersWithParentIDWithSafeHarborFix",
                   c.haveUpdatedPluginContainersWithParentID()),
           string("ThinnedAppVariantID", c.alternateThinningModelIdentifier()),
       }},
      {"paths",
       {
           path("oldContainerPath", c.oldContainerPath()),
           path("oldInstallMapPath", c.oldInstallMapPath()),
           path("oldDataDirectoryPath", c.oldDataDirectoryPath()),
           path("oldLoggingPath", c.oldLoggingPath()),
           path("oldArchiveDirectory", c.oldArchiveDirectory()),
           path("dataDirectoryPath", c.dataDirectoryPath()),
           path("roleUserMigrationMarkerFilePath", c.roleUserMigrationMarkerFilePath()),
           path("carrierBundlesDirectory", c.carrierBundlesDirectory()),
           path("stagingRoot", c.stagingRoot()),
           path("logDirectory", c.logDirectory()),
           path("basaltDirectory", c.basaltDirectory()),
           path("systemAppsDirectory", c.systemAppsDirectory()),
           path("internalAppsDirectory", c.internalAppsDirectory()),
           path("developerAppsDirectory", c.developerAppsDirectory()),
           path("factoryMountDirectory", c.factoryMountDirectory()),
           path("systemFrameworksRootDirectory", c.systemFrameworksRootDirectory()),
           path("internalFrameworksRootDirectory", c.internalFrameworksRootDirectory()),
           path("developerFrameworksRootDirectory", c.developerFrameworksRootDirectory()),
           list("allFrameworksDirectories", c.allFrameworksDirectories(), plain),
           path("dataDirectory", c.dataDirectory()),
           path("cachesDirectory", c.cachesDirectory()),
           list("diskImageApplicationsDirectories", c.diskImageApplicationsDirectories(), plain),
       }},
      {"itemNames",
       {
           list("appBundleMetadataItemNames", c.appBundleMetadataItemNames(), same),
           list("appUserDataItemNames", c.appUserDataItemNames(), same),
           list("installationBlacklist", SLGlobalConfiguration::installationBlacklist(), same),
       }},
  };
}

}  // namespace

int configCommand(Arguments args) {
  std::string root;
  bool json = false;
  CommandLine line("config", kHelp);
  line.value("--root", "a directory", &root).flag("--json", &json);
  if (std::optional<int> status = line.parse(args)) return *status;
  if (!applyRoot("config", root)) return 2;

  const std::vector<Section> sections = collect(SLGlobalConfiguration::sharedInstance());
  if (json) {
    JsonWriter out;
    out.beginObject();
    out.key("root").string(sl::systemRoot());
    for (const Section& section : sections) {
      out.key(section.name).beginObject();
      for (const Entry& entry : section.entries) out.key(entry.name).raw(entry.json);
      out.endObject();
    }
    out.endObject();
    std::printf("%s\n", out.str().c_str());
    return 0;
  }
  size_t width = 0;
  for (const Section& section : sections)
    for (const Entry& entry : section.entries) width = std::max(width, entry.name.size());
  std::printf("root: %s\n", sl::systemRoot().c_str());
  for (const Section& section : sections) {
    std::printf("\n%s:\n", section.name);
    for (const Entry& entry : section.entries)
      std::printf("  %-*s  %s\n", static_cast<int>(width), entry.name.c_str(), entry.text.c_str());
  }
  return 0;
}

}  // namespace stowline
