// Group container migration: the content of each old group container that
// an installed application belongs to moves into the group container the
// registry assigned, and the old directory goes.
//
// _groupContainerMap (group identifier -> { "Container": old path }) only
// shrinks: a group leaves it once its content has moved, so a group shared
// by several applications moves with the first of them.

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "AppMigrator/OldLayout.h"
#include "AppMigrator/AppMigrator.h"
#include "FileManager/SLFileManager.h"
#include "Platform/ApplicationRegistry.h"

namespace {

constexpr char kMigrateGroupsFunctionName[] = "-[SLAppMigrator _migrateGroupContainersForIdentifier:]";
constexpr char kMoveItemsFunctionName[] = "-[SLAppMigrator _moveAllItemsInGroupContainerURL:toGroupContainerURL:]";
using sl::migrator::kGroupContainerPathKey;

}  // namespace

bool SLAppMigrator::_migrateGroupContainersForIdentifier(const sl::String& identifier) {
  if (_groupContainerMap.isNull() || _groupContainerMap.isEmpty()) return true;

  const std::shared_ptr<RGBundleProxy> proxy = RGBundleProxy::bundleProxyForIdentifier(identifier);
  if (!proxy) {
    SLMigratorLog(sl::kLogLevelError, kMigrateGroupsFunctionName, "SLAppMigrator: Failed to get bundle proxy for %@",
                  identifier);
    return false;
  }
  const sl::Dictionary groups = proxy->groupContainerURLs();
  if (groups.isNull()) {
    SLMigratorLog(sl::kLogLevelError, kMigrateGroupsFunctionName,
                  "SLAppMigrator: Failed to get group container URLs for installed %@", identifier);
    return false;
  }
  if (groups.isEmpty()) {
    SLMigratorLog(sl::kLogLevelNotice, kMigrateGroupsFunctionName,
                  "SLAppMigrator: No group containers to migrate for %@", identifier);
    return true;
  }

  SLFileManager& fm = SLFileManager::defaultManager();
  // No group's trouble ends the walk or changes the result: what could not
  // move stays in place, with its map entry, for the next run.
  for (const auto& [groupName, newValue] : groups) {
    const sl::String group(groupName);
    const sl::Dictionary entry = _groupContainerMap.get(groupName).asDictionary();
    if (entry.isNull()) {
      SLMigratorLog(sl::kLogLevelNotice, kMigrateGroupsFunctionName,
                    "SLAppMigrator: No group container entry to migrate for %@[%@]", identifier, group);
      continue;
    }
    const sl::String oldPath = entry.get(kGroupContainerPathKey).asString();
    if (oldPath.isNull()) {
      SLMigratorLog(sl::kLogLevelNotice, kMigrateGroupsFunctionName,
                    "SLAppMigrator: Failed to get path to group container for %@[%@]", identifier, group);
      continue;
    }
    const sl::URL oldURL = sl::URL::fileURLWithPath(oldPath.view(), true);
    if (!fm.itemExistsAtURL(oldURL)) {
      SLMigratorLog(sl::kLogLevelError, kMigrateGroupsFunctionName,
                    "SLAppMigrator: Missing source group container at %@", oldURL);
      continue;
    }
    // The registry answers URLs; a plain path is taken as one.
    sl::URL newURL = newValue.asURL();
    if (newURL.isNull()) newURL = sl::URL::fileURLWithPath(newValue.asString().view(), true);

    SLMigratorLog(sl::kLogLevelNotice, kMigrateGroupsFunctionName,
                  "SLAppMigrator: Migrating group container %@ at %@ to %@", group, oldURL, newURL);
    if (!_moveAllItemsInGroupContainerURL(oldURL, newURL)) continue;

    _groupContainerMap.remove(groupName);
    sl::Error error;
    if (!fm.removeItemAtURL(oldURL, &error)) {
      SLMigratorLog(sl::kLogLevelError, kMigrateGroupsFunctionName,
                    "SLAppMigrator: Failed to remove old group container at %@ : %@", oldURL, error);
    }
  }
  return true;
}

bool SLAppMigrator::_moveAllItemsInGroupContainerURL(const sl::URL& url, const sl::URL& toGroupContainerURL) {
  SLFileManager& fm = SLFileManager::defaultManager();
  sl::Error error;
  const std::optional<std::vector<sl::URL>> items = fm.urlsForItemsInDirectoryAtURL(url, false, &error);
  if (!items) {
    SLMigratorLog(sl::kLogLevelError, kMoveItemsFunctionName,
                  "SLAppMigrator: Failed to get all urls in source group container %@ : %@", url, error);
    return false;
  }

  // Every item is tried even after one fails. The answer is false when any
  // item stayed behind: the caller removes the old group container after a
  // true answer, and that would delete what could not be moved. Reporting
  // false keeps the old directory and its map entry for the next run.
  bool movedAll = true;
  for (const sl::URL& item : *items) {
    const sl::URL destination =
        toGroupContainerURL.URLByAppendingPathComponent(item.lastPathComponent(), item.isDirectory());
    // The old item wins: whatever the new container holds under its name
    // goes first. Should that fail, the move below reports it.
    (void)fm.removeItemAtURL(destination);
    if (!fm.moveItemIfExistsAtURL(item, destination, &error)) {
      SLMigratorLog(sl::kLogLevelError, kMoveItemsFunctionName, "SLAppMigrator: Failed to move item %@ to %@ : %@",
                    item, destination, error);
      movedAll = false;
    }
  }
  return movedAll;
}
