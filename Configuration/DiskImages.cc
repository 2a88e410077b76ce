// SLGlobalConfiguration: the mount points of attached disk images and the
// applications directories on them.
//
// Nothing here is cached and no lock is taken: every request walks the
// device registry and reads the mount table afresh. Registry and mount-table
// failures are logged and end the request with none or an empty array.

#include <cerrno>
#include <cstring>
#include <utility>

#include "Configuration/SLGlobalConfiguration.h"
#include "Platform/DeviceRegistry.h"
#include "Platform/Format.h"
#include "Support/Log.h"

namespace {

constexpr const char* kDiskImageControllerClass = sl::kDVDiskImageControllerClass;
constexpr const char* kDiskImageDriveClass = sl::kDVDiskImageDriveClass;
constexpr const char* kMediaClass = sl::kDVMediaClass;
constexpr const char* kBSDNameKey = sl::kDVBSDNameKey;
constexpr char kDebugMountPrefix[] = "/private/var/debug_mount";

// Owns one registry handle (entry or iterator) and releases it when the
// scope ends.
class ScopedRegistryObject {
 public:
  explicit ScopedRegistryObject(sl::dv_object_t object = 0) : object_(object) {}
  ScopedRegistryObject(const ScopedRegistryObject&) = delete;
  ScopedRegistryObject& operator=(const ScopedRegistryObject&) = delete;
  ~ScopedRegistryObject() { sl::dvObjectRelease(object_); }

  sl::dv_object_t get() const { return object_; }
  explicit operator bool() const { return object_ != 0; }

 private:
  sl::dv_object_t object_;
};

}  // namespace

sl::String SLGlobalConfiguration::mountPointForDevice(sl::dv_object_t device) {
  static constexpr char kFunctionName[] = "-[SLGlobalConfiguration mountPointForDevice:]";

  std::vector<sl::MountEntry> mounts = sl::getmntinfo();
  if (mounts.empty()) {
    int mountErrno = errno;
    SLLog(sl::kLogLevelError, kFunctionName, "getmntinfo failed: %s", strerror(mountErrno));
    return nullptr;
  }

  sl::dv_iterator_t rawIterator = 0;
  if (sl::dvRegistryEntryCreateIterator(device, sl::kDVServicePlane, sl::kDVRegistryIterateRecursively,
                                        &rawIterator) != sl::kDVReturnSuccess) {
    SLLog(sl::kLogLevelError, kFunctionName, "DVRegistryEntryCreateIterator failed for deviceObj (%u)", device);
    return nullptr;
  }
  ScopedRegistryObject iterator(rawIterator);

  // The first medium below the device that is mounted, in the iterator's
  // order; for each medium the first entry of the mount table that mounts
  // its device node.
  for (;;) {
    ScopedRegistryObject descendant(sl::dvIteratorNext(iterator.get()));
    if (!descendant) return nullptr;
    if (!sl::dvObjectConformsTo(descendant.get(), kMediaClass)) continue;
    sl::String bsdName = sl::dvRegistryEntryCopyStringProperty(descendant.get(), kBSDNameKey);
    if (bsdName.isNull()) continue;
    std::string devicePath = sl::format("/dev/%@", bsdName);
    for (const sl::MountEntry& mount : mounts) {
      if (mount.mntFromName == devicePath) return sl::String(mount.mntOnName);
    }
  }
}

std::vector<sl::String> SLGlobalConfiguration::diskImageMountPoints() {
  static constexpr char kFunctionName[] = "-[SLGlobalConfiguration diskImageMountPoints]";
  std::vector<sl::String> mountPoints;

  ScopedRegistryObject controller(sl::dvServiceGetMatchingService(kDiskImageControllerClass));
  if (!controller) return mountPoints;  // no disk images on this system

  sl::dv_iterator_t rawIterator = 0;
  sl::dv_return_t status = sl::dvRegistryEntryCreateIterator(controller.get(), sl::kDVServicePlane, 0, &rawIterator);
  if (status != sl::kDVReturnSuccess) {
    SLLog(sl::kLogLevelError, kFunctionName, "unable to create controller child iterator: error 0x%08X (%d)",
          status, status);
    return mountPoints;
  }
  ScopedRegistryObject children(rawIterator);

  while (ScopedRegistryObject child{sl::dvIteratorNext(children.get())}) {
    if (sl::dvObjectConformsTo(child.get(), kDiskImageDriveClass)) {
      if (sl::String mountPoint = mountPointForDevice(child.get())) mountPoints.push_back(std::move(mountPoint));
      continue;
    }
    // Not a drive itself: at most one mount point from the drives below it,
    // the first that has one. Failing to look below it is not worth a line.
    sl::dv_iterator_t rawDescendants = 0;
    if (sl::dvRegistryEntryCreateIterator(child.get(), sl::kDVServicePlane, sl::kDVRegistryIterateRecursively,
                                          &rawDescendants) != sl::kDVReturnSuccess) {
      continue;
    }
    ScopedRegistryObject descendants(rawDescendants);
    while (ScopedRegistryObject descendant{sl::dvIteratorNext(descendants.get())}) {
      if (!sl::dvObjectConformsTo(descendant.get(), kDiskImageDriveClass)) continue;
      if (sl::String mountPoint = mountPointForDevice(descendant.get())) {
        mountPoints.push_back(std::move(mountPoint));
        break;
      }
    }
  }
  return mountPoints;
}

std::vector<sl::URL> SLGlobalConfiguration::diskImageApplicationsDirectories() {
  static constexpr char kFunctionName[] = "-[SLGlobalConfiguration diskImageApplicationsDirectories]";
  sl::URL developerApps = developerAppsDirectory();

  std::vector<sl::URL> directories;
  for (const sl::String& mountPoint : diskImageMountPoints()) {
    // A plain text prefix: "/private/var/debug_mount2" is left out too.
    if (mountPoint.view().starts_with(kDebugMountPrefix)) continue;
    directories.push_back(sl::URL::fileURLWithPath(mountPoint.view(), true)
                              .URLByAppendingPathComponent("Applications", true));
  }

  // An image mounted on the developer root already gave this directory.
  bool haveDeveloperApps = false;
  for (const sl::URL& directory : directories) {
    if (directory.path() == developerApps.path()) haveDeveloperApps = true;
  }
  if (!haveDeveloperApps) directories.push_back(developerApps);

  if (SLLogWanted(sl::kLogLevelDebug)) {
    SLLog(sl::kLogLevelDebug, kFunctionName, "returning: %@",
          sl::Array(std::vector<sl::Value>(directories.begin(), directories.end())));
  }
  return directories;
}
