#include "Platform/DeviceRegistry.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <string>
#include <vector>

#include "TestSupport/TestSupport.h"

namespace {

using sl::test::makeDirs;
using sl::test::writeFile;

// Points the registry at a made-up tree and mount table for the scope.
struct ScopedLocations {
  explicit ScopedLocations(const std::string& dir) { sl::setDeviceRegistryLocations(dir + "/sys", dir + "/mountinfo"); }
  ~ScopedLocations() { sl::setDeviceRegistryLocations("/sys", "/proc/self/mountinfo"); }
};

// Each entry of the walk as "CLASS" or "CLASS BSDNAME"; every handle released.
std::vector<std::string> walk(sl::dv_object_t entry, uint32_t options) {
  std::vector<std::string> seen;
  sl::dv_iterator_t iterator = 0;
  EXPECT_EQ(sl::dvRegistryEntryCreateIterator(entry, sl::kDVServicePlane, options, &iterator), sl::kDVReturnSuccess);
  while (sl::dv_object_t object = sl::dvIteratorNext(iterator)) {
    sl::String name = sl::dvRegistryEntryCopyStringProperty(object, "BSD Name");
    for (const char* cls : {"DVQVAMController", "DVQVAMHDDrive", "DVMedia"}) {
      if (sl::dvObjectConformsTo(object, cls)) seen.push_back(cls + (name ? " " + name.str() : ""));
    }
    sl::dvObjectRelease(object);
  }
  sl::dvObjectRelease(iterator);
  return seen;
}

TEST(DeviceRegistryTest, LoopDevicesAreControllerDrivesAndMedia) {
  sl::test::TempDir tmp;
  const std::string block = tmp / "sys/block";
  makeDirs(block + "/vda");
  makeDirs(block + "/loopback");  // not a loop device
  ScopedLocations locations(tmp.path());
  const size_t handlesBefore = sl::dvOutstandingHandles();

  EXPECT_EQ(sl::dvServiceGetMatchingService("DVQVAMController"), 0u);  // no loop device yet

  // Drives and partitions in numeric order; loop1 has nothing attached,
  // loop2 an empty backing file.
  writeFile(block + "/loop0/loop/backing_file", "/images/a.img\n");
  for (const char* p : {"loop0p2", "loop0p10", "loop0p1", "loop0p1x"}) makeDirs(block + "/loop0/" + p);
  makeDirs(block + "/loop1/queue");
  writeFile(block + "/loop2/loop/backing_file", "\n");
  writeFile(block + "/loop10/loop/backing_file", "/images/c.img\n");
  writeFile(block + "/loop9/loop/backing_file", "/images/b.img\n");

  sl::dv_object_t controller = sl::dvServiceGetMatchingService("DVQVAMController");
  ASSERT_NE(controller, 0u);
  EXPECT_EQ(walk(controller, 0), (std::vector<std::string>(3, "DVQVAMHDDrive")));
  EXPECT_EQ(walk(controller, sl::kDVRegistryIterateRecursively),
            (std::vector<std::string>{"DVQVAMHDDrive", "DVMedia loop0", "DVMedia loop0p1", "DVMedia loop0p2",
                                      "DVMedia loop0p10", "DVQVAMHDDrive", "DVMedia loop9", "DVQVAMHDDrive",
                                      "DVMedia loop10"}));

  // Bad arguments; an iterator keeps the drives it saw when it was made.
  sl::dv_iterator_t iterator = 0;
  EXPECT_EQ(sl::dvRegistryEntryCreateIterator(controller, "DVDevice", 0, &iterator), sl::kDVReturnBadArgument);
  EXPECT_EQ(sl::dvRegistryEntryCreateIterator(0, sl::kDVServicePlane, 0, &iterator), sl::kDVReturnBadArgument);
  ASSERT_EQ(sl::dvRegistryEntryCreateIterator(controller, sl::kDVServicePlane, 0, &iterator), sl::kDVReturnSuccess);
  sl::test::forceRemove(block + "/loop9/loop");
  EXPECT_EQ(walk(controller, 0).size(), 2u);
  size_t handedOut = 0;
  for (; sl::dv_object_t drive = sl::dvIteratorNext(iterator); ++handedOut) sl::dvObjectRelease(drive);
  EXPECT_EQ(handedOut, 3u);
  sl::dvObjectRelease(iterator);
  sl::dvObjectRelease(controller);
  EXPECT_EQ(sl::dvOutstandingHandles(), handlesBefore);
}

}  // namespace
