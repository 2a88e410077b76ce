// The names of the old layout and of the migrator's records: file names
// inside the old container root and the installer data directory, and the
// keys of container records, markers and maps. The migrator and the tools
// that read the same layout (plan, fixture) share them.
#pragma once

namespace sl::migrator {

// Container record and migration marker.
inline constexpr char kContainerPathKey[] = "ContainerPath";
inline constexpr char kBundlePathKey[] = "BundlePath";
inline constexpr char kContainerTypeKey[] = "ContainerType";
inline constexpr char kBundleIdentifierKey[] = "BundleIdentifier";
inline constexpr char kSecondBundlePathKey[] = "SecondBundlePath";
inline constexpr char kContainerTypeApp[] = "App";
inline constexpr char kContainerTypeVPNBundle[] = "VPNBundle";

// The marker family: file names directly inside an old container.
inline constexpr char kMigrationMarkerName[] = "com.vantor.stowline.container_migrator.plist";
inline constexpr char kMigrationMarkerFlagName[] = "com.vantor.stowline.migration_marker";
inline constexpr char kPlaceholderFlagName[] = "com.vantor.stowline.placeholder";

// The staging layout inside an old container.
inline constexpr char kStagingDirectoryName[] = "Staging";
inline constexpr char kPayloadDirectoryName[] = "Payload";

// The old container root's note, deleted by the migration.
inline constexpr char kWhereDidMyApplicationsGoName[] = "WhereDidMyApplicationsGo.txt";

// The old install map: "GroupContainers" -> group id -> { "Container": path }.
inline constexpr char kGroupContainersKey[] = "GroupContainers";
inline constexpr char kGroupContainerPathKey[] = "Container";

// In the installer data directory.
inline constexpr char kSafeHarborMapName[] = "SafeHarbor.plist";
inline constexpr char kHarborPathKey[] = "HarborPathKey";
inline constexpr char kLastSystemVersionFileName[] = "AppMigratorLastSystemVersion.plist";

}  // namespace sl::migrator
