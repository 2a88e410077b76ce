// sl-floor: the least that a durable migration of a fixture root must do,
// as the yardstick for `stowline migrate`.
//
//   sl-floor --root DIR [--stats] [--no-durability]
//
// For each old application container (in directory order) it
//   - makes a bundle container and renames the bundle and the store
//     metadata items into it,
//   - makes a data container and renames the user-data directories into it,
//   - renames each of the application's group containers (from the old
//     install map, first application of a group only) into the group root,
//   - removes the emptied old container,
//   - fsyncs every directory whose entries changed (the two new containers,
//     the bundle, data and group roots, the old groups directory and the old
//     container root), and
//   - records the application in one SQLite commit (WAL, synchronous=FULL):
//     identifier, bundle container, data container and groups.
// The order is the durable one: a record is committed only once the
// directories it names are on the disk.
//
// It reads what any migration must read (each bundle's Info.plist for the
// identifier and the groups, the old install map) and nothing else: no
// marker, no intent record, no staging, no placeholder, no verification.
// The new layout is the registry's: bundle containers in
// private/var/stowd/Containers/Bundle, data containers in
// private/var/mobile/Containers/Data, group containers in
// private/var/mobile/Containers/Shared, the database in
// private/var/stowd/Library/Registry (floor.sqlite, beside where the
// registry keeps its own).
//
// With --stats it prints the counts of what it did as one JSON object.
// --no-durability leaves out the directory fsyncs and commits with
// synchronous=OFF: the same work without its durability, to show what that
// costs.
// Exit status 0 on success, 1 on a failure, 2 for a usage error.

#include <dirent.h>
#include <fcntl.h>
#include <sqlite3.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "FileManager/SLFileManager.h"
#include "Platform/Mutations.h"
#include "Platform/PropertyList.h"
#include "Platform/UniqueFd.h"
#include "Platform/Value.h"

namespace {

constexpr char kUsage[] = "usage: sl-floor --root DIR [--stats] [--no-durability]\n";

constexpr char kOldContainerRoot[] = "private/var/mobile/Applications";
constexpr char kOldInstallMap[] = "private/var/mobile/Library/Caches/com.vantor.stowline.plist";
constexpr char kBundleRoot[] = "private/var/stowd/Containers/Bundle";
constexpr char kDataRoot[] = "private/var/mobile/Containers/Data";
constexpr char kGroupRoot[] = "private/var/mobile/Containers/Shared";
constexpr char kRegistryDirectory[] = "private/var/stowd/Library/Registry";
constexpr char kDatabaseName[] = "floor.sqlite";

constexpr const char* kUserDataNames[] = {"Documents", "Library", "tmp", "Tillbox"};

struct Counts {
  uint64_t applications = 0;
  uint64_t renames = 0;
  uint64_t directoriesMade = 0;
  uint64_t removals = 0;
  uint64_t fsyncs = 0;
  uint64_t commits = 0;
};

bool fail(const char* call, const std::string& what, int savedErrno) {
  std::fprintf(stderr, "sl-floor: %s of %s failed: %s\n", call, what.c_str(), std::strerror(savedErrno));
  return false;
}

struct SqliteClose {
  void operator()(sqlite3* db) const { sqlite3_close(db); }
};
struct SqliteFinalize {
  void operator()(sqlite3_stmt* statement) const { sqlite3_finalize(statement); }
};

// A random version 4 UUID, uppercase, as the registry names containers.
bool makeUUID(std::string* out) {
  uint8_t bytes[16];
  if (::getrandom(bytes, sizeof bytes, 0) != static_cast<ssize_t>(sizeof bytes)) return fail("getrandom", "a UUID", errno);
  bytes[6] = static_cast<uint8_t>((bytes[6] & 0x0F) | 0x40);
  bytes[8] = static_cast<uint8_t>((bytes[8] & 0x3F) | 0x80);
  static constexpr char kHex[] = "0123456789ABCDEF";
  out->clear();
  for (size_t i = 0; i < sizeof bytes; ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) *out += '-';
    *out += kHex[bytes[i] >> 4];
    *out += kHex[bytes[i] & 0x0F];
  }
  return true;
}

bool hasSuffix(std::string_view name, std::string_view suffix) {
  return name.size() > suffix.size() && name.substr(name.size() - suffix.size()) == suffix;
}

class Floor {
 public:
  Floor(std::string root, bool durable) : root_(std::move(root)), durable_(durable) {}
  bool run();
  const Counts& counts() const { return counts_; }

 private:
  bool openDirectory(const std::string& relative, bool create, sl::UniqueFd* out);
  bool openDatabase();
  bool readGroupMap();
  bool migrate(const std::string& containerName);
  bool sync(int fd, const std::string& what);
  bool makeContainer(int parent, const std::string& parentPath, std::string* name, sl::UniqueFd* out);
  bool moveInto(int fromDir, const std::string& name, int toDir, const std::string& toName, const std::string& what);

  std::string root_;
  bool durable_;
  Counts counts_;
  sl::UniqueFd oldRoot_, bundleRoot_, dataRoot_, groupRoot_, oldGroups_;
  std::string oldGroupsPath_;
  std::map<std::string, std::string> oldGroupPaths_;  // group identifier -> old path
  std::set<std::string> movedGroups_;
  std::map<std::string, std::string> newGroupPaths_;
  std::unique_ptr<sqlite3, SqliteClose> db_;
  std::unique_ptr<sqlite3_stmt, SqliteFinalize> insert_;
};

bool Floor::openDirectory(const std::string& relative, bool create, sl::UniqueFd* out) {
  sl::UniqueFd current(::open(root_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!current) return fail("open", root_, errno);
  std::string path = root_;
  size_t start = 0;
  while (start < relative.size()) {
    size_t end = relative.find('/', start);
    if (end == std::string::npos) end = relative.size();
    const std::string component = relative.substr(start, end - start);
    start = end + 1;
    path += "/" + component;
    if (create && sl::mut::mkdirat(current.get(), component.c_str(), 0755) != 0 && errno != EEXIST) {
      return fail("mkdir", path, errno);
    }
    sl::UniqueFd next(::openat(current.get(), component.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!next) return fail("open", path, errno);
    current = std::move(next);
  }
  *out = std::move(current);
  return true;
}

bool Floor::openDatabase() {
  sl::UniqueFd registry;
  if (!openDirectory(kRegistryDirectory, true, &registry)) return false;
  const std::string path = root_ + "/" + kRegistryDirectory + "/" + kDatabaseName;
  sqlite3* raw = nullptr;
  const int rc = sqlite3_open_v2(path.c_str(), &raw, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX,
                                 nullptr);
  db_.reset(raw);
  auto sqliteFailure = [&](const char* what) {
    std::fprintf(stderr, "sl-floor: %s of %s failed: %s\n", what, path.c_str(),
                 db_ ? sqlite3_errmsg(db_.get()) : sqlite3_errstr(rc));
    return false;
  };
  if (rc != SQLITE_OK) return sqliteFailure("open");
  if (sqlite3_exec(db_.get(), durable_ ? "PRAGMA synchronous=FULL" : "PRAGMA synchronous=OFF", nullptr, nullptr,
                   nullptr) != SQLITE_OK ||
      sqlite3_exec(db_.get(),
                   "PRAGMA journal_mode=WAL;"
                   "CREATE TABLE IF NOT EXISTS applications(identifier TEXT PRIMARY KEY, bundle_container TEXT, "
                   "data_container TEXT, groups TEXT)",
                   nullptr, nullptr, nullptr) != SQLITE_OK) {
    return sqliteFailure("setup");
  }
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v2(db_.get(), "INSERT OR REPLACE INTO applications VALUES(?, ?, ?, ?)", -1, &statement,
                         nullptr) != SQLITE_OK) {
    return sqliteFailure("prepare");
  }
  insert_.reset(statement);
  return true;
}

bool Floor::readGroupMap() {
  const sl::Dictionary map =
      sl::dictionaryWithContentsOfURL(sl::URL::fileURLWithPath(root_ + "/" + kOldInstallMap, false));
  if (map.isNull()) return true;  // no groups
  const sl::Dictionary groups = map.get("GroupContainers").asDictionary();
  if (groups.isNull()) return true;
  for (const auto& [identifier, value] : groups) {
    const sl::String path = value.asDictionary().get("Container").asString();
    if (!path.isNull()) oldGroupPaths_[std::string(identifier)] = path.str();
  }
  return true;
}

bool Floor::sync(int fd, const std::string& what) {
  if (!durable_) return true;
  if (sl::mut::fsync(fd) != 0) return fail("fsync", what, errno);
  ++counts_.fsyncs;
  return true;
}

bool Floor::makeContainer(int parent, const std::string& parentPath, std::string* name, sl::UniqueFd* out) {
  if (!makeUUID(name)) return false;
  if (sl::mut::mkdirat(parent, name->c_str(), 0755) != 0) return fail("mkdir", parentPath + "/" + *name, errno);
  ++counts_.directoriesMade;
  sl::UniqueFd fd(::openat(parent, name->c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return fail("open", parentPath + "/" + *name, errno);
  *out = std::move(fd);
  return true;
}

bool Floor::moveInto(int fromDir, const std::string& name, int toDir, const std::string& toName,
                     const std::string& what) {
  if (sl::mut::renameat(fromDir, name.c_str(), toDir, toName.c_str()) != 0) return fail("rename", what, errno);
  ++counts_.renames;
  return true;
}

bool Floor::migrate(const std::string& containerName) {
  const std::string containerPath = root_ + "/" + kOldContainerRoot + "/" + containerName;
  sl::UniqueFd container(
      ::openat(oldRoot_.get(), containerName.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!container) return fail("open", containerPath, errno);

  // What the container holds: the bundle is the one NAME.app.
  std::string bundleName;
  std::vector<std::string> names;
  {
    sl::UniqueFd listFd(::dup(container.get()));
    if (!listFd) return fail("dup", containerPath, errno);
    sl::UniqueDir dir = sl::fdopendir(listFd);
    if (!dir) return fail("fdopendir", containerPath, errno);
    while (const struct dirent* entry = ::readdir(dir.get())) {
      const std::string name = entry->d_name;
      if (name == "." || name == "..") continue;
      if (hasSuffix(name, ".app")) bundleName = name;
      names.push_back(name);
    }
  }
  if (bundleName.empty()) return true;  // not an application container: left for the real thing

  const sl::Dictionary info = sl::dictionaryWithContentsOfURL(
      sl::URL::fileURLWithPath(containerPath + "/" + bundleName + "/Info.plist", false));
  const sl::String identifier = info.isNull() ? sl::String() : info.get("PBBundleIdentifier").asString();
  if (identifier.isNull()) {
    std::fprintf(stderr, "sl-floor: no bundle identifier in %s/%s\n", containerPath.c_str(), bundleName.c_str());
    return false;
  }

  // The bundle and the store metadata beside it.
  std::string bundleContainer;
  sl::UniqueFd bundleFd;
  if (!makeContainer(bundleRoot_.get(), kBundleRoot, &bundleContainer, &bundleFd)) return false;
  if (!moveInto(container.get(), bundleName, bundleFd.get(), bundleName, containerPath + "/" + bundleName)) {
    return false;
  }
  const std::set<std::string> present(names.begin(), names.end());
  for (const std::string& item : SLFileManager::storeDataItemNames()) {
    if (present.count(item) != 0 && !moveInto(container.get(), item, bundleFd.get(), item, containerPath + "/" + item)) {
      return false;
    }
  }

  // The user data.
  std::string dataContainer;
  sl::UniqueFd dataFd;
  if (!makeContainer(dataRoot_.get(), kDataRoot, &dataContainer, &dataFd)) return false;
  for (const char* item : kUserDataNames) {
    if (present.count(item) != 0 && !moveInto(container.get(), item, dataFd.get(), item, containerPath + "/" + item)) {
      return false;
    }
  }

  // The groups, each moved whole with the first application that names it.
  std::string groupList;
  bool movedGroup = false;
  for (const sl::Value& value : info.get("PBApplicationGroups").asArray()) {
    const std::string group = value.asString().str();
    if (group.empty()) continue;
    if (!groupList.empty()) groupList += ",";
    groupList += group;
    if (!movedGroups_.insert(group).second) continue;
    const auto old = oldGroupPaths_.find(group);
    if (old == oldGroupPaths_.end()) continue;
    // The old groups all live in one directory (the install map's paths
    // are absolute and used as they stand).
    const std::string oldName = old->second.substr(old->second.rfind('/') + 1);
    std::string newName;
    if (!makeUUID(&newName)) return false;
    if (sl::mut::renameat(oldGroups_.get(), oldName.c_str(), groupRoot_.get(), newName.c_str()) != 0) {
      if (errno == ENOENT) continue;  // already gone: nothing to carry
      return fail("rename", old->second, errno);
    }
    ++counts_.renames;
    newGroupPaths_[group] = newName;
    movedGroup = true;
  }

  // The emptied container goes.
  if (sl::mut::unlinkat(oldRoot_.get(), containerName.c_str(), AT_REMOVEDIR) != 0) {
    return fail("rmdir", containerPath, errno);
  }
  ++counts_.removals;

  // Every directory whose entries changed, then the record.
  if (!sync(bundleFd.get(), bundleContainer) || !sync(dataFd.get(), dataContainer) ||
      !sync(bundleRoot_.get(), kBundleRoot) || !sync(dataRoot_.get(), kDataRoot) ||
      !sync(oldRoot_.get(), kOldContainerRoot)) {
    return false;
  }
  if (movedGroup && (!sync(groupRoot_.get(), kGroupRoot) || !sync(oldGroups_.get(), oldGroupsPath_))) return false;

  sqlite3_stmt* insert = insert_.get();
  sqlite3_reset(insert);
  sqlite3_bind_text(insert, 1, identifier.str().c_str(), -1, SQLITE_TRANSIENT);
  sqlite3_bind_text(insert, 2, (root_ + "/" + kBundleRoot + "/" + bundleContainer).c_str(), -1, SQLITE_TRANSIENT);
  sqlite3_bind_text(insert, 3, (root_ + "/" + kDataRoot + "/" + dataContainer).c_str(), -1, SQLITE_TRANSIENT);
  sqlite3_bind_text(insert, 4, groupList.c_str(), -1, SQLITE_TRANSIENT);
  if (sqlite3_step(insert) != SQLITE_DONE) {
    std::fprintf(stderr, "sl-floor: commit for %s failed: %s\n", identifier.str().c_str(), sqlite3_errmsg(db_.get()));
    return false;
  }
  ++counts_.commits;
  ++counts_.applications;
  return true;
}

bool Floor::run() {
  if (!openDirectory(kOldContainerRoot, false, &oldRoot_) || !openDirectory(kBundleRoot, true, &bundleRoot_) ||
      !openDirectory(kDataRoot, true, &dataRoot_) || !openDirectory(kGroupRoot, true, &groupRoot_) ||
      !openDatabase() || !readGroupMap()) {
    return false;
  }
  if (!oldGroupPaths_.empty()) {
    const std::string& any = oldGroupPaths_.begin()->second;
    oldGroupsPath_ = any.substr(0, any.rfind('/'));
    oldGroups_ = sl::UniqueFd(::open(oldGroupsPath_.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!oldGroups_) return fail("open", oldGroupsPath_, errno);
  }

  std::vector<std::string> containers;
  {
    sl::UniqueFd listFd(::dup(oldRoot_.get()));
    if (!listFd) return fail("dup", kOldContainerRoot, errno);
    sl::UniqueDir dir = sl::fdopendir(listFd);
    if (!dir) return fail("fdopendir", kOldContainerRoot, errno);
    while (const struct dirent* entry = ::readdir(dir.get())) {
      if (entry->d_type == DT_DIR && entry->d_name[0] != '.') containers.emplace_back(entry->d_name);
    }
  }
  for (const std::string& name : containers) {
    if (!migrate(name)) return false;
  }
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  std::string root;
  bool stats = false;
  bool durable = true;
  for (int i = 1; i < argc; ++i) {
    const std::string_view arg = argv[i];
    if (arg == "--root" && i + 1 < argc) {
      root = argv[++i];
    } else if (arg == "--stats") {
      stats = true;
    } else if (arg == "--no-durability") {
      durable = false;
    } else {
      std::fputs(kUsage, stderr);
      return 2;
    }
  }
  if (root.empty()) {
    std::fputs(kUsage, stderr);
    return 2;
  }
  Floor floor(root, durable);
  const bool ok = floor.run();
  if (stats) {
    const Counts& c = floor.counts();
    std::printf(
        "{\"applications\":%llu,\"renames\":%llu,\"directoriesMade\":%llu,\"removals\":%llu,\"fsyncs\":%llu,"
        "\"commits\":%llu}\n",
        static_cast<unsigned long long>(c.applications), static_cast<unsigned long long>(c.renames),
        static_cast<unsigned long long>(c.directoriesMade), static_cast<unsigned long long>(c.removals),
        static_cast<unsigned long long>(c.fsyncs), static_cast<unsigned long long>(c.commits));
  }
  return ok ? 0 : 1;
}
