// stowline registry: shows and drives the embedded application registry of
// a system root.

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "AppMigrator/OldLayout.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "FileManager/SLFileManager.h"
#include "Platform/ApplicationRegistry.h"
#include "Platform/Bundle.h"
#include "Platform/URL.h"
#include "Registry/EmbeddedRegistry.h"
#include "tools/CommandLine.h"
#include "tools/Commands.h"
#include "tools/Json.h"

namespace stowline {

namespace {

constexpr char kCommand[] = "registry";

constexpr char kUsage[] =
    "usage: stowline registry [--root DIR] list [--json]\n"
    "       stowline registry [--root DIR] show ID [--json]\n"
    "       stowline registry [--root DIR] install PATH [--placeholder]\n"
    "       stowline registry [--root DIR] harbors [--json]\n"
    "\n"
    "  list              every application the registry knows, built-in ones included\n"
    "  show ID           one application; exit status 1 when the registry does not know it\n"
    "  install PATH      install a customer package (a directory holding Payload/NAME.app);\n"
    "                    with --placeholder, PATH is a bundle directory installed as a\n"
    "                    placeholder. Once the registry has it, the package is consumed\n"
    "                    whatever the outcome; one refused before (no application in\n"
    "                    Payload, no identifier) stays where it is.\n"
    "  harbors           the recorded safe harbors\n"
    "\n"
    "  --root DIR        the system root (default: STOWLINE_ROOT, else /)\n"
    "  --json            print JSON instead of text\n";

// The install type the command's installs carry: a user's own install.
constexpr uint64_t kCommandInstallType = 1;

std::string describe(const sl::Error& error) {
  if (error.isNull()) return "unknown error";
  return error.localizedDescription().str() + " (" + error.domain() + " " + std::to_string(error.code()) + ")";
}

// A path as JSON: the plain path, or null when there is none.
void pathMember(JsonWriter& json, std::string_view key, const std::string& path) {
  json.key(key);
  if (path.empty()) {
    json.null();
  } else {
    json.string(sl::URL::fileURLWithPath(path, true).path());
  }
}

// What the command shows of one application.
struct Application {
  EmbeddedRegistry::Record record;
  sl::Dictionary groups;  // group identifier -> URL
  int64_t installType = 0;
  bool isPlaceholder = false;
};

Application describeApplication(EmbeddedRegistry& registry, EmbeddedRegistry::Record record) {
  SLFileManager& fm = SLFileManager::defaultManager();
  Application application;
  if (std::shared_ptr<RGBundleProxy> proxy = registry.bundleProxyForIdentifier(record.identifier)) {
    application.groups = proxy->groupContainerURLs();
  }
  if (!record.bundlePath.empty()) {
    const sl::URL bundle = sl::URL::fileURLWithPath(record.bundlePath, true);
    const sl::Number installType = fm.installTypeForBundle(bundle);
    if (!installType.isNull()) application.installType = installType.int64Value();
    application.isPlaceholder = fm.bundleAtURLIsPlaceholder(bundle);
  }
  application.isPlaceholder = application.isPlaceholder || record.type == "Placeholder";
  application.record = std::move(record);
  return application;
}

void writeApplicationJson(JsonWriter& json, const Application& application) {
  const EmbeddedRegistry::Record& record = application.record;
  json.beginObject();
  json.key("bundleIdentifier").string(record.identifier);
  json.key("bundleType").string(record.type);
  pathMember(json, "bundleURL", record.bundlePath);
  pathMember(json, "bundleContainerURL", record.bundleContainer);
  pathMember(json, "dataContainerURL", record.dataContainer);
  json.key("groupContainerURLs").beginObject();
  for (const auto& [group, url] : application.groups) json.key(group).value(url);
  json.endObject();
  json.key("installType").number(application.installType);
  json.key("isPlaceholder").boolean(application.isPlaceholder);
  json.endObject();
}

const char* orDash(const std::string& text) { return text.empty() ? "-" : text.c_str(); }

int listApplications(EmbeddedRegistry& registry, bool asJson) {
  std::vector<Application> applications;
  for (EmbeddedRegistry::Record& record : registry.installedApplications()) {
    applications.push_back(describeApplication(registry, std::move(record)));
  }
  if (asJson) {
    JsonWriter json;
    json.beginArray();
    for (const Application& application : applications) writeApplicationJson(json, application);
    json.endArray();
    std::printf("%s\n", json.str().c_str());
    return 0;
  }
  for (const Application& application : applications) {
    const EmbeddedRegistry::Record& record = application.record;
    std::printf("%s\t%s\t%s\t%s\n", record.identifier.c_str(), record.type.c_str(), orDash(record.bundlePath),
                orDash(record.dataContainer));
  }
  return 0;
}

int showApplication(EmbeddedRegistry& registry, const std::string& identifier, bool asJson) {
  std::vector<EmbeddedRegistry::Record> records = registry.installedApplications();
  const auto found = std::find_if(records.begin(), records.end(),
                                  [&](const EmbeddedRegistry::Record& r) { return r.identifier == identifier; });
  if (found == records.end()) {
    std::fprintf(stderr, "stowline registry: no application with the identifier %s\n", identifier.c_str());
    return 1;
  }
  const Application application = describeApplication(registry, std::move(*found));
  if (asJson) {
    JsonWriter json;
    writeApplicationJson(json, application);
    std::printf("%s\n", json.str().c_str());
    return 0;
  }
  const EmbeddedRegistry::Record& record = application.record;
  std::printf("bundleIdentifier: %s\nbundleType: %s\nbundleURL: %s\nbundleContainerURL: %s\ndataContainerURL: %s\n",
              record.identifier.c_str(), record.type.c_str(), orDash(record.bundlePath), orDash(record.bundleContainer),
              orDash(record.dataContainer));
  std::printf("groupContainerURLs:%s\n", application.groups.isEmpty() ? " -" : "");
  for (const auto& [group, url] : application.groups) {
    std::printf("  %s: %s\n", group.c_str(), url.asURL().path().c_str());
  }
  std::printf("installType: %lld\nisPlaceholder: %s\n", static_cast<long long>(application.installType),
              application.isPlaceholder ? "true" : "false");
  return 0;
}

int listHarbors(EmbeddedRegistry& registry, bool asJson) {
  const std::vector<EmbeddedRegistry::SafeHarbor> harbors = registry.safeHarbors();
  if (asJson) {
    JsonWriter json;
    json.beginArray();
    for (const EmbeddedRegistry::SafeHarbor& harbor : harbors) {
      json.beginObject();
      json.key("identifier").string(harbor.identifier);
      pathMember(json, "path", harbor.path);
      json.key("containerType").number(int64_t{harbor.containerType});
      json.endObject();
    }
    json.endArray();
    std::printf("%s\n", json.str().c_str());
    return 0;
  }
  for (const EmbeddedRegistry::SafeHarbor& harbor : harbors) {
    std::printf("%s\t%s\t%d\n", harbor.identifier.c_str(), harbor.path.c_str(), harbor.containerType);
  }
  return 0;
}

// The package's bundle: the first NAME.app of Payload (in name order) for a
// customer package, the package itself for a placeholder. Null, with a
// usage error printed, when there is none.
sl::URL packageBundle(const sl::URL& package, bool placeholder) {
  if (placeholder) return package;
  sl::Error error;
  const std::optional<std::vector<sl::URL>> items = SLFileManager::defaultManager().urlsForItemsInDirectoryAtURL(
      package.URLByAppendingPathComponent(sl::migrator::kPayloadDirectoryName, true), true, &error);
  if (!items) {
    setupError(kCommand, "cannot list " + package.path() + "/Payload: " + describe(error));
    return nullptr;
  }
  std::vector<std::string> bundles;
  for (const sl::URL& item : *items) {
    if (item.pathExtension() == "app") bundles.push_back(item.path());
  }
  if (bundles.empty()) {
    setupError(kCommand, package.path() + "/Payload holds no application bundle");
    return nullptr;
  }
  std::sort(bundles.begin(), bundles.end());
  return sl::URL::fileURLWithPath(bundles.front(), true);
}

int installPackage(EmbeddedRegistry& registry, const std::string& argument, bool placeholder) {
  if (argument.empty()) return usageError(kCommand, "install needs a package path");
  std::string absolute = argument;
  if (absolute.front() != '/') {
    std::vector<char> cwd(4096);
    if (::getcwd(cwd.data(), cwd.size()) == nullptr) {
      return setupError(kCommand, std::string("cannot resolve ") + argument + ": " + std::strerror(errno));
    }
    absolute = std::string(cwd.data()) + "/" + argument;
  }
  const sl::URL package = sl::URL::fileURLWithPath(absolute, true);
  struct stat st;
  if (::stat(package.fileSystemRepresentation(), &st) != 0) {
    return setupError(kCommand, "package " + package.path() + " does not exist");
  }
  if (!S_ISDIR(st.st_mode)) return setupError(kCommand, "package " + package.path() + " is not a directory");
  const sl::URL bundleURL = packageBundle(package, placeholder);
  if (bundleURL.isNull()) return 2;
  const std::shared_ptr<sl::Bundle> bundle = sl::Bundle::createUnique(bundleURL);
  const sl::String identifier = bundle ? bundle->identifier() : sl::String();
  if (identifier.isNull()) {
    return setupError(kCommand, "no bundle identifier in " + bundleURL.path() + "/" + sl::kBundleInfoPlistName);
  }

  const sl::Dictionary options{
      {RGInstallTypeKey, sl::Number(kCommandInstallType)},
      {RGPackageTypeKey, sl::String(placeholder ? RGPackageTypePlaceholder : RGPackageTypeCustomer)},
      {RGBundleIdentifierOptionKey, identifier},
  };
  std::printf("Installing %s from %s%s\n", identifier.c_str(), package.path().c_str(),
              placeholder ? " as a placeholder" : "");
  sl::Error error;
  const bool installed = registry.installApplication(package, options, &error, [](const sl::Dictionary& report) {
    const sl::String failure = report.get(RGProgressErrorKey).asString();
    if (!failure.isNull()) {
      std::fprintf(stderr, "stowline registry: installer error %s: %s (%s)\n", failure.c_str(),
                   report.get(RGProgressErrorDescriptionKey).description().c_str(),
                   report.get(RGProgressErrorDetailKey).description().c_str());
      return;
    }
    const sl::Number percent = report.get(RGProgressPercentCompleteKey).asNumber();
    const sl::String status = report.get(RGProgressStatusKey).asString();
    std::printf("%3lld%% %s\n", percent.isNull() ? 0LL : static_cast<long long>(percent.int64Value()),
                status.isNull() ? "" : status.c_str());
    std::fflush(stdout);
  });
  if (!installed) {
    std::fprintf(stderr, "stowline registry: install of %s failed: %s\n", identifier.c_str(), describe(error).c_str());
    return 1;
  }
  const std::shared_ptr<RGBundleProxy> proxy = registry.bundleProxyForIdentifier(identifier);
  std::printf("Installed %s (%s): bundle %s, data container %s\n", identifier.c_str(),
              proxy ? proxy->bundleType().c_str() : "?", proxy ? orDash(proxy->bundleURL().path()) : "-",
              proxy ? orDash(proxy->dataContainerURL().path()) : "-");
  return 0;
}

}  // namespace

int registryCommand(Arguments args) {
  std::string root;
  bool asJson = false;
  bool placeholder = false;
  std::vector<std::string> words;  // the action and its operand
  CommandLine line(kCommand, kUsage);
  line.value("--root", "a directory", &root).flag("--json", &asJson).flag("--placeholder", &placeholder);
  if (std::optional<int> status = line.operands(&words).parse(args)) return *status;
  if (words.empty()) return usageError(kCommand, "an action is required: list, show, install or harbors");
  const std::string& action = words[0];
  const bool takesOperand = action == "show" || action == "install";
  if (action != "list" && action != "harbors" && !takesOperand) {
    return usageError(kCommand, "unknown action '" + action + "'");
  }
  if (takesOperand && words.size() < 2) {
    return usageError(kCommand, action + (action == "show" ? " needs an identifier" : " needs a package path"));
  }
  if (words.size() > (takesOperand ? 2u : 1u)) {
    return usageError(kCommand, "unexpected argument '" + words.back() + "'");
  }
  if (asJson && action == "install") return usageError(kCommand, "--json does not apply to install");
  if (placeholder && action != "install") return usageError(kCommand, "--placeholder applies to install only");
  if (!applyRoot(kCommand, root)) return 2;

  sl::Error error;
  const std::shared_ptr<EmbeddedRegistry> registry =
      EmbeddedRegistry::open(SLGlobalConfiguration::sharedInstance(), &error);
  if (!registry) {
    return setupError(kCommand, "cannot open the registry: " + describe(error));
  }
  if (action == "list") return listApplications(*registry, asJson);
  if (action == "show") return showApplication(*registry, words[1], asJson);
  if (action == "harbors") return listHarbors(*registry, asJson);
  return installPackage(*registry, words[1], placeholder);
}

}  // namespace stowline
