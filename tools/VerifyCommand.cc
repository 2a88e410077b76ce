// stowline verify: checks a migrated layout against a manifest of the old
// one. Every item must stand exactly once, with the same content, in the
// data or group container that the registry names for it.
//
// The registry is opened the ordinary way (its open may run recovery and
// create its own directories): verify runs after a migration, when the
// registry's files are the migrator's anyway. The containers themselves are
// only read.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <map>
#include <string>
#include <vector>

#include "Configuration/SLGlobalConfiguration.h"
#include "Platform/Error.h"
#include "Platform/InstallerLog.h"
#include "Platform/URL.h"
#include "Platform/UniqueFd.h"
#include "Registry/EmbeddedRegistry.h"
#include "tools/CommandLine.h"
#include "tools/Commands.h"
#include "tools/ManifestItem.h"
#include "tools/Json.h"

namespace stowline {

namespace {

constexpr char kCommand[] = "verify";
constexpr char kUsage[] =
    "usage: stowline verify [--root DIR] [--json] MANIFEST\n"
    "\n"
    "Checks, after a migration, that every item that 'stowline manifest'\n"
    "recorded stands exactly once in the new layout: in the data container the\n"
    "registry names for its application, or in the group container it names\n"
    "for its group, with the same type, size, mode and SHA-256 or link target.\n"
    "Prints one line for each item that is missing, changed or duplicated (still\n"
    "in the old layout as well), then a summary. Exit status 1 when anything is\n"
    "wrong. The registry is opened normally and may finish its own recovery.\n"
    "\n"
    "  --root DIR  the system root (default: $STOWLINE_ROOT, else /)\n"
    "  --json      one JSON object instead of text\n"
    "  --help      this text\n";

struct Problem {
  std::string kind;   // "missing", "changed", "duplicated"
  std::string owner;  // "application ID" or "group ID"
  std::string path;   // the item's relative path
  std::string detail;
};

std::optional<std::string> readFile(const std::string& path, int* err) {
  sl::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY));
  if (!fd) {
    const int openErrno = errno;
    *err = openErrno;
    return std::nullopt;
  }
  std::string bytes;
  char buffer[65536];
  for (;;) {
    const ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
    if (n < 0) {
      const int readErrno = errno;
      if (readErrno == EINTR) continue;
      *err = readErrno;
      return std::nullopt;
    }
    if (n == 0) return bytes;
    bytes.append(buffer, static_cast<size_t>(n));
  }
}

// A manifest item from its JSON object; false when it is malformed.
bool itemFrom(const sl::Value& value, ManifestItem* item) {
  const sl::Dictionary d = value.asDictionary();
  if (d.isNull()) return false;
  const sl::String path = d.get("path").asString(), type = d.get("type").asString();
  const sl::Number size = d.get("size").asNumber(), mode = d.get("mode").asNumber();
  if (path.isNull() || path.str().empty() || path.str()[0] == '/' || type.isNull() || size.isNull() ||
      mode.isNull()) {
    return false;
  }
  item->path = path.str();
  item->type = type.str();
  item->size = size.uint64Value();
  item->mode = static_cast<uint32_t>(mode.uint64Value());
  const sl::String sha = d.get("sha256").asString(), target = d.get("target").asString();
  if (item->type == "file" && sha.isNull()) return false;
  if (item->type == "link" && target.isNull()) return false;
  item->sha256 = sha.isNull() ? std::string() : sha.str();
  item->target = target.isNull() ? std::string() : target.str();
  return true;
}

std::string octal(uint32_t mode) {
  char text[16];
  std::snprintf(text, sizeof text, "%04o", mode);
  return text;
}

// What differs between the recorded item and the one found; empty when
// they agree. Directory sizes depend on the file system and are not
// compared.
std::string difference(const ManifestItem& want, const ManifestItem& have) {
  if (want.type != have.type) return "type " + want.type + " became " + have.type;
  std::string out;
  auto add = [&](const std::string& part) { out += (out.empty() ? "" : ", ") + part; };
  if (want.type != "directory" && want.size != have.size) {
    add("size " + std::to_string(want.size) + " became " + std::to_string(have.size));
  }
  if (want.mode != have.mode) add("mode " + octal(want.mode) + " became " + octal(have.mode));
  if (want.type == "file" && want.sha256 != have.sha256) add("content changed (SHA-256 " + have.sha256 + ")");
  if (want.type == "link" && want.target != have.target) add("target " + want.target + " became " + have.target);
  return out;
}

class Checker {
 public:
  // Checks `items` of one owner against the new container `newPath` (empty
  // when the registry names none) and the old one `oldPath` (empty when the
  // manifest does not say).
  void check(const std::string& owner, const sl::Array& items, const std::string& newPath, const std::string& oldPath,
             const std::string& why) {
    sl::UniqueFd newFd;
    if (!newPath.empty()) newFd.reset(::open(newPath.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    const int newErrno = newFd ? 0 : errno;
    sl::UniqueFd oldFd;
    if (!oldPath.empty()) oldFd.reset(::open(oldPath.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));

    for (const sl::Value& value : items) {
      ++checked_;
      ManifestItem want;
      if (!itemFrom(value, &want)) {
        problems_.push_back({"malformed", owner, "", "an item of the manifest is malformed"});
        continue;
      }
      if (newPath.empty()) {
        problems_.push_back({"missing", owner, want.path, why});
      } else if (!newFd) {
        problems_.push_back({"missing", owner, want.path, newPath + ": " + std::strerror(newErrno)});
      } else {
        int err = 0;
        const std::optional<ManifestItem> have = describeManifestItem(newFd.get(), want.path, &err);
        if (!have) {
          problems_.push_back({"missing", owner, want.path,
                               err == ENOENT ? "not in " + newPath : newPath + ": " + std::strerror(err)});
        } else if (const std::string changed = difference(want, *have); !changed.empty()) {
          problems_.push_back({"changed", owner, want.path, changed});
        }
      }
      // A directory that stays behind empty holds no data; anything else
      // that still stands in the old container is there twice.
      if (oldFd && want.type != "directory") {
        int err = 0;
        if (describeManifestItem(oldFd.get(), want.path, &err)) {
          problems_.push_back({"duplicated", owner, want.path, "still in " + oldPath});
        }
      }
    }
  }

  void fail(std::string kind, std::string owner, std::string detail) {
    problems_.push_back({std::move(kind), std::move(owner), "", std::move(detail)});
  }

  const std::vector<Problem>& problems() const { return problems_; }
  size_t checked() const { return checked_; }

 private:
  std::vector<Problem> problems_;
  size_t checked_ = 0;
};

std::string pathOf(const sl::URL& url) { return url.isNull() ? std::string() : url.path(); }

}  // namespace

int verifyCommand(Arguments args) {
  std::string root;
  bool json = false;
  std::vector<std::string> manifests;
  CommandLine line(kCommand, kUsage);
  line.value("--root", "a directory", &root).flag("--json", &json).operands(&manifests);
  if (std::optional<int> status = line.parse(args)) return *status;
  if (manifests.empty()) return usageError(kCommand, "a manifest is needed");
  if (manifests.size() > 1) return usageError(kCommand, "only one manifest can be given");
  const std::string& manifestPath = manifests[0];

  int err = 0;
  const std::optional<std::string> text = readFile(manifestPath, &err);
  if (!text) return setupError(kCommand, "cannot read " + manifestPath + ": " + std::strerror(err));
  sl::Error error;
  const sl::Dictionary manifest = parseJson(*text, &error).asDictionary();
  if (manifest.isNull()) {
    return setupError(kCommand, manifestPath + " is not a manifest: " +
                                    (error.isNull() ? std::string("not a JSON object") : error.localizedDescription().str()));
  }
  const sl::Dictionary applications = manifest.get("applications").asDictionary();
  const sl::Dictionary groups = manifest.get("groups").asDictionary();
  if (applications.isNull() || groups.isNull()) {
    return setupError(kCommand, manifestPath + " is not a manifest: \"applications\" or \"groups\" is missing");
  }
  const sl::Dictionary oldContainers = manifest.get("containers").asDictionary();
  const sl::Dictionary oldGroupContainers = manifest.get("groupContainers").asDictionary();
  if (!applyRoot(kCommand, root)) return 2;

  sl::setInstallerLogSink([](const sl::LogRecord& record) {
    if (record.level <= sl::kLogLevelError) {
      std::fprintf(stderr, "stowline verify: %.*s\n", static_cast<int>(record.message.size()), record.message.data());
    }
  });
  std::shared_ptr<EmbeddedRegistry> registry = EmbeddedRegistry::open(SLGlobalConfiguration::sharedInstance(), &error);
  if (!registry) return setupError(kCommand, "cannot open the registry: " + error.description());

  // The new containers, as the registry names them: each application's data
  // container, and each group's container from the applications in it.
  std::map<std::string, std::string> dataContainers, groupContainers;
  for (const EmbeddedRegistry::Record& record : registry->installedApplications()) {
    if (!applications.get(record.identifier).isNull()) dataContainers[record.identifier] = record.dataContainer;
    const std::shared_ptr<RGBundleProxy> proxy = registry->bundleProxyForIdentifier(sl::String(record.identifier));
    const sl::Dictionary urls = proxy ? proxy->groupContainerURLs() : nullptr;
    if (urls.isNull()) continue;
    for (const auto& [group, value] : urls.entries()) {
      const std::string path = value.asURL().isNull() ? value.asString().isNull() ? "" : value.asString().str()
                                                      : pathOf(value.asURL());
      if (!path.empty()) groupContainers.emplace(group, path);
    }
  }

  Checker checker;
  auto oldPathOf = [](const sl::Dictionary& map, const std::string& key) {
    const sl::String path = map.get(key).asString();
    return path.isNull() ? std::string() : path.str();
  };
  for (const auto& [identifier, items] : applications.entries()) {
    const std::string owner = "application " + identifier;
    if (items.asArray().isNull()) {
      checker.fail("malformed", owner, "its items are not an array");
      continue;
    }
    const auto found = dataContainers.find(identifier);
    const bool known = found != dataContainers.end();
    checker.check(owner, items.asArray(), known ? found->second : std::string(), oldPathOf(oldContainers, identifier),
                  known ? "the registry names no data container" : "the registry does not know the application");
  }
  for (const auto& [group, items] : groups.entries()) {
    const std::string owner = "group " + group;
    if (items.asArray().isNull()) {
      checker.fail("malformed", owner, "its items are not an array");
      continue;
    }
    const auto found = groupContainers.find(group);
    checker.check(owner, items.asArray(), found == groupContainers.end() ? std::string() : found->second,
                  oldPathOf(oldGroupContainers, group), "the registry names no container for the group");
  }

  const std::vector<Problem>& problems = checker.problems();
  std::map<std::string, size_t> counts;
  for (const Problem& problem : problems) ++counts[problem.kind];
  if (json) {
    JsonWriter w;
    w.beginObject();
    std::error_code cwdError;  // the path as given, when the working directory is gone
    const std::filesystem::path absolute = std::filesystem::absolute(manifestPath, cwdError);
    w.key("manifest").string(cwdError ? manifestPath : absolute.lexically_normal().string());
    w.key("checked").number(static_cast<uint64_t>(checker.checked()));
    w.key("ok").boolean(problems.empty());
    w.key("problems").beginArray();
    for (const Problem& problem : problems) {
      w.beginObject().key("kind").string(problem.kind).key("owner").string(problem.owner);
      w.key("path").string(problem.path).key("detail").string(problem.detail).endObject();
    }
    w.endArray();
    w.endObject();
    std::printf("%s\n", w.str().c_str());
  } else {
    for (const Problem& problem : problems) {
      std::printf("%s: %s: %s%s%s\n", problem.kind.c_str(), problem.owner.c_str(), problem.path.c_str(),
                  problem.path.empty() ? "" : ": ", problem.detail.c_str());
    }
    std::printf("%zu items checked: %zu missing, %zu changed, %zu duplicated%s\n", checker.checked(),
                counts["missing"], counts["changed"], counts["duplicated"],
                counts["malformed"] ? (", " + std::to_string(counts["malformed"]) + " malformed").c_str() : "");
  }
  return problems.empty() ? 0 : 1;
}

}  // namespace stowline
