// The device registry over sysfs, and the mount table over mountinfo.
//
// The registry is a tree that is read from sysfs whenever it is asked:
//
//   controller                      when SYSFS/block holds a loopN directory
//     drive loopN                   each loop device with a backing file
//       medium loopN                the device itself, "BSD Name" loopN
//         medium loopNpM            its partitions, "BSD Name" loopNpM
//
// Drives come in numeric order of N, partitions in numeric order of M. A
// handle names one node of that tree by what it is (kind and device name),
// not by a sysfs descriptor, so a handle holds nothing open; an iterator
// takes a snapshot of the nodes below its entry when it is made.
//
// SYSFS/block/loopN are symbolic links into SYSFS/devices on a real system:
// they are followed. sysfs is the kernel's own tree, so following its links
// cannot lead anywhere an attacker chose.

#include "Platform/DeviceRegistry.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <mutex>
#include <optional>
#include <string>
#include <utility>

#include "Platform/UniqueFd.h"

namespace sl {

namespace {

constexpr char kDefaultSysfsRoot[] = "/sys";
constexpr char kDefaultMountInfoPath[] = "/proc/self/mountinfo";

constexpr const char* kControllerClass = kDVDiskImageControllerClass;
constexpr const char* kDriveClass = kDVDiskImageDriveClass;
constexpr const char* kMediaClass = kDVMediaClass;
constexpr const char* kBSDNameKey = kDVBSDNameKey;

enum class Kind : uint8_t { Controller, Drive, WholeMedium, Partition };

// One node of the registry tree. `name` is the device name ("loop0",
// "loop0p1"; empty for the controller), `sysfsRoot` the tree it was found in,
// so that a handle keeps answering from that tree even when the locations
// change while it is held.
struct Node {
  Kind kind;
  std::string name;
  std::string sysfsRoot;
};

// A slot of the handle table: free, an entry, or an iterator with the
// snapshot it hands out and the position of the next entry.
struct Slot {
  enum class Use : uint8_t { Free, Entry, Iterator } use = Use::Free;
  Node node{};
  std::vector<Node> pending;
  size_t next = 0;
};

// Everything the layer keeps between calls, guarded by one mutex. Never
// destroyed, so that handles may be released from other statics' teardown.
struct State {
  std::mutex mutex;
  std::string sysfsRoot = kDefaultSysfsRoot;
  std::string mountInfoPath = kDefaultMountInfoPath;
  std::vector<Slot> slots;  // handle h lives in slots[h - 1]
  size_t outstanding = 0;
};

State& state() {
  static State* const instance = new State();
  return *instance;
}

// Takes a free slot (the lowest, so handles stay small) and returns its
// handle. The caller holds the mutex.
uint32_t allocateLocked(State& s, Slot slot) {
  auto it = std::find_if(s.slots.begin(), s.slots.end(), [](const Slot& x) { return x.use == Slot::Use::Free; });
  if (it == s.slots.end()) it = s.slots.insert(s.slots.end(), Slot());
  *it = std::move(slot);
  ++s.outstanding;
  return static_cast<uint32_t>(it - s.slots.begin()) + 1;
}

uint32_t newEntryHandle(Node node) {
  State& s = state();
  Slot slot;
  slot.use = Slot::Use::Entry;
  slot.node = std::move(node);
  std::lock_guard<std::mutex> guard(s.mutex);
  return allocateLocked(s, std::move(slot));
}

// The slot of a handle that is in use; null for 0, an unknown or a released
// handle. The caller holds the mutex.
Slot* slotLocked(State& s, uint32_t handle) {
  if (handle == 0 || handle > s.slots.size()) return nullptr;
  Slot& slot = s.slots[handle - 1];
  return slot.use == Slot::Use::Free ? nullptr : &slot;
}

// The node an entry handle names; none for anything else.
std::optional<Node> entryNode(uint32_t handle) {
  State& s = state();
  std::lock_guard<std::mutex> guard(s.mutex);
  Slot* slot = slotLocked(s, handle);
  if (slot == nullptr || slot->use != Slot::Use::Entry) return std::nullopt;
  return slot->node;
}

// N when `name` is `prefix` followed by decimal digits (and nothing else).
std::optional<unsigned> numberAfter(std::string_view name, std::string_view prefix) {
  if (!name.starts_with(prefix) || name.size() == prefix.size()) return std::nullopt;
  std::string_view digits = name.substr(prefix.size());
  unsigned value = 0;  // from_chars takes no sign for an unsigned type
  auto [end, ec] = std::from_chars(digits.data(), digits.data() + digits.size(), value);
  if (ec != std::errc() || end != digits.data() + digits.size()) return std::nullopt;
  return value;
}

// The names of the directories in `dirFd` (links to directories included)
// that are `prefix` followed by a number, in numeric order. An unreadable
// directory has none.
std::vector<std::string> numberedDirectories(UniqueFd dirFd, std::string_view prefix) {
  std::vector<std::pair<unsigned, std::string>> found;
  if (!dirFd) return {};
  int fd = dirFd.get();  // stays open as long as the stream below
  UniqueDir dir = fdopendir(dirFd);
  if (!dir) return {};
  while (const dirent* entry = ::readdir(dir.get())) {
    std::optional<unsigned> number = numberAfter(entry->d_name, prefix);
    if (!number) continue;
    struct stat st;
    if (::fstatat(fd, entry->d_name, &st, 0) != 0 || !S_ISDIR(st.st_mode)) continue;
    found.emplace_back(*number, entry->d_name);
  }
  std::sort(found.begin(), found.end());
  std::vector<std::string> names;
  names.reserve(found.size());
  for (auto& [number, name] : found) names.push_back(std::move(name));
  return names;
}

UniqueFd openDirectory(const std::string& path) {
  return UniqueFd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

// The loop devices of the tree: SYSFS/block/loopN, in numeric order.
std::vector<std::string> loopDevices(const std::string& sysfsRoot) {
  return numberedDirectories(openDirectory(sysfsRoot + "/block"), "loop");
}

// Whether SYSFS/block/NAME/loop/backing_file holds anything but blanks: the
// kernel keeps that file only while a file is attached, and writes its path
// followed by a newline.
bool hasBackingFile(const std::string& sysfsRoot, const std::string& name) {
  std::string path = sysfsRoot + "/block/" + name + "/loop/backing_file";
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) return false;
  char buffer[256];
  ssize_t n;
  do {
    n = ::read(fd.get(), buffer, sizeof buffer);
  } while (n < 0 && errno == EINTR);
  for (ssize_t i = 0; i < n; ++i) {
    if (buffer[i] != '\n' && buffer[i] != ' ' && buffer[i] != '\t') return true;
  }
  return false;
}

const char* classOf(Kind kind) {
  switch (kind) {
    case Kind::Controller: return kControllerClass;
    case Kind::Drive: return kDriveClass;
    case Kind::WholeMedium:
    case Kind::Partition: return kMediaClass;
  }
  return "";
}

// The nodes one level below `node`, read from its tree now.
std::vector<Node> childrenOf(const Node& node) {
  std::vector<Node> children;
  switch (node.kind) {
    case Kind::Controller:
      for (std::string& name : loopDevices(node.sysfsRoot)) {
        if (hasBackingFile(node.sysfsRoot, name)) children.push_back({Kind::Drive, std::move(name), node.sysfsRoot});
      }
      break;
    case Kind::Drive:
      children.push_back({Kind::WholeMedium, node.name, node.sysfsRoot});
      break;
    case Kind::WholeMedium:
      for (std::string& name : numberedDirectories(openDirectory(node.sysfsRoot + "/block/" + node.name),
                                                   node.name + "p")) {
        children.push_back({Kind::Partition, std::move(name), node.sysfsRoot});
      }
      break;
    case Kind::Partition:
      break;
  }
  return children;
}

// Every node below `node`, depth first, each before its own descendants.
void appendDescendants(const Node& node, std::vector<Node>& out) {
  for (Node& child : childrenOf(node)) {
    out.push_back(std::move(child));
    appendDescendants(out.back(), out);
  }
}

std::string currentSysfsRoot() {
  State& s = state();
  std::lock_guard<std::mutex> guard(s.mutex);
  return s.sysfsRoot;
}

// Decodes the octal escapes (\040 for a blank, \011, \012, \134) with which
// the kernel writes blanks and backslashes in mountinfo fields. A backslash
// that does not start three octal digits stays as it is.
std::string decodeMountField(std::string_view field) {
  auto isOctal = [](char c) { return c >= '0' && c <= '7'; };
  std::string out;
  out.reserve(field.size());
  for (size_t i = 0; i < field.size(); ++i) {
    if (field[i] == '\\' && i + 3 < field.size() && isOctal(field[i + 1]) && isOctal(field[i + 2]) &&
        isOctal(field[i + 3])) {
      int value = (field[i + 1] - '0') * 64 + (field[i + 2] - '0') * 8 + (field[i + 3] - '0');
      out += static_cast<char>(value & 0xFF);
      i += 3;
    } else {
      out += field[i];
    }
  }
  return out;
}

// One mountinfo line:
//   ID PARENT MAJ:MIN ROOT MOUNTPOINT OPTIONS [OPTIONAL...] - FSTYPE SOURCE SUPEROPTIONS
// The mount point is the fifth field, the source the second after the lone
// "-". A line that does not have that shape gives none.
std::optional<MountEntry> parseMountInfoLine(std::string_view line) {
  std::vector<std::string_view> fields;
  size_t i = 0;
  while (i < line.size()) {
    size_t end = line.find(' ', i);
    if (end == std::string_view::npos) end = line.size();
    if (end > i) fields.push_back(line.substr(i, end - i));
    i = end + 1;
  }
  constexpr size_t kMountPoint = 4;
  constexpr size_t kFirstOptional = 6;
  auto separator = std::find(fields.begin() + std::min(fields.size(), kFirstOptional), fields.end(), "-");
  if (fields.size() <= kMountPoint || separator == fields.end() || fields.end() - separator < 3) return std::nullopt;
  return MountEntry{decodeMountField(*(separator + 2)), decodeMountField(fields[kMountPoint])};
}

// Reads the whole file. False with errno set when it cannot be opened or
// read.
bool readWholeFile(const std::string& path, std::string& text) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) return false;
  char buffer[8192];
  for (;;) {
    ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;  // the descriptor's close keeps errno
    }
    if (n == 0) return true;
    text.append(buffer, static_cast<size_t>(n));
  }
}

}  // namespace

void setDeviceRegistryLocations(std::string_view sysfsRoot, std::string_view mountInfoPath) {
  State& s = state();
  std::lock_guard<std::mutex> guard(s.mutex);
  s.sysfsRoot = sysfsRoot;
  s.mountInfoPath = mountInfoPath;
}

dv_object_t dvServiceGetMatchingService(const char* className) {
  if (className == nullptr) return 0;
  Node controller{Kind::Controller, std::string(), currentSysfsRoot()};
  if (loopDevices(controller.sysfsRoot).empty()) return 0;  // no loop driver, no registry
  if (std::strcmp(className, kControllerClass) == 0) return newEntryHandle(std::move(controller));
  std::vector<Node> services;
  appendDescendants(controller, services);
  for (Node& node : services) {
    if (std::strcmp(className, classOf(node.kind)) == 0) return newEntryHandle(std::move(node));
  }
  return 0;
}

dv_return_t dvRegistryEntryCreateIterator(dv_object_t entry, const char* plane, uint32_t options,
                                          dv_iterator_t* iterator) {
  if (iterator == nullptr || plane == nullptr || std::strcmp(plane, kDVServicePlane) != 0) {
    return kDVReturnBadArgument;
  }
  std::optional<Node> node = entryNode(entry);
  if (!node) return kDVReturnBadArgument;

  // Read outside the lock: sysfs can be slow, and the snapshot belongs to
  // this iterator alone.
  Slot slot;
  slot.use = Slot::Use::Iterator;
  if (options & kDVRegistryIterateRecursively) {
    appendDescendants(*node, slot.pending);
  } else {
    slot.pending = childrenOf(*node);
  }
  State& s = state();
  std::lock_guard<std::mutex> guard(s.mutex);
  *iterator = allocateLocked(s, std::move(slot));
  return kDVReturnSuccess;
}

dv_object_t dvIteratorNext(dv_iterator_t iterator) {
  State& s = state();
  std::lock_guard<std::mutex> guard(s.mutex);
  Slot* slot = slotLocked(s, iterator);
  if (slot == nullptr || slot->use != Slot::Use::Iterator || slot->next == slot->pending.size()) return 0;
  Slot entry;
  entry.use = Slot::Use::Entry;
  entry.node = std::move(slot->pending[slot->next++]);
  // allocateLocked may grow the table and move `slot`: it is not used after.
  return allocateLocked(s, std::move(entry));
}

bool dvObjectConformsTo(dv_object_t object, const char* className) {
  if (className == nullptr) return false;
  std::optional<Node> node = entryNode(object);
  return node && std::strcmp(className, classOf(node->kind)) == 0;
}

String dvRegistryEntryCopyStringProperty(dv_object_t entry, const char* key) {
  if (key == nullptr) return nullptr;
  std::optional<Node> node = entryNode(entry);
  if (!node || (node->kind != Kind::WholeMedium && node->kind != Kind::Partition)) return nullptr;
  if (std::strcmp(key, kBSDNameKey) != 0) return nullptr;
  return String(node->name);
}

void dvObjectRelease(dv_object_t object) {
  State& s = state();
  std::lock_guard<std::mutex> guard(s.mutex);
  Slot* slot = slotLocked(s, object);
  if (slot == nullptr) return;
  *slot = Slot();  // frees the snapshot too
  --s.outstanding;
}

size_t dvOutstandingHandles() {
  State& s = state();
  std::lock_guard<std::mutex> guard(s.mutex);
  return s.outstanding;
}

std::vector<MountEntry> parseMountInfo(std::string_view text) {
  std::vector<MountEntry> table;
  size_t i = 0;
  while (i < text.size()) {
    size_t end = text.find('\n', i);
    if (end == std::string_view::npos) end = text.size();
    if (std::optional<MountEntry> entry = parseMountInfoLine(text.substr(i, end - i))) {
      table.push_back(std::move(*entry));
    }
    i = end + 1;
  }
  return table;
}

std::vector<MountEntry> getmntinfo() {
  std::string path;
  {
    State& s = state();
    std::lock_guard<std::mutex> guard(s.mutex);
    path = s.mountInfoPath;
  }
  std::string text;
  if (!readWholeFile(path, text)) return {};  // errno from the open or read
  std::vector<MountEntry> table = parseMountInfo(text);
  // Every process has its root mounted: a file without a single mount in it
  // is not a mount table.
  if (table.empty()) errno = EINVAL;
  return table;
}

}  // namespace sl
