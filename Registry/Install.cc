// The install algorithm: validate, record the intent, do the file-system
// steps, commit the new state, clean up. See EmbeddedRegistry.h for the
// crash-safety design and Recovery.cc for what happens after a crash.

#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <set>

#include "FileManager/SLFileManager.h"
#include "Platform/AtomicFile.h"
#include "Platform/Bundle.h"
#include "Platform/Copyfile.h"
#include "Registry/EmbeddedRegistry.h"
#include "Registry/Moves.h"
#include "Support/Errors.h"
#include "Support/Log.h"

namespace {

constexpr char kFunctionName[] = "-[EmbeddedRegistry installApplication:withOptions:error:usingBlock:]";
constexpr char kApplicationGroupsKey[] = "PBApplicationGroups";
constexpr char kBundleVersionKey[] = "PBBundleVersion";
constexpr char kCatalogueBundleVersionKey[] = "PBBundleVersion";

// The real path of `path`, or empty when it cannot be resolved.
std::string realPathOf(const std::string& path) {
  const std::unique_ptr<char, decltype(&std::free)> resolved(::realpath(path.c_str(), nullptr), &std::free);
  return resolved ? std::string(resolved.get()) : std::string();
}

// Whether `path` is `directory` or lies below it (both absolute).
bool within(const std::string& path, const std::string& directory) {
  if (path.empty() || directory.empty()) return false;
  if (directory == "/") return true;
  return path.compare(0, directory.size(), directory) == 0 &&
         (path.size() == directory.size() || path[directory.size()] == '/');
}

// How a package meets the registry's own places (`own`): nullptr when it
// does not, else "lies inside" or "holds". Consuming such a package would
// remove what the registry records, so links are resolved as the removal
// would meet them: the package as named, where its name stands (its
// directory resolved; removal does not follow a link at the name), and
// where it leads (the layout is read through a link at the name).
const char* overlapWithOwnPlaces(const std::string& packagePath, const std::vector<std::string>& own) {
  std::string named = packagePath;
  while (named.size() > 1 && named.back() == '/') named.pop_back();
  const size_t slash = named.rfind('/');
  const std::string directory = slash == std::string::npos ? std::string() : realPathOf(named.substr(0, slash + 1));
  const std::string standing =
      directory.empty() ? std::string() : (directory == "/" ? "" : directory) + named.substr(slash);
  const std::string places[] = {named, standing, realPathOf(named)};
  for (const std::string& root : own) {
    for (const std::string& ownPlace : {root, realPathOf(root)}) {
      for (const std::string& place : places) {
        if (within(place, ownPlace)) return "lies inside";
        if (within(ownPlace, place)) return "holds";
      }
    }
  }
  return nullptr;
}

struct PlannedGroup {
  std::string identifier;
  std::string path;
  bool isNew = false;
};

}  // namespace

bool EmbeddedRegistry::installApplication(const sl::URL& path, const sl::Dictionary& withOptions, sl::Error* error,
                                          const RGProgressHandler& usingBlock) {
  std::lock_guard lock(mutex_);
  // The directories that the moves and new containers change are flushed
  // together, by the commit that records them (or by the removal that
  // consumes a refused package), not one by one.
  sl::DeferredSyncs deferred;
  SLFileManager& fm = SLFileManager::defaultManager();
  const std::string packagePath = path.path();

  auto report = [&](int percent, const char* status) {
    if (usingBlock) {
      usingBlock(sl::Dictionary{{RGProgressPercentCompleteKey, sl::Number(percent)},
                                {RGProgressStatusKey, sl::String(status)}});
    }
  };
  // Every refusal tells the handler before the call returns...
  auto tell = [&](const char* name, const sl::Error& record) {
    if (usingBlock) {
      usingBlock(sl::Dictionary{{RGProgressErrorKey, sl::String(name)},
                                {RGProgressErrorDescriptionKey, record.localizedDescription()},
                                {RGProgressErrorDetailKey, sl::String(packagePath)}});
    }
    return sl::fail(error, record);
  };
  // ...and consumes the package, except the refusal of a package inside the
  // registry's own layout (below), which keeps it.
  auto refuse = [&](const char* name, const sl::Error& record) {
    if (!packagePath.empty()) (void)fm.removeItemAtURL(path);
    return tell(name, record);
  };

  // A package refused because a built-in application is not older is
  // remembered before it is consumed. When that consumption was cut short
  // (the process killed while the package was being removed), the same call
  // finds a package without its application and gets the same answer, so
  // that a resumed migration hears what the first call would have said.
  auto refusedAsAlreadyInstalled = [&](const std::string& identifierText) {
    if (configuration_.systemAppBundleIDToInfoMap().get(identifierText).asDictionary().isNull()) return false;
    std::optional<rg::Statement> earlier =
        db_.prepare("SELECT 1 FROM refused_installs WHERE package_path = ? AND identifier = ?", nullptr);
    return earlier && earlier->bind(1, packagePath).bind(2, identifierText).step(nullptr);
  };
  auto refuseAgain = [&](const std::string& identifierText) {
    return refuse(RGErrorApplicationAlreadyInstalled,
                  _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGAlreadyInstalledError,
                               "The package %s for %s was refused before: the built-in application is not older",
                               packagePath, identifierText));
  };

  report(0, "Validating");
  // A package inside the registry's own layout (an installed bundle, a data
  // or group container, the database's directory) or the built-in
  // applications, or one that holds them, is refused before anything else,
  // and kept: consuming it would remove what the registry records or the
  // system ships.
  if (const char* overlap = overlapWithOwnPlaces(
          packagePath, {bundleRoot_, dataRoot_, groupRoot_, databasePath_.substr(0, databasePath_.rfind('/'))})) {
    return tell(kRGProgressErrorInvalidPackage,
                _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGInvalidPackageError,
                             "Package %s %s the registry's own containers", packagePath, overlap));
  }
  if (const char* overlap = overlapWithOwnPlaces(packagePath, {configuration_.systemAppsDirectory().path()})) {
    return tell(kRGProgressErrorInvalidPackage,
                _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGInvalidPackageError,
                             "Package %s %s the built-in applications", packagePath, overlap));
  }
  const sl::String identifierOption = withOptions.get(RGBundleIdentifierOptionKey).asString();
  if (packagePath.empty() || identifierOption.isNull()) {
    return refuse(kRGProgressErrorInvalidOptions,
                  _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGInvalidOptionsError,
                               "Install of %s names no bundle identifier under \"%s\"", packagePath,
                               RGBundleIdentifierOptionKey));
  }
  const std::string identifier = identifierOption.str();
  const sl::String packageType = withOptions.get(RGPackageTypeKey).asString();
  const bool placeholder = packageType == RGPackageTypePlaceholder;
  if (!placeholder && !(packageType == RGPackageTypeCustomer)) {
    return refuse(kRGProgressErrorInvalidOptions,
                  _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGInvalidOptionsError,
                               "Unknown package type %@ for %s", packageType, identifier));
  }

  sl::Error dbError;
  std::optional<Record> existing = recordFor(identifier, &dbError);
  if (!dbError.isNull()) return refuse(kRGProgressErrorInstallFailed, dbError);

  // Repeats nothing: the same package path and identifier of a finished
  // install succeed at once, as long as the application is still known.
  if (existing) {
    std::optional<rg::Statement> completed =
        db_.prepare("SELECT 1 FROM completed_installs WHERE package_path = ? AND identifier = ?", &dbError);
    if (!completed) return refuse(kRGProgressErrorInstallFailed, dbError);
    completed->bind(1, packagePath).bind(2, identifier);
    if (completed->step(nullptr)) {
      (void)fm.removeItemAtURL(path);
      report(100, "Complete");
      return true;
    }
  }

  // ---- The package's layout ----
  std::vector<rg::Move> moves;
  std::string bundlePath;
  std::string bundleContainer;
  const std::string uuid = rg::makeUUID();
  if (uuid.empty()) {
    return refuse(kRGProgressErrorInstallFailed, _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, EIO,
                                                               "Could not read /dev/urandom for a container name"));
  }
  bundleContainer = bundleRoot_ + "/" + uuid;
  if (placeholder) {
    // The bundle directory itself, never a link to one: the link is what
    // would be moved.
    struct stat st;
    if (::lstat(packagePath.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
      return refuse(kRGProgressErrorInvalidPackage,
                    _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGInvalidPackageError,
                                 "Placeholder package %s is not a directory", packagePath));
    }
    bundlePath = packagePath;
    moves.push_back({packagePath, bundleContainer + "/" + path.lastPathComponent()});
  } else {
    const sl::URL payload = path.URLByAppendingPathComponent("Payload", true);
    sl::Error listError;
    const std::optional<std::vector<sl::URL>> items = fm.urlsForItemsInDirectoryAtURL(payload, true, &listError);
    if (!items) {
      return refuse(kRGProgressErrorInvalidPackage,
                    _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGInvalidPackageError,
                                 "Package %s has no readable Payload directory: %@", packagePath, listError));
    }
    for (const sl::URL& item : *items) {
      const std::string extension = item.pathExtension();
      if (extension == "app") {
        if (!bundlePath.empty()) {
          return refuse(kRGProgressErrorInvalidPackage,
                        _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGInvalidPackageError,
                                     "Package %s holds more than one application", packagePath));
        }
        bundlePath = item.path();
        // The application moves first: the undo walks the moves backwards.
        moves.insert(moves.begin(), {item.path(), bundleContainer + "/" + item.lastPathComponent()});
      } else if (extension == "vpnplugin") {
        moves.push_back({item.path(), bundleContainer + "/" + item.lastPathComponent()});
      }
    }
    if (bundlePath.empty()) {
      if (refusedAsAlreadyInstalled(identifier)) return refuseAgain(identifier);
      return refuse(kRGProgressErrorInvalidPackage,
                    _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGInvalidPackageError,
                                 "Package %s holds no application in Payload", packagePath));
    }
    // Store metadata beside Payload lands beside the application.
    for (const std::string& name : SLFileManager::storeDataItemNames()) {
      const sl::URL item = path.URLByAppendingPathComponent(name, false);
      struct stat st;
      if (::lstat(item.fileSystemRepresentation(), &st) == 0) {
        moves.push_back({item.path(), bundleContainer + "/" + name});
      }
    }
  }

  // ---- The bundle ----
  const std::shared_ptr<sl::Bundle> bundle = sl::Bundle::createUnique(sl::URL::fileURLWithPath(bundlePath, true));
  const sl::Dictionary info = bundle ? bundle->infoDictionary() : sl::Dictionary();
  if (info.isNull()) {
    if (!placeholder && refusedAsAlreadyInstalled(identifier)) return refuseAgain(identifier);
    return refuse(kRGProgressErrorInvalidPackage,
                  _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGInvalidPackageError,
                               "No readable Info.plist in bundle %s", bundlePath));
  }
  const sl::String bundleIdentifier = info.get(sl::kBundleIdentifierKey).asString();
  if (!(bundleIdentifier == identifier)) {
    return refuse(kRGProgressErrorIdentifierMismatch,
                  _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGIdentifierMismatchError,
                               "Package identifier %@ does not match the option %s", bundleIdentifier, identifier));
  }
  const bool skipBlacklist = withOptions.get(RGSkipBlacklistOptionKey).asBoolean().boolValue();
  if (!skipBlacklist && SLGlobalConfiguration::installationBlacklist().count(identifier) != 0) {
    return refuse(kRGProgressErrorBlacklisted,
                  _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGBlacklistedError,
                               "%s is on the installation blacklist", identifier));
  }
  const sl::Dictionary builtIn = configuration_.systemAppBundleIDToInfoMap().get(identifier).asDictionary();
  if (!builtIn.isNull()) {
    if (placeholder) {
      return refuse(kRGProgressErrorPlaceholderRefused,
                    _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGPlaceholderRefusedError,
                                 "A placeholder is never installed over the built-in application %s", identifier));
    }
    const std::string builtInVersion = builtIn.get(kCatalogueBundleVersionKey).asString().str();
    const std::string packageVersion = info.get(kBundleVersionKey).asString().str();
    if (rg::compareVersions(builtInVersion, packageVersion) >= 0) {
      std::optional<rg::Statement> remember = db_.prepare(
          "INSERT OR IGNORE INTO refused_installs(package_path, identifier) VALUES(?, ?)", &dbError);
      if (!remember || !remember->bind(1, packagePath).bind(2, identifier).run(&dbError)) {
        return refuse(kRGProgressErrorInstallFailed, dbError);
      }
      return refuse(RGErrorApplicationAlreadyInstalled,
                    _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGAlreadyInstalledError,
                                 "The built-in %s has version %s, not older than the package's %s", identifier,
                                 builtInVersion, packageVersion));
    }
  }
  if (placeholder && existing && existing->type == "User") {
    return refuse(kRGProgressErrorPlaceholderRefused,
                  _CreateError(kFunctionName, __LINE__, RGErrorDomain, kRGPlaceholderRefusedError,
                               "A placeholder is never installed over the installed application %s", identifier));
  }

  // ---- The plan ----
  const bool newDataContainer = !existing || existing->dataContainer.empty();
  std::string dataContainer = newDataContainer ? dataRoot_ + "/" + uuid : existing->dataContainer;
  std::vector<PlannedGroup> groups;
  {
    std::set<std::string> seen;
    for (const sl::Value& value : info.get(kApplicationGroupsKey).asArray()) {
      const sl::String group = value.asString();
      if (group.isNull() || !seen.insert(group.str()).second) continue;
      PlannedGroup planned{group.str(), {}, false};
      std::optional<rg::Statement> lookup = db_.prepare("SELECT path FROM groups WHERE group_id = ?", &dbError);
      if (!lookup) return refuse(kRGProgressErrorInstallFailed, dbError);
      lookup->bind(1, planned.identifier);
      if (lookup->step(nullptr)) {
        planned.path = lookup->text(0).value_or("");
      } else {
        const std::string groupUUID = rg::makeUUID();
        if (groupUUID.empty()) {
          return refuse(kRGProgressErrorInstallFailed,
                        _CreateError(kFunctionName, __LINE__, sl::kPOSIXErrorDomain, EIO,
                                     "Could not read /dev/urandom for a container name"));
        }
        planned.path = groupRoot_ + "/" + groupUUID;
        planned.isNew = true;
      }
      groups.push_back(std::move(planned));
    }
  }
  const std::string oldBundleContainer = existing ? existing->bundleContainer : std::string();
  const std::string installedBundle = moves.front().destination;

  // ---- 2. The intent ----
  report(10, "Preparing");
  int64_t operation = 0;
  {
    // The intent names only what is still to come: the flushes of what came
    // before (the package's own making) wait for the commit of the state.
    rg::Transaction transaction(db_, &dbError, rg::Transaction::Depends::kOnNothingBefore);
    if (!transaction.began()) return refuse(kRGProgressErrorInstallFailed, dbError);
    std::optional<rg::Statement> insert = db_.prepare(
        "INSERT INTO operations(identifier, package_path, new_bundle_container, old_bundle_container) "
        "VALUES(?, ?, ?, ?)",
        &dbError);
    if (!insert || !insert->bind(1, identifier)
                         .bind(2, packagePath)
                         .bind(3, bundleContainer)
                         .bind(4, oldBundleContainer.empty() ? std::nullopt : std::optional(oldBundleContainer))
                         .run(&dbError)) {
      return refuse(kRGProgressErrorInstallFailed, dbError);
    }
    operation = db_.lastInsertRowid();
    std::vector<std::string> made;
    if (newDataContainer) made.push_back(dataContainer);
    for (const PlannedGroup& group : groups) {
      if (group.isNew) made.push_back(group.path);
    }
    for (const std::string& madePath : made) {
      std::optional<rg::Statement> row =
          db_.prepare("INSERT INTO operation_paths(operation, path) VALUES(?, ?)", &dbError);
      if (!row || !row->bind(1, operation).bind(2, madePath).run(&dbError)) {
        return refuse(kRGProgressErrorInstallFailed, dbError);
      }
    }
    for (size_t i = 0; i < moves.size(); ++i) {
      std::optional<rg::Statement> row = db_.prepare(
          "INSERT INTO operation_moves(operation, seq, source, destination) VALUES(?, ?, ?, ?)", &dbError);
      if (!row || !row->bind(1, operation)
                       .bind(2, static_cast<int64_t>(i))
                       .bind(3, moves[i].source)
                       .bind(4, moves[i].destination)
                       .run(&dbError)) {
        return refuse(kRGProgressErrorInstallFailed, dbError);
      }
    }
    if (!transaction.commit(&dbError)) return refuse(kRGProgressErrorInstallFailed, dbError);
  }

  // ---- 3. The file-system steps ----
  // A failure undoes what was done (as recovery would) and consumes the
  // package.
  // When the undo itself fails, the operation stays recorded and the package
  // is left alone: the next open finishes the undo, and removing the package
  // now would only have it brought back then.
  auto abandon = [&](const sl::Error& record) {
    sl::Error undoError;
    if (!recoverOperation(operation, false, &undoError)) {
      SLLog(sl::kLogLevelError, kFunctionName, "Failed to undo the install of %s: %@", identifier, undoError);
      return tell(kRGProgressErrorInstallFailed, record);
    }
    return refuse(kRGProgressErrorInstallFailed, record);
  };
  sl::Error fsError;
  auto makeDirectory = [&](const std::string& directory) {
    return fm.createDirectoryAtURL(sl::URL::fileURLWithPath(directory, true), false, 0755, &fsError);
  };
  report(30, "Installing");
  if (!makeDirectory(bundleContainer)) return abandon(fsError);
  if (newDataContainer) {
    for (const std::string& directory :
         {dataContainer, dataContainer + "/Documents", dataContainer + "/Library", dataContainer + "/tmp"}) {
      if (!makeDirectory(directory)) return abandon(fsError);
    }
  }
  for (const PlannedGroup& group : groups) {
    if (group.isNew && !makeDirectory(group.path)) return abandon(fsError);
  }
  for (const rg::Move& move : moves) {
    if (!rg::moveIntoContainer(move, &fsError)) return abandon(fsError);
  }
  const sl::URL installedBundleURL = sl::URL::fileURLWithPath(installedBundle, true);
  sl::Number installType = withOptions.get(RGInstallTypeKey).asNumber();
  if (installType.isNull()) installType = sl::Number(0);
  if (!fm.setInstallType(installType, installedBundleURL, &fsError)) return abandon(fsError);
  if (placeholder) {
    if (!fm.markBundleAsPlaceholder(installedBundleURL, &fsError)) return abandon(fsError);
  }

  // Everything the new state records is on disk before it is committed:
  // the containers made above, their entries, the moves and the installed
  // bundle's attributes. The flushes noted here and by the moves are made
  // by the commit. After the commit the package may go.
  {
    std::vector<std::string> durable = {bundleRoot_, bundleContainer, installedBundle};
    if (newDataContainer) {
      durable.insert(durable.end(), {dataRoot_, dataContainer});
    }
    bool newGroup = false;
    for (const PlannedGroup& group : groups) newGroup = newGroup || group.isNew;
    if (newGroup) durable.push_back(groupRoot_);
    for (const std::string& directory : durable) {
      if (!sl::syncDirectory(directory, &fsError)) return abandon(fsError);
    }
  }

  // ---- 4. The new state ----
  report(80, "Registering");
  {
    rg::Transaction transaction(db_, &dbError);
    bool ok = transaction.began();
    auto run = [&](const char* sql, std::initializer_list<std::optional<std::string>> values) {
      if (!ok) return;
      std::optional<rg::Statement> statement = db_.prepare(sql, &dbError);
      if (!statement) {
        ok = false;
        return;
      }
      int index = 1;
      for (const std::optional<std::string>& value : values) statement->bind(index++, value);
      ok = statement->run(&dbError);
    };
    run("INSERT INTO applications(identifier, type, bundle_path, bundle_container, data_container) "
        "VALUES(?1, ?2, ?3, ?4, ?5) ON CONFLICT(identifier) DO UPDATE SET type = ?2, bundle_path = ?3, "
        "bundle_container = ?4, data_container = ?5",
        {identifier, placeholder ? "Placeholder" : "User", installedBundle, bundleContainer, dataContainer});
    run("DELETE FROM app_groups WHERE identifier = ?", {identifier});
    for (const PlannedGroup& group : groups) {
      run("INSERT OR IGNORE INTO groups(group_id, path) VALUES(?, ?)", {group.identifier, group.path});
      run("INSERT INTO app_groups(identifier, group_id) VALUES(?, ?)", {identifier, group.identifier});
    }
    run("INSERT OR IGNORE INTO completed_installs(package_path, identifier) VALUES(?, ?)", {packagePath, identifier});
    run("UPDATE operations SET done = 1 WHERE id = ?", {std::to_string(operation)});
    if (ok) ok = transaction.commit(&dbError);
    if (!ok) return abandon(dbError);
  }

  // ---- 5. Cleanup ----
  report(90, "Cleaning up");
  sl::Error cleanupError;
  if (!finishOperation(operation, &cleanupError)) {
    // The new state stands; the leftovers go at the next open.
    SLLog(sl::kLogLevelError, kFunctionName, "Cleanup after installing %s is incomplete: %@", identifier,
          cleanupError);
  }
  report(100, "Complete");
  return true;
}
