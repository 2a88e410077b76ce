// The registry object: opening, the schema, lookups of records, and the
// small helpers shared by the other files of this folder.

#include "Registry/EmbeddedRegistry.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>

#include "FileManager/SLFileManager.h"
#include "Platform/AtomicFile.h"
#include "Platform/Mutations.h"
#include "Platform/UniqueFd.h"
#include "Support/Errors.h"
#include "Support/Log.h"

namespace {

constexpr char kCatalogueBundleURLKey[] = "com.vantor.Stowline.bundleURL";

// Applications: one row per known application. A built-in one gets a row
// (type "System") only once its data container was made. Groups are shared
// by identifier; app_groups links them to applications. operations,
// operation_paths and operation_moves hold the intent of installs in flight
// (see EmbeddedRegistry.h); completed_installs remembers finished calls so
// that a repeated one does nothing; refused_installs remembers packages
// refused because a built-in application is not older, so that a repeated
// call whose package was half consumed gets the same refusal.
constexpr char kSchema[] = R"sql(
CREATE TABLE IF NOT EXISTS applications(
  identifier TEXT PRIMARY KEY,
  type TEXT NOT NULL,
  bundle_path TEXT NOT NULL,
  bundle_container TEXT,
  data_container TEXT UNIQUE);
CREATE TABLE IF NOT EXISTS groups(
  group_id TEXT PRIMARY KEY,
  path TEXT NOT NULL UNIQUE);
CREATE TABLE IF NOT EXISTS app_groups(
  identifier TEXT NOT NULL REFERENCES applications(identifier) ON DELETE CASCADE,
  group_id TEXT NOT NULL REFERENCES groups(group_id),
  PRIMARY KEY(identifier, group_id));
CREATE TABLE IF NOT EXISTS operations(
  id INTEGER PRIMARY KEY,
  identifier TEXT NOT NULL,
  package_path TEXT NOT NULL,
  new_bundle_container TEXT NOT NULL,
  old_bundle_container TEXT,
  done INTEGER NOT NULL DEFAULT 0);
CREATE TABLE IF NOT EXISTS operation_paths(
  operation INTEGER NOT NULL REFERENCES operations(id) ON DELETE CASCADE,
  path TEXT NOT NULL);
CREATE TABLE IF NOT EXISTS operation_moves(
  operation INTEGER NOT NULL REFERENCES operations(id) ON DELETE CASCADE,
  seq INTEGER NOT NULL,
  source TEXT NOT NULL,
  destination TEXT NOT NULL,
  PRIMARY KEY(operation, seq));
CREATE TABLE IF NOT EXISTS refused_installs(
  package_path TEXT NOT NULL,
  identifier TEXT NOT NULL,
  PRIMARY KEY(package_path, identifier));
CREATE TABLE IF NOT EXISTS completed_installs(
  package_path TEXT NOT NULL,
  identifier TEXT NOT NULL,
  PRIMARY KEY(package_path, identifier));
CREATE TABLE IF NOT EXISTS safe_harbors(
  identifier TEXT PRIMARY KEY,
  path TEXT NOT NULL,
  container_type INTEGER NOT NULL);
)sql";

// The parent of a directory URL's path, as a path.
std::string parentPath(const sl::URL& url) { return url.URLByDeletingLastPathComponent().path(); }

}  // namespace

namespace rg {

std::string makeUUID() {
  sl::UniqueFd fd(::open("/dev/urandom", O_RDONLY | O_CLOEXEC));
  if (!fd) return {};
  unsigned char bytes[16];
  size_t got = 0;
  while (got < sizeof bytes) {
    const ssize_t n = ::read(fd.get(), bytes + got, sizeof bytes - got);
    if (n <= 0) {
      if (n < 0 && errno == EINTR) continue;
      return {};
    }
    got += static_cast<size_t>(n);
  }
  bytes[6] = static_cast<unsigned char>((bytes[6] & 0x0F) | 0x40);  // version 4
  bytes[8] = static_cast<unsigned char>((bytes[8] & 0x3F) | 0x80);  // variant 1
  std::string text;
  char hex[3];
  for (size_t i = 0; i < sizeof bytes; ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) text += '-';
    std::snprintf(hex, sizeof hex, "%02X", bytes[i]);
    text += hex;
  }
  return text;
}

int compareVersions(const std::string& a, const std::string& b) {
  auto component = [](const std::string& text, size_t& position) -> unsigned long long {
    unsigned long long value = 0;
    while (position < text.size() && text[position] != '.') {
      const char c = text[position++];
      if (c < '0' || c > '9') {  // only the numeric prefix counts
        while (position < text.size() && text[position] != '.') ++position;
        break;
      }
      value = value * 10 + static_cast<unsigned>(c - '0');
    }
    if (position < text.size()) ++position;  // the dot
    return value;
  };
  size_t i = 0;
  size_t j = 0;
  while (i < a.size() || j < b.size()) {
    const unsigned long long x = component(a, i);
    const unsigned long long y = component(b, j);
    if (x != y) return x < y ? -1 : 1;
  }
  return 0;
}

}  // namespace rg

EmbeddedRegistry::EmbeddedRegistry(SLGlobalConfiguration& configuration, sl::UniqueFd lock, rg::Database db)
    : configuration_(configuration), lock_(std::move(lock)), db_(std::move(db)) {}

namespace {
// The configuration's data directory is INSTALLER_BASE/Library/Stowline: the
// installer base is two levels up.
sl::URL installerBaseOf(SLGlobalConfiguration& configuration) {
  return configuration.dataDirectoryPath().URLByDeletingLastPathComponent().URLByDeletingLastPathComponent();
}
constexpr char kRegistryDirectory[] = "/Library/Registry";
constexpr char kDatabaseName[] = "registry.sqlite";
constexpr char kLockName[] = "registry.lock";

// Opens the lock file, making it when it is missing; 0 or the errno. flock
// needs no more than a read-only descriptor. A link is not followed and
// only a regular file serves (a fifo or a device is never read).
int openLockFile(const std::string& path, sl::UniqueFd* lock) {
  sl::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!fd) {
    const int openErrno = errno;
    if (openErrno != ENOENT) return openErrno;
    // Its content and durability do not matter: lost, it is made again.
    fd = sl::UniqueFd(sl::mut::open(path.c_str(), O_RDONLY | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0644));
    if (!fd) return errno;
  }
  struct stat st;
  if (::fstat(fd.get(), &st) != 0) return errno;
  if (!S_ISREG(st.st_mode)) return S_ISDIR(st.st_mode) ? EISDIR : EINVAL;
  *lock = std::move(fd);
  return 0;
}

// Takes (or converts an exclusive lock to) the shared lock; 0 or the errno.
int lockShared(const sl::UniqueFd& lock) {
  while (::flock(lock.get(), LOCK_SH) != 0) {
    const int lockErrno = errno;
    if (lockErrno != EINTR) return lockErrno;
  }
  return 0;
}
}  // namespace

std::string EmbeddedRegistry::databasePathFor(SLGlobalConfiguration& configuration) {
  return installerBaseOf(configuration).path() + kRegistryDirectory + "/" + kDatabaseName;
}

std::shared_ptr<EmbeddedRegistry> EmbeddedRegistry::open(SLGlobalConfiguration& configuration, sl::Error* error) {
  static constexpr char kFunctionName[] = "+[EmbeddedRegistry open:error:]";
  // The bases come from the configuration: the installer base above its
  // data directory, the user base above the old container root.
  const sl::URL installerBase = installerBaseOf(configuration);
  const std::string userBase = parentPath(configuration.oldContainerPath());
  const std::string registryDirectory = installerBase.path() + kRegistryDirectory;
  const std::string bundleRoot = installerBase.path() + "/Containers/Bundle";
  const std::string dataRoot = userBase + "/Containers/Data";
  const std::string groupRoot = userBase + "/Containers/Shared";

  SLFileManager& fm = SLFileManager::defaultManager();
  for (const std::string& directory : {registryDirectory, bundleRoot, dataRoot, groupRoot}) {
    if (!fm.createDirectoryAtURL(sl::URL::fileURLWithPath(directory, true), true, 0755, error)) return nullptr;
  }
  // Recovery undoes every operation in flight, so it runs only in an open
  // that has the registry alone: an exclusive lock, granted when no other
  // registry object (here or in another process) holds its shared one. An
  // open that is not alone waits for any recovery under way, then leaves
  // the operations in flight to their owners. Locks of a killed process go
  // with it.
  const std::string lockPath = registryDirectory + "/" + kLockName;
  auto failed = [&](sl::Error record) -> std::shared_ptr<EmbeddedRegistry> {
    sl::fail(error, std::move(record));
    return nullptr;
  };
  sl::UniqueFd lock;
  if (const int openErrno = openLockFile(lockPath, &lock); openErrno != 0) {
    return failed(_CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, openErrno,
                               "Cannot open the registry's lock file %s: %s", lockPath, strerror(openErrno)));
  }
  bool alone = true;
  int lockErrno = 0;
  if (::flock(lock.get(), LOCK_EX | LOCK_NB) != 0) {
    lockErrno = errno;
    if (lockErrno == EWOULDBLOCK) {
      alone = false;
      lockErrno = lockShared(lock);
    }
  }
  if (lockErrno != 0) {
    return failed(_CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, lockErrno,
                               "Cannot lock the registry's lock file %s: %s", lockPath, strerror(lockErrno)));
  }

  const std::string databasePath = databasePathFor(configuration);
  std::optional<rg::Database> db = rg::Database::open(databasePath, error);
  if (!db) return nullptr;

  std::shared_ptr<EmbeddedRegistry> registry(new EmbeddedRegistry(configuration, std::move(lock), std::move(*db)));
  registry->databasePath_ = databasePath;
  registry->bundleRoot_ = bundleRoot;
  registry->dataRoot_ = dataRoot;
  registry->groupRoot_ = groupRoot;
  if (!registry->createSchema(error)) return nullptr;
  if (!alone) {
    std::optional<rg::Statement> count = registry->db_.prepare("SELECT COUNT(*) FROM operations", nullptr);
    const int64_t inFlight = count && count->step(nullptr) ? count->integer(0) : 0;
    if (inFlight > 0) {
      SLLog(sl::kLogLevelNotice, kFunctionName,
            "The registry at %s is open elsewhere: recovery of its operations in flight (%lld) is left to a later open",
            databasePath, static_cast<long long>(inFlight));
    }
    return registry;
  }
  sl::Error recoveryError;
  if (!registry->recover(&recoveryError)) {
    // An operation that could not be undone or finished stays recorded and
    // is tried again at the next open; the registry itself is usable.
    SLLog(sl::kLogLevelError, kFunctionName, "Recovery of the registry at %s is incomplete: %@", databasePath,
          recoveryError);
  }
  if (const int downgradeErrno = lockShared(registry->lock_); downgradeErrno != 0) {
    return failed(_CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, downgradeErrno,
                               "Cannot lock the registry's lock file %s: %s", lockPath, strerror(downgradeErrno)));
  }
  return registry;
}

bool EmbeddedRegistry::createSchema(sl::Error* error) { return db_.exec(kSchema, error); }

std::optional<EmbeddedRegistry::Record> EmbeddedRegistry::systemRecordFor(const std::string& identifier) {
  const sl::Dictionary entry = configuration_.systemAppBundleIDToInfoMap().get(identifier).asDictionary();
  if (entry.isNull()) return std::nullopt;
  Record record;
  record.identifier = identifier;
  record.type = "System";
  record.bundlePath = entry.get(kCatalogueBundleURLKey).asURL().path();
  return record;
}

std::optional<EmbeddedRegistry::Record> EmbeddedRegistry::recordFor(const std::string& identifier, sl::Error* error) {
  std::optional<rg::Statement> statement = db_.prepare(
      "SELECT type, bundle_path, bundle_container, data_container FROM applications WHERE identifier = ?", error);
  if (!statement) return std::nullopt;
  statement->bind(1, identifier);
  if (statement->step(error)) {
    Record record;
    record.identifier = identifier;
    record.type = statement->text(0).value_or("");
    record.bundlePath = statement->text(1).value_or("");
    record.bundleContainer = statement->text(2).value_or("");
    record.dataContainer = statement->text(3).value_or("");
    return record;
  }
  if (statement->failed()) return std::nullopt;
  return systemRecordFor(identifier);
}

std::vector<std::pair<std::string, std::string>> EmbeddedRegistry::groupsOf(const std::string& identifier) {
  std::vector<std::pair<std::string, std::string>> groups;
  std::optional<rg::Statement> statement = db_.prepare(
      "SELECT g.group_id, g.path FROM app_groups a JOIN groups g ON g.group_id = a.group_id "
      "WHERE a.identifier = ? ORDER BY g.group_id",
      nullptr);
  if (!statement) return groups;
  statement->bind(1, identifier);
  while (statement->step(nullptr)) groups.emplace_back(statement->text(0).value_or(""), statement->text(1).value_or(""));
  return groups;
}

bool EmbeddedRegistry::applicationIsInstalled(const sl::String& identifier) {
  std::lock_guard lock(mutex_);
  return recordFor(identifier.str(), nullptr).has_value();
}

std::string EmbeddedRegistry::dataContainerForIdentifier(const std::string& identifier) {
  static constexpr char kFunctionName[] = "-[EmbeddedRegistry dataContainerForIdentifier:]";
  std::lock_guard lock(mutex_);
  sl::Error error;
  std::optional<Record> record = recordFor(identifier, &error);
  if (!record) return {};
  if (record->dataContainer.empty()) {
    if (record->type != "System") return {};
    // Recorded first, made second: a crash in between leaves a record whose
    // directory is made on the next request, never an unnamed directory.
    const std::string uuid = rg::makeUUID();
    if (uuid.empty()) return {};
    const std::string path = dataRoot_ + "/" + uuid;
    std::optional<rg::Statement> insert = db_.prepare(
        "INSERT INTO applications(identifier, type, bundle_path, bundle_container, data_container) "
        "VALUES(?, 'System', ?, NULL, ?)",
        &error);
    if (!insert || !insert->bind(1, identifier).bind(2, record->bundlePath).bind(3, path).run(&error)) {
      SLLog(sl::kLogLevelError, kFunctionName, "Failed to record a data container for %s: %@", identifier, error);
      return {};
    }
    record->dataContainer = path;
  }
  if (record->type == "System") {
    SLFileManager& fm = SLFileManager::defaultManager();
    const sl::URL container = sl::URL::fileURLWithPath(record->dataContainer, true);
    if (!fm.itemExistsAtURL(container)) {
      for (const char* name : {"", "Documents", "Library", "tmp"}) {
        const sl::URL url = *name ? container.URLByAppendingPathComponent(name, true) : container;
        if (!fm.createDirectoryAtURL(url, true, 0755, &error)) {
          SLLog(sl::kLogLevelError, kFunctionName, "Failed to make the data container of %s: %@", identifier, error);
          return {};
        }
      }
      // Data is moved into it next: its entry must be on disk first.
      if (!sl::syncDirectory(record->dataContainer, &error) || !sl::syncDirectory(dataRoot_, &error)) {
        SLLog(sl::kLogLevelError, kFunctionName, "Failed to make the data container of %s: %@", identifier, error);
        return {};
      }
    }
  }
  return record->dataContainer;
}

std::vector<EmbeddedRegistry::Record> EmbeddedRegistry::installedApplications() {
  std::lock_guard lock(mutex_);
  std::map<std::string, Record> records;
  std::optional<rg::Statement> statement = db_.prepare(
      "SELECT identifier, type, bundle_path, bundle_container, data_container FROM applications", nullptr);
  if (!statement) return {};
  while (statement->step(nullptr)) {
    Record record{statement->text(0).value_or(""), statement->text(1).value_or(""), statement->text(2).value_or(""),
                  statement->text(3).value_or(""), statement->text(4).value_or("")};
    records.emplace(record.identifier, std::move(record));
  }
  if (statement->failed()) return {};
  // Built-in applications without a row yet (their data container was never
  // asked for).
  const sl::Dictionary builtIn = configuration_.systemAppBundleIDToInfoMap();
  for (const auto& [identifier, entry] : builtIn) {
    if (records.contains(identifier)) continue;
    if (std::optional<Record> record = systemRecordFor(identifier)) records.emplace(identifier, std::move(*record));
  }
  std::vector<Record> result;
  result.reserve(records.size());
  for (auto& [identifier, record] : records) result.push_back(std::move(record));
  return result;
}

std::vector<EmbeddedRegistry::SafeHarbor> EmbeddedRegistry::safeHarbors() {
  std::lock_guard lock(mutex_);
  std::vector<SafeHarbor> harbors;
  std::optional<rg::Statement> statement =
      db_.prepare("SELECT identifier, path, container_type FROM safe_harbors ORDER BY identifier", nullptr);
  if (!statement) return harbors;
  while (statement->step(nullptr)) {
    harbors.push_back({statement->text(0).value_or(""), statement->text(1).value_or(""),
                       static_cast<int>(statement->integer(2))});
  }
  return harbors;
}
