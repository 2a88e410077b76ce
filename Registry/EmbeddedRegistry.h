// The embedded application registry: RGApplicationWorkspace and
// SLInstallerLibrary on one SQLite database, owning the new layout.
//
// Layout below the system root (the bases come from the configuration the
// registry is opened with):
//   ROOT/private/var/stowd/Library/Registry/registry.sqlite   the database
//   ROOT/private/var/stowd/Library/Registry/registry.lock     held by every open registry
//   ROOT/private/var/stowd/Containers/Bundle/<UUID>/NAME.app   bundle containers
//   ROOT/private/var/mobile/Containers/Data/<UUID>/            data containers
//   ROOT/private/var/mobile/Containers/Shared/<UUID>/          group containers
// UUIDs are random (8-4-4-4-12, uppercase hex).
//
// Crash safety. Every install writes its intent before it touches the file
// system: one transaction records a pending operation with every path it
// will create and every move it will make. Then come the file-system steps,
// then one transaction that records the new state and marks the operation
// done, then the cleanup (the replaced bundle container, the package), and
// finally the operation row goes. Opening the registry runs recovery (when
// no other registry object has it open, below): an operation not marked
// done is undone (bundles moved back into the package, never through a
// link in it, see rg::undoMove; the containers it made removed: they hold
// no user data yet, since data is moved in only after the install
// returned), one marked done is finished (its cleanup repeated). Every
// recovery step can be repeated.
//
// Durability. The database commits with synchronous=FULL in WAL mode, and
// no commit reaches the disk before the file-system changes it may depend
// on: an install defers the flushes of its moves and new containers
// (sl::DeferredSyncs), and the database's commit hook makes them, one
// syncfs per file system, before the commit is written; a failed flush
// rolls the commit back. Only the deletion of a finished operation commits
// without a flush of its own: lost to a power cut, it costs a repeat of the
// cleanup at the next open.
//
// A cross-volume move copies the bundle into a temporary name inside the
// new bundle container, renames it into place, then renames the source to a
// trash name beside it (".NAME.rgtrash") and removes that. So a source that
// is present is always whole, and undoing a move whose source is gone copies
// the bundle back the same way.
//
// Threads and processes: one mutex serialises every call on one registry
// object; two objects, in one process or two, share the database safely
// (SQLite locks). Every object holds a shared flock on "registry.lock"
// beside the database for its whole life, and recovery runs only in an open
// that first gets that lock exclusively, that is with no other object open:
// an operation in flight may otherwise belong to a live install, which
// recovery would undo under it. An open that is not alone leaves the
// operations in flight to a later open that is (a notice says how many).
// Installs from two objects into one root at once are still not supported.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "Configuration/SLGlobalConfiguration.h"
#include "Platform/ApplicationRegistry.h"
#include "Platform/InstallerLibrary.h"
#include "Platform/UniqueFd.h"
#include "Registry/Database.h"

// Codes of RGErrorDomain.
inline constexpr int64_t kRGDatabaseError = 1;          // SQLite failed
inline constexpr int64_t kRGInvalidOptionsError = 2;    // missing identifier, unknown package type
inline constexpr int64_t kRGInvalidPackageError = 3;    // no bundle, no readable Info.plist
inline constexpr int64_t kRGIdentifierMismatchError = 4;
inline constexpr int64_t kRGBlacklistedError = 5;
inline constexpr int64_t kRGAlreadyInstalledError = 6;  // a built-in application is as new or newer
inline constexpr int64_t kRGPlaceholderRefusedError = 7;  // over a built-in or an installed application

// The names under RGProgressErrorKey for refusals other than
// RGErrorApplicationAlreadyInstalled.
inline constexpr char kRGProgressErrorInvalidOptions[] = "InvalidOptions";
inline constexpr char kRGProgressErrorInvalidPackage[] = "InvalidPackage";
inline constexpr char kRGProgressErrorIdentifierMismatch[] = "IdentifierMismatch";
inline constexpr char kRGProgressErrorBlacklisted[] = "Blacklisted";
inline constexpr char kRGProgressErrorPlaceholderRefused[] = "PlaceholderRefused";
inline constexpr char kRGProgressErrorInstallFailed[] = "InstallFailed";

class EmbeddedRegistry : public RGApplicationWorkspace,
                         public SLInstallerLibrary,
                         public std::enable_shared_from_this<EmbeddedRegistry> {
 public:
  // Opens (creating) the registry of the layout that `configuration`
  // describes and, when no other registry object has it open, runs
  // recovery. The configuration must outlive the registry; the built-in
  // applications are its system catalogue. Null on failure, also when the
  // lock file cannot be opened or locked ("Cannot open the registry's lock
  // file PATH: ...", "Cannot lock the registry's lock file PATH: ...").
  static std::shared_ptr<EmbeddedRegistry> open(SLGlobalConfiguration& configuration, sl::Error* error);

  // Where the database of that layout lives; computes only, creates nothing.
  static std::string databasePathFor(SLGlobalConfiguration& configuration);

  // ---- RGApplicationWorkspace ----
  bool applicationIsInstalled(const sl::String& identifier) override;
  // Every refused install consumes its package, except one of a package
  // that lies inside the registry's own layout or holds it ("Package PATH
  // lies inside the registry's own containers", "... holds ...";
  // kRGInvalidPackageError), which is kept: it is what the registry records.
  bool installApplication(const sl::URL& path, const sl::Dictionary& withOptions, sl::Error* error,
                          const RGProgressHandler& usingBlock) override;
  using RGApplicationWorkspace::installApplication;
  std::shared_ptr<RGBundleProxy> bundleProxyForIdentifier(const sl::String& identifier) override;

  // ---- SLInstallerLibrary ----
  bool registerSafeHarbor(const sl::String& path, const sl::String& identifier, int containerType,
                          sl::Error* error) override;
  bool updateContainerDataProtection(const sl::Dictionary& options) override;

  // ---- Layout ----
  const std::string& databasePath() const { return databasePath_; }
  const std::string& bundleContainersRoot() const { return bundleRoot_; }
  const std::string& dataContainersRoot() const { return dataRoot_; }
  const std::string& groupContainersRoot() const { return groupRoot_; }

  // The safe harbor recorded for `identifier`: (path, container type).
  std::optional<std::pair<std::string, int>> safeHarborForIdentifier(const std::string& identifier);

  // ---- Enumeration (read only: nothing is made or recorded) ----
  struct Record;  // one application row (Proxy.cc, Install.cc)
  struct SafeHarbor {
    std::string identifier;
    std::string path;
    int containerType = 0;
  };
  // Every application the registry knows, built-in ones included (a
  // built-in one whose data container was never asked for has none yet), in
  // identifier order. Empty when the database cannot be read.
  std::vector<Record> installedApplications();
  // Every recorded safe harbor, in identifier order.
  std::vector<SafeHarbor> safeHarbors();

  // The data container of an application, made (and recorded) on first
  // request for a built-in one; empty when unknown. Used by the proxies.
  std::string dataContainerForIdentifier(const std::string& identifier);

 private:
  EmbeddedRegistry(SLGlobalConfiguration& configuration, sl::UniqueFd lock, rg::Database db);

  bool createSchema(sl::Error* error);
  bool recover(sl::Error* error);  // Recovery.cc
  bool recoverOperation(int64_t operation, bool done, sl::Error* error);
  bool finishOperation(int64_t operation, sl::Error* error);

  std::optional<Record> recordFor(const std::string& identifier, sl::Error* error);
  std::optional<Record> systemRecordFor(const std::string& identifier);
  std::vector<std::pair<std::string, std::string>> groupsOf(const std::string& identifier);

  SLGlobalConfiguration& configuration_;
  // The lock file, locked shared; declared before db_ so that the lock
  // outlives the connection.
  sl::UniqueFd lock_;
  rg::Database db_;
  std::recursive_mutex mutex_;
  std::string databasePath_;
  std::string bundleRoot_;
  std::string dataRoot_;
  std::string groupRoot_;

  friend class InstallOperation;
};

struct EmbeddedRegistry::Record {
  std::string identifier;
  std::string type;             // "User", "Placeholder" or "System"
  std::string bundlePath;
  std::string bundleContainer;  // empty for a built-in application
  std::string dataContainer;    // empty while a built-in one has none
};

namespace rg {

// A new random container name, 8-4-4-4-12 uppercase hex; empty when
// /dev/urandom cannot be read.
std::string makeUUID();

// Dot-separated numeric version comparison: <0, 0, >0. Missing components
// count as 0, and the numeric prefix of each component is compared.
int compareVersions(const std::string& a, const std::string& b);

}  // namespace rg
