// SLAppMigrator: the application-migration plug-in's migrator.
//
// The host makes one instance through the plug-in's entry point (which runs
// init), may ask for dataClassName, estimatedDuration and migrationProgress
// at any time (migrationProgress from another thread too), and calls
// performMigration once. The migrator carries every old per-application
// container into the new layout that the application registry hands out,
// leaving a migration marker in each container first so that an interrupted
// run resumes on the next one.
//
// Operations return a boolean and write their own failures to the host log
// (category "Movanta"; every message begins with "SLAppMigrator: "); error
// records received from the layers below are written into those lines and
// not passed on. Every path comes from SLGlobalConfiguration, every file
// operation goes through SLFileManager, and the registry is reached only
// through the interfaces in Platform/ApplicationRegistry.h and
// Platform/InstallerLibrary.h.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <vector>

#include "Platform/Bundle.h"
#include "Platform/HostLog.h"
#include "Platform/MigrationHost.h"
#include "Platform/URL.h"
#include "Platform/Value.h"

// Writes one host-log line under the calling function's documented name.
#define SLMigratorLog(level, function, ...) \
  ::sl::hostLog(__FILE__, function, __LINE__, "Movanta", level, __VA_ARGS__)

class SLAppMigrator final : public DataClassMigrator {
 public:
  // Makes a migrator and runs init; null when init yields null.
  static std::unique_ptr<SLAppMigrator> create();

  sl::String dataClassName() override;
  float estimatedDuration() override;
  float migrationProgress() override;
  bool performMigration() override;

 private:
  SLAppMigrator() = default;

  // Start-up state: lists the old container root and reads the maps. False
  // when the instance must not be handed out.
  bool init();

  // The passes of performMigration, which keeps any exception from the host.
  bool runPasses();

  // Introspection and the marker.
  sl::Dictionary _introspectContainer(const sl::URL& url, bool* orderResultEarly);
  sl::String _bundleIdentifierForBundle(const sl::URL& bundle);
  sl::Dictionary _loadAndValidateMigrationMarkerAtURL(const sl::URL& url);

  // One container.
  bool _migrateContainerWithInfo(const sl::Dictionary& info);
  bool _containerHasMissedItems(const sl::URL& container, const sl::String& withIdentifier);

  // Safe harbors.
  bool _migrateSafeHarbors();

  // Data, bundle, placeholder and group containers.
  bool _migrateDataContainerForIdentifier(const sl::String& identifier, const sl::URL& fromURL, const sl::URL& toURL);
  bool _stageAndInstallBundleAtURL(const sl::URL& bundle, const sl::String& withIdentifier,
                                   const sl::URL& andVPNPluginAtURL, const sl::URL& inContainerURL);
  bool _stageAndInstallPlaceholderForBundleAtURL(const sl::URL& bundle, const sl::String& withIdentifier,
                                                 const sl::URL& inContainerURL);
  bool _writeIconForBundle(const sl::Bundle& bundle, const sl::URL& toURL);
  bool _migrateGroupContainersForIdentifier(const sl::String& identifier);
  bool _moveAllItemsInGroupContainerURL(const sl::URL& url, const sl::URL& toGroupContainerURL);

  // Items of the old container root dealt with so far. Only performMigration
  // changes it, always by one; the host may read it from another thread
  // while the migration runs.
  std::atomic<uint64_t> _countItemsMigrated{0};
  // The entries of the old container root found by init, links left out;
  // absent when the root did not exist or was empty.
  std::optional<std::vector<sl::URL>> _itemsToMigrate;
  sl::Dictionary _installMap;
  sl::Dictionary _harborMap;
  // Group identifier -> { "Container": old path }; entries leave as their
  // groups are migrated.
  sl::Dictionary _groupContainerMap;
  sl::String _lastSystemBuildVersion;

  friend class SLAppMigratorTestAccess;
};
