// The device registry and the mount table, as disk-image discovery walks
// them.
//
// On Linux the loop driver is the disk-image controller ("DVQVAMController"):
// it exists when the sysfs tree holds a loop device. Each loop device with a
// backing file (block/loopN/loop/backing_file) is one attached image drive
// ("DVQVAMHDDrive"); the device itself and its partitions (loopNpM) are its
// media ("DVMedia"), each with the property "BSD Name" = "loopN" or
// "loopNpM". All of them hang in the service plane ("DVService"):
//
//   controller > drive loopN > medium loopN > media loopNp1, loopNp2, ...
//
// Drives come in numeric order of N, partitions in numeric order of M. Each
// entry conforms to its own class only.
//
// Handles are small non-zero integers into a table the layer owns; 0 is no
// handle. Every handle obtained (entries and iterators) must be released
// with dvObjectRelease. A machine without loop devices has no controller.
// The tree is read from sysfs when a service is looked up and when an
// iterator is made; an iterator hands out what it saw then. All functions
// may be called from any thread.
//
// The sysfs tree and the mount table are read from locations that tests can
// replace with a made-up tree (setDeviceRegistryLocations).
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "Platform/Value.h"

namespace sl {

using dv_object_t = uint32_t;
using dv_iterator_t = uint32_t;
using dv_return_t = int32_t;

inline constexpr dv_return_t kDVReturnSuccess = 0;
inline constexpr dv_return_t kDVReturnError = static_cast<dv_return_t>(0xE00002BC);
inline constexpr dv_return_t kDVReturnNoMemory = static_cast<dv_return_t>(0xE00002BD);
inline constexpr dv_return_t kDVReturnBadArgument = static_cast<dv_return_t>(0xE00002C2);

inline constexpr char kDVServicePlane[] = "DVService";
inline constexpr char kDVDiskImageControllerClass[] = "DVQVAMController";
inline constexpr char kDVDiskImageDriveClass[] = "DVQVAMHDDrive";
inline constexpr char kDVMediaClass[] = "DVMedia";
inline constexpr char kDVBSDNameKey[] = "BSD Name";
inline constexpr uint32_t kDVRegistryIterateRecursively = 0x00000001;

// Where the layer reads sysfs ("/sys" by default; it looks at
// SYSFS/block/*) and the mount table ("/proc/self/mountinfo").
void setDeviceRegistryLocations(std::string_view sysfsRoot, std::string_view mountInfoPath);

// The first service of the class (or derived from it); 0 when none.
dv_object_t dvServiceGetMatchingService(const char* className);

// An iterator over the entry's children in the plane, or with
// kDVRegistryIterateRecursively over all its descendants (depth first, each
// before its own descendants). kDVReturnBadArgument for a plane other than
// kDVServicePlane, for 0 or any handle that is not a live entry, and for a
// null `iterator`; `*iterator` is written only on success.
dv_return_t dvRegistryEntryCreateIterator(dv_object_t entry, const char* plane, uint32_t options,
                                          dv_iterator_t* iterator);

// The next entry (a new handle), or 0 when the iterator is exhausted.
dv_object_t dvIteratorNext(dv_iterator_t iterator);

// Whether the entry is of the class or derives from it.
bool dvObjectConformsTo(dv_object_t object, const char* className);

// A string property of the entry; null when it has none.
String dvRegistryEntryCopyStringProperty(dv_object_t entry, const char* key);

// Releases a handle; 0 is accepted.
void dvObjectRelease(dv_object_t object);

// The number of handles currently held, for tests that check every handle
// is released.
size_t dvOutstandingHandles();

// One mounted file system: the mounted source ("/dev/loop0") and the mount
// point, with the octal escapes of the mount table decoded.
struct MountEntry {
  std::string mntFromName;
  std::string mntOnName;
};

// The current mount table (what getmntinfo(MNT_NOWAIT) answers), in the
// order of the file; lines of another shape are passed over. An empty table
// with errno set when it cannot be read (EINVAL when it holds no mount at
// all).
std::vector<MountEntry> getmntinfo();

// The mounts that mountinfo text lists, as getmntinfo reads them (without
// its errno: an empty result is just empty).
std::vector<MountEntry> parseMountInfo(std::string_view text);

}  // namespace sl
