// stowline plan: what migrate would do to each entry of the old container
// root, found without changing anything.
//
// Strictly read-only: the configuration is asked only for computed paths
// (never the accessors that create their directory), the migrator's
// classification only reads, and the registry's database is not opened
// through the registry (whose open creates directories and runs recovery)
// nor through SQLite on the file (a reader of a WAL database creates or
// writes the -shm index). Its file and its write-ahead log are read whole
// instead, the log's committed frames applied in memory, and the image
// queried as an in-memory database.

#include <fcntl.h>
#include <sqlite3.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "AppMigrator/OldLayout.h"
#include "AppMigrator/Classification.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "FileManager/SLFileManager.h"
#include "Platform/Bundle.h"
#include "Platform/InstallerLog.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"
#include "Registry/EmbeddedRegistry.h"
#include "tools/CommandLine.h"
#include "tools/Commands.h"
#include "tools/Json.h"

namespace stowline {

namespace {

namespace mg = sl::migrator;

constexpr char kCommand[] = "plan";
constexpr char kUsage[] =
    "usage: stowline plan [--root DIR] [--json]\n"
    "\n"
    "Shows what 'stowline migrate' would do with each entry of the old container\n"
    "root, changing nothing: its classification (record built, marker found,\n"
    "deleted or left in place, and why), the identifier, whether the registry\n"
    "knows it, the data items and group containers that would move, the\n"
    "leftovers that would keep the container in place, and the migration markers\n"
    "that name paths outside the old layout (migrate refuses to run over those\n"
    "without --trust-markers).\n"
    "\n"
    "  --root DIR  the system root (default: $STOWLINE_ROOT, else /)\n"
    "  --json      one JSON object instead of text\n"
    "  --help      this text\n";

constexpr const char* kWhereDidMyApplicationsGo = sl::migrator::kWhereDidMyApplicationsGoName;
constexpr const char* kSafeHarborFileName = sl::migrator::kSafeHarborMapName;
constexpr const char* kStagingName = sl::migrator::kStagingDirectoryName;

// ---- The registry's database, read without touching it ----

// Reads a whole file; nullopt when it cannot be opened or read (absent
// included, then *missing is set).
std::optional<std::string> readWhole(const std::string& path, bool* missing) {
  sl::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY));
  if (!fd) {
    const int openErrno = errno;
    if (missing) *missing = openErrno == ENOENT;
    return std::nullopt;
  }
  std::string bytes;
  char buffer[65536];
  for (;;) {
    const ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
    if (n < 0) {
      if (errno == EINTR) continue;
      return std::nullopt;
    }
    if (n == 0) return bytes;
    bytes.append(buffer, static_cast<size_t>(n));
  }
}

uint32_t bigEndian32(const unsigned char* p) {
  return (uint32_t{p[0]} << 24) | (uint32_t{p[1]} << 16) | (uint32_t{p[2]} << 8) | uint32_t{p[3]};
}

// SQLite's WAL checksum: pairs of 32-bit words, in the byte order that the
// log's magic number names, folded into (s1, s2).
void walChecksum(bool bigEndianWords, const unsigned char* data, size_t size, uint32_t sum[2]) {
  for (size_t i = 0; i + 8 <= size; i += 8) {
    uint32_t x0, x1;
    if (bigEndianWords) {
      x0 = bigEndian32(data + i);
      x1 = bigEndian32(data + i + 4);
    } else {
      x0 = uint32_t{data[i]} | (uint32_t{data[i + 1]} << 8) | (uint32_t{data[i + 2]} << 16) |
           (uint32_t{data[i + 3]} << 24);
      x1 = uint32_t{data[i + 4]} | (uint32_t{data[i + 5]} << 8) | (uint32_t{data[i + 6]} << 16) |
           (uint32_t{data[i + 7]} << 24);
    }
    sum[0] += x0 + sum[1];
    sum[1] += x1 + sum[0];
  }
}

// Applies the committed frames of a write-ahead log to the database image:
// frames are taken while their salts and the running checksum hold, and
// only up to the last commit frame among them.
void applyWriteAheadLog(std::string& image, const std::string& wal) {
  const auto* w = reinterpret_cast<const unsigned char*>(wal.data());
  if (wal.size() < 32) return;
  const uint32_t magic = bigEndian32(w);
  if ((magic & 0xFFFFFFFEu) != 0x377F0682u) return;
  const bool bigEndianWords = magic & 1;
  const uint32_t pageSize = bigEndian32(w + 8);
  if (pageSize < 512 || pageSize > 65536 || (pageSize & (pageSize - 1)) != 0) return;
  uint32_t sum[2] = {0, 0};
  walChecksum(bigEndianWords, w, 24, sum);
  if (sum[0] != bigEndian32(w + 24) || sum[1] != bigEndian32(w + 28)) return;

  std::map<uint32_t, size_t> committed, pending;  // page number -> offset of its data in the log
  uint32_t committedPages = 0;
  for (size_t frame = 32; frame + 24 + pageSize <= wal.size(); frame += 24 + pageSize) {
    const unsigned char* header = w + frame;
    if (bigEndian32(header + 8) != bigEndian32(w + 16) || bigEndian32(header + 12) != bigEndian32(w + 20)) break;
    walChecksum(bigEndianWords, header, 8, sum);
    walChecksum(bigEndianWords, header + 24, pageSize, sum);
    if (sum[0] != bigEndian32(header + 16) || sum[1] != bigEndian32(header + 20)) break;
    const uint32_t page = bigEndian32(header);
    if (page == 0) break;
    pending[page] = frame + 24;
    if (const uint32_t pages = bigEndian32(header + 4); pages != 0) {
      for (const auto& [p, offset] : pending) committed[p] = offset;
      pending.clear();
      committedPages = pages;
    }
  }
  if (committedPages == 0) return;
  image.resize(size_t{committedPages} * pageSize, '\0');
  for (const auto& [page, offset] : committed) {
    if (page <= committedPages) image.replace(size_t{page - 1} * pageSize, pageSize, wal, offset, pageSize);
  }
}

// What the registry's database says about identifiers. Opened on a copy in
// memory, so the files below the root are only read.
class RegistrySnapshot {
 public:
  explicit RegistrySnapshot(std::string databasePath) : path_(std::move(databasePath)) {
    bool missing = false;
    std::optional<std::string> image = readWhole(path_, &missing);
    if (!image) {
      state_ = missing ? "absent" : "unreadable";
      return;
    }
    if (std::optional<std::string> wal = readWhole(path_ + "-wal", nullptr)) applyWriteAheadLog(*image, *wal);
    // Rollback journal mode in the copy: a memory database has no log.
    if (image->size() >= 100) (*image)[18] = (*image)[19] = 1;

    sqlite3* raw = nullptr;
    const int opened = sqlite3_open_v2(":memory:", &raw, SQLITE_OPEN_READWRITE, nullptr);
    db_.reset(raw);
    if (opened != SQLITE_OK || image->empty()) {
      state_ = "unreadable";
      return;
    }
    auto* buffer = static_cast<unsigned char*>(sqlite3_malloc64(image->size()));
    if (!buffer) {
      state_ = "unreadable";
      return;
    }
    std::memcpy(buffer, image->data(), image->size());
    const auto size = static_cast<sqlite3_int64>(image->size());
    if (sqlite3_deserialize(db_.get(), "main", buffer, size, size,
                            SQLITE_DESERIALIZE_FREEONCLOSE | SQLITE_DESERIALIZE_READONLY) != SQLITE_OK) {
      state_ = "unreadable";
      return;
    }
    sqlite3_stmt* statement = nullptr;
    if (sqlite3_prepare_v2(db_.get(), "SELECT type FROM applications WHERE identifier = ?", -1, &statement, nullptr) !=
        SQLITE_OK) {
      state_ = "unreadable";
      return;
    }
    lookup_.reset(statement);
    state_ = "read";
  }

  const std::string& path() const { return path_; }
  // "read", "absent" or "unreadable".
  const std::string& state() const { return state_; }

  // The application's type in the registry ("User", "Placeholder",
  // "System"); nullopt when it has no row.
  std::optional<std::string> typeOf(const std::string& identifier) {
    if (!lookup_) return std::nullopt;
    sqlite3_reset(lookup_.get());
    sqlite3_bind_text(lookup_.get(), 1, identifier.data(), static_cast<int>(identifier.size()), SQLITE_TRANSIENT);
    std::optional<std::string> type;
    if (sqlite3_step(lookup_.get()) == SQLITE_ROW) {
      const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(lookup_.get(), 0));
      type = text ? text : "";
    }
    sqlite3_reset(lookup_.get());
    return type;
  }

 private:
  struct Close {
    void operator()(sqlite3* db) const { sqlite3_close_v2(db); }
  };
  struct Finalize {
    void operator()(sqlite3_stmt* s) const { sqlite3_finalize(s); }
  };
  std::string path_;
  std::string state_;
  std::unique_ptr<sqlite3, Close> db_;  // declared before the statement, destroyed after it
  std::unique_ptr<sqlite3_stmt, Finalize> lookup_;
};

// ---- One entry ----

struct GroupMove {
  std::string group;
  std::string path;
  bool exists = false;
};

struct Item {
  sl::URL url;
  mg::DecisionKind kind = mg::DecisionKind::LeaveInPlace;
  std::string reason;
  int reasonLevel = 0;
  // For records:
  sl::Dictionary record;
  bool early = false;
  std::optional<std::string> registryType;  // "User", "Placeholder", "System" (also built-in)
  bool bundleIsPlaceholder = false;
  std::vector<std::string> dataItems;
  std::vector<GroupMove> groups;
  std::vector<std::string> leftovers;
  bool listed = true;  // false when the container could not be listed for data items and leftovers
  // For a marker that names paths outside the old layout.
  std::optional<MarkerFinding> untrustedMarker;
  // Where the entry is expected to be after migrate: empty when it is gone,
  // otherwise why it stays. (A registry install that fails cannot be
  // foreseen.)
  std::string stays;
};

std::string stringOf(const sl::Dictionary& record, const char* key) {
  const sl::String s = record.get(key).asString();
  return s.isNull() ? std::string() : s.str();
}

bool lexists(const std::string& path) {
  struct stat st;
  return ::lstat(path.c_str(), &st) == 0;
}

class Planner {
 public:
  Planner()
      : configuration_(SLGlobalConfiguration::sharedInstance()),
        fileManager_(SLFileManager::defaultManager()),
        registry_(registryDatabasePath()) {
    const sl::Dictionary installMap = sl::dictionaryWithContentsOfURL(configuration_.oldInstallMapPath());
    installMapRead_ = !installMap.isNull();
    groupMap_ = installMap.get(sl::migrator::kGroupContainersKey).asDictionary();
  }

  std::string registryDatabasePath() { return EmbeddedRegistry::databasePathFor(configuration_); }

  Item plan(const sl::URL& url) {
    Item item;
    item.url = url;
    if (url.lastPathComponent() == kWhereDidMyApplicationsGo) {
      item.kind = mg::DecisionKind::Delete;
      item.reason = "the migrator deletes WhereDidMyApplicationsGo.txt";
      item.reasonLevel = sl::kLogLevelNotice;
      return item;
    }
    mg::Decision decision = mg::classifyContainer(url);
    item.kind = decision.kind;
    item.reason = decision.reason.text;
    item.reasonLevel = decision.reason.level;
    if (decision.kind == mg::DecisionKind::LeaveInPlace) item.stays = "left in place";
    if (decision.record.isNull()) return item;

    item.record = decision.record;
    if (decision.kind == mg::DecisionKind::MarkerFound) {
      const sl::URL marker = url.URLByAppendingPathComponent(mg::kMigrationMarkerName, false);
      item.untrustedMarker = checkMarkerRecord(item.record, marker, configuration_.oldContainerPath());
    }
    item.early = decision.early.value_or(false);
    const std::string identifier = stringOf(item.record, mg::kBundleIdentifierKey);
    const std::string bundle = stringOf(item.record, mg::kBundlePathKey);
    const std::string second = stringOf(item.record, mg::kSecondBundlePathKey);
    const std::string container = stringOf(item.record, mg::kContainerPathKey);

    item.registryType = registry_.typeOf(identifier);
    if (!item.registryType && configuration_.systemAppBundleIDToInfoMap().contains(identifier)) {
      item.registryType = "System";
    }
    item.bundleIsPlaceholder = fileManager_.bundleAtURLIsPlaceholder(sl::URL::fileURLWithPath(bundle, true));

    // What stands in the container the record names (a marker may name
    // another directory; the migration works on that one).
    sl::Error error;
    const std::optional<std::vector<sl::URL>> entries =
        fileManager_.urlsForItemsInDirectoryAtURL(sl::URL::fileURLWithPath(container, true), false, &error);
    std::set<std::string> names;
    if (entries) {
      for (const sl::URL& entry : *entries) names.insert(entry.lastPathComponent());
    } else {
      item.listed = false;
    }
    const std::vector<std::string> dataItemNames = configuration_.appUserDataItemNames();
    for (const std::string& name : dataItemNames) {
      if (names.contains(name)) item.dataItems.push_back(container + "/" + name);
    }
    std::set<std::string> expected(dataItemNames.begin(), dataItemNames.end());
    for (const std::string& name : SLFileManager::storeDataItemNames()) expected.insert(name);
    for (const char* name :
         {kStagingName, mg::kMigrationMarkerName, mg::kMigrationMarkerFlagName, mg::kPlaceholderFlagName}) {
      expected.insert(name);
    }
    for (const std::string& path : {bundle, second}) {
      if (!path.empty() && sl::URL::fileURLWithPath(path, false).URLByDeletingLastPathComponent().path() ==
                               sl::URL::fileURLWithPath(container, true).path()) {
        expected.insert(sl::URL::fileURLWithPath(path, false).lastPathComponent());
      }
    }
    if (entries) {
      for (const sl::URL& entry : *entries) {
        if (!expected.contains(entry.lastPathComponent())) item.leftovers.push_back(entry.path());
      }
    }

    // Groups move after a real install only: not for a placeholder bundle.
    if (!item.bundleIsPlaceholder && !groupMap_.isNull()) {
      std::shared_ptr<sl::Bundle> reader = sl::Bundle::createUnique(sl::URL::fileURLWithPath(bundle, true));
      const sl::Array groups = reader ? reader->infoDictionary().get("PBApplicationGroups").asArray() : nullptr;
      if (!groups.isNull()) {
        for (const sl::Value& value : groups) {
          const sl::String group = value.asString();
          if (group.isNull()) continue;
          const sl::String path = groupMap_.get(group.str()).asDictionary().get("Container").asString();
          if (path.isNull()) continue;
          item.groups.push_back({group.str(), path.str(), lexists(path.str())});
        }
      }
    }
    if (!item.registryType && stringOf(item.record, mg::kContainerTypeKey) != mg::kContainerTypeApp) {
      item.stays = "the registry does not know it and only applications get a placeholder";
    } else if (!item.bundleIsPlaceholder && !item.listed) {
      item.stays = "the container cannot be listed for leftovers";
    } else if (!item.bundleIsPlaceholder && !item.leftovers.empty()) {
      item.stays = "leftovers";
    }
    return item;
  }

  SLGlobalConfiguration& configuration() { return configuration_; }
  RegistrySnapshot& registry() { return registry_; }
  bool installMapRead() const { return installMapRead_; }
  const sl::Dictionary& groupMap() const { return groupMap_; }

 private:
  SLGlobalConfiguration& configuration_;
  SLFileManager& fileManager_;
  RegistrySnapshot registry_;
  bool installMapRead_ = false;
  sl::Dictionary groupMap_;
};

struct Harbor {
  std::string identifier;
  std::optional<std::string> path;  // none when the entry is malformed
};

std::vector<Harbor> readHarbors(const sl::URL& mapURL, bool* present, bool* readable) {
  std::vector<Harbor> harbors;
  *present = lexists(mapURL.path());
  const sl::Dictionary map = *present ? sl::dictionaryWithContentsOfURL(mapURL) : nullptr;
  *readable = !map.isNull();
  if (map.isNull()) return harbors;
  for (const auto& [identifier, entry] : map) {
    const sl::String path = entry.asDictionary().get(sl::migrator::kHarborPathKey).asString();
    harbors.push_back({identifier, path.isNull() ? std::nullopt : std::optional<std::string>(path.str())});
  }
  return harbors;
}

const char* describeKind(mg::DecisionKind kind) {
  switch (kind) {
    case mg::DecisionKind::RecordBuilt:
      return "record built";
    case mg::DecisionKind::MarkerFound:
      return "marker found";
    case mg::DecisionKind::Delete:
      return "deleted";
    case mg::DecisionKind::LeaveInPlace:
      return "left in place";
    case mg::DecisionKind::Vanished:
      return "vanished";
  }
  return "?";
}

std::string joined(const std::vector<std::string>& parts) {
  if (parts.empty()) return "none";
  std::string out;
  for (const std::string& part : parts) out += (out.empty() ? "" : ", ") + part;
  return out;
}

// The names of entries of one container, for the text form (JSON keeps the
// whole paths).
std::vector<std::string> names(const std::vector<std::string>& paths) {
  std::vector<std::string> out;
  for (const std::string& path : paths) out.push_back(sl::URL::fileURLWithPath(path, false).lastPathComponent());
  return out;
}

}  // namespace

int planCommand(Arguments args) {
  std::string root;
  bool json = false;
  CommandLine line(kCommand, kUsage);
  line.value("--root", "a directory", &root).flag("--json", &json);
  if (std::optional<int> status = line.parse(args)) return *status;
  if (!applyRoot(kCommand, root)) return 2;

  // The installer log's errors still reach the user; its notices do not
  // belong in a plan.
  sl::setInstallerLogSink([](const sl::LogRecord& record) {
    if (record.level <= sl::kLogLevelError) {
      std::fprintf(stderr, "stowline plan: %.*s\n", static_cast<int>(record.message.size()), record.message.data());
    }
  });

  Planner planner;
  SLGlobalConfiguration& configuration = planner.configuration();
  const sl::URL containerRoot = configuration.oldContainerPath();
  SLFileManager& fileManager = SLFileManager::defaultManager();

  // The old container root as init lists it (links left out), and the
  // links apart: the main pass's final check finds them.
  std::string rootState = "present";
  std::vector<Item> items;
  std::vector<std::string> links;
  bool whereDidMyApplicationsGo = false;
  if (!lexists(containerRoot.path())) {
    rootState = "missing";
  } else {
    sl::Error error;
    std::optional<std::vector<sl::URL>> all = fileManager.urlsForItemsInDirectoryAtURL(containerRoot, false, &error);
    if (!all) {
      std::fprintf(stderr, "stowline plan: cannot list %s: %s\n", containerRoot.path().c_str(),
                   error.description().c_str());
      return 1;
    }
    for (const sl::URL& entry : *all) {
      struct stat st;
      if (::lstat(entry.fileSystemRepresentation(), &st) == 0 && S_ISLNK(st.st_mode)) {
        links.push_back(entry.path());
        continue;
      }
      if (entry.lastPathComponent() == kWhereDidMyApplicationsGo) whereDidMyApplicationsGo = true;
      items.push_back(planner.plan(entry));
    }
    if (items.empty()) rootState = "empty";
  }
  // Containers that claim one identifier stay, as the migration leaves them.
  std::vector<sl::Dictionary> records;
  for (const Item& item : items) {
    if (!item.record.isNull()) records.push_back(item.record);
  }
  std::map<std::string, size_t> claims = mg::identifierClaims(records);
  for (Item& item : items) {
    if (item.record.isNull()) continue;
    const std::string identifier = stringOf(item.record, mg::kBundleIdentifierKey);
    if (claims[identifier] > 1) {
      item.stays = std::to_string(claims[identifier]) + " containers claim the identifier " + identifier;
    }
  }
  bool harborMapPresent = false, harborMapReadable = false;
  const sl::URL harborMapURL =
      configuration.dataDirectoryPath().URLByAppendingPathComponent(kSafeHarborFileName, false);
  const std::vector<Harbor> harbors = readHarbors(harborMapURL, &harborMapPresent, &harborMapReadable);
  RegistrySnapshot& registry = planner.registry();

  if (json) {
    JsonWriter w;
    w.beginObject();
    w.key("root").string(sl::systemRoot());
    w.key("containerRoot").string(containerRoot.path());
    w.key("containerRootState").string(rootState);
    w.key("installMap").beginObject();
    w.key("path").string(configuration.oldInstallMapPath().path());
    w.key("read").boolean(planner.installMapRead());
    w.key("groupContainers")
        .number(static_cast<uint64_t>(planner.groupMap().isNull() ? 0 : planner.groupMap().count()));
    w.endObject();
    w.key("registry").beginObject();
    w.key("path").string(registry.path());
    w.key("state").string(registry.state());
    w.endObject();
    w.key("whereDidMyApplicationsGo").boolean(whereDidMyApplicationsGo);
    w.key("links").beginArray();
    for (const std::string& link : links) w.string(link);
    w.endArray();
    w.key("items").beginArray();
    for (const Item& item : items) {
      w.beginObject();
      w.key("path").string(item.url.path());
      w.key("classification").string(mg::decisionKindName(item.kind));
      w.key("reason").string(item.reason);
      w.key("reasonLevel").number(static_cast<int64_t>(item.reasonLevel));
      w.key("afterMigration").string(item.stays.empty() ? "gone" : "stays");
      if (!item.stays.empty()) w.key("staysBecause").string(item.stays);
      if (!item.record.isNull()) {
        w.key("record").value(item.record);
        w.key("identifier").string(stringOf(item.record, mg::kBundleIdentifierKey));
        w.key("containerType").string(stringOf(item.record, mg::kContainerTypeKey));
        w.key("early").boolean(item.early);
        w.key("registryKnows").boolean(item.registryType.has_value());
        if (item.registryType) {
          w.key("registryType").string(*item.registryType);
        } else {
          w.key("registryType").null();
        }
        w.key("bundleIsPlaceholder").boolean(item.bundleIsPlaceholder);
        w.key("containerListed").boolean(item.listed);
        w.key("dataItems").beginArray();
        for (const std::string& path : item.dataItems) w.string(path);
        w.endArray();
        w.key("groupContainers").beginArray();
        for (const GroupMove& group : item.groups) {
          w.beginObject().key("group").string(group.group).key("path").string(group.path);
          w.key("exists").boolean(group.exists).endObject();
        }
        w.endArray();
        w.key("leftovers").beginArray();
        for (const std::string& path : item.leftovers) w.string(path);
        w.endArray();
        if (item.kind == mg::DecisionKind::MarkerFound) {
          w.key("untrustedMarker");
          if (const std::optional<MarkerFinding>& finding = item.untrustedMarker) {
            w.beginObject().key("marker").string(finding->marker).key("key").string(finding->key);
            w.key("path").string(finding->path).key("within").string(finding->within).endObject();
          } else {
            w.null();
          }
        }
      }
      w.endObject();
    }
    w.endArray();
    w.key("harborMap").beginObject();
    w.key("path").string(harborMapURL.path());
    w.key("present").boolean(harborMapPresent);
    w.key("read").boolean(harborMapReadable);
    w.endObject();
    w.key("harbors").beginArray();
    for (const Harbor& harbor : harbors) {
      w.beginObject().key("identifier").string(harbor.identifier).key("path");
      if (harbor.path) {
        w.string(*harbor.path);
      } else {
        w.null();
      }
      w.endObject();
    }
    w.endArray();
    w.endObject();
    std::printf("%s\n", w.str().c_str());
    return 0;
  }

  std::printf("Old container root: %s (%s)\n", containerRoot.path().c_str(),
              rootState == "missing" ? "missing: nothing to migrate"
              : rootState == "empty" ? "empty: migrate deletes it"
                                     : "present");
  std::printf("Old install map: %s (%s", configuration.oldInstallMapPath().path().c_str(),
              planner.installMapRead() ? "read" : "not readable");
  if (planner.installMapRead()) {
    std::printf(", %zu group containers", planner.groupMap().isNull() ? size_t{0} : planner.groupMap().count());
  }
  std::printf(")\n");
  std::printf("Registry: %s (%s)\n", registry.path().c_str(), registry.state().c_str());
  if (whereDidMyApplicationsGo) std::printf("%s: would be deleted\n", kWhereDidMyApplicationsGo);
  for (const std::string& link : links) {
    std::printf("Link %s: not migrated; while it stays, the migration fails its final check\n", link.c_str());
  }
  for (const Item& item : items) {
    std::printf("\n%s\n", item.url.path().c_str());
    std::printf("  classification: %s\n", describeKind(item.kind));
    std::printf("  reason: %s: %s\n", std::string(sl::logLevelName(item.reasonLevel)).c_str(), item.reason.c_str());
    std::printf("  after migration: %s\n", item.stays.empty() ? "gone" : ("stays (" + item.stays + ")").c_str());
    if (item.record.isNull()) continue;
    if (item.untrustedMarker) {
      std::printf("  warning: %s: migrate refuses to run without --trust-markers\n",
                  describeMarkerFinding(*item.untrustedMarker).c_str());
    }
    std::printf("  identifier: %s\n", stringOf(item.record, mg::kBundleIdentifierKey).c_str());
    std::printf("  container type: %s%s\n", stringOf(item.record, mg::kContainerTypeKey).c_str(),
                item.early ? " (migrated early)" : "");
    std::printf("  bundle: %s%s\n", stringOf(item.record, mg::kBundlePathKey).c_str(),
                item.bundleIsPlaceholder ? " (placeholder: data moves, nothing is installed)" : "");
    if (const std::string second = stringOf(item.record, mg::kSecondBundlePathKey); !second.empty()) {
      std::printf("  second bundle: %s\n", second.c_str());
    }
    std::printf("  registry knows: %s\n", item.registryType ? ("yes (" + *item.registryType + ")").c_str() : "no");
    std::printf("  data items: %s\n", joined(names(item.dataItems)).c_str());
    std::vector<std::string> groups;
    for (const GroupMove& group : item.groups) {
      groups.push_back(group.group + " from " + group.path + (group.exists ? "" : " (missing)"));
    }
    std::printf("  group containers: %s\n", joined(groups).c_str());
    std::printf("  leftovers: %s\n", item.listed ? joined(names(item.leftovers)).c_str() : "container cannot be listed");
  }
  std::printf("\nSafe harbor map: %s (%s)\n", harborMapURL.path().c_str(),
              !harborMapPresent   ? "absent"
              : harborMapReadable ? "read"
                                  : "not readable: left in place");
  for (const Harbor& harbor : harbors) {
    std::printf("  %s: %s\n", harbor.identifier.c_str(),
                harbor.path ? harbor.path->c_str() : "(malformed entry: skipped)");
  }
  return 0;
}

}  // namespace stowline
