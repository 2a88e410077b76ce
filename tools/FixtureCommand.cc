// stowline fixture: writes a sample old layout below a system root, for
// demonstrations, tests and benchmarks.
//
// Everything that varies (container names, versions, groups, file contents)
// comes from one splitmix64 generator seeded by --seed, drawn in a fixed
// order, and every item written gets fixed modes and times: the same seed
// gives a byte-identical tree. The tree is written through directory
// descriptors (mkdirat, openat, futimens), without fsync, so that ten
// thousand applications take seconds.

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <charconv>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "AppMigrator/OldLayout.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "Platform/Icon.h"
#include "Platform/ImageDestination.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"
#include "Platform/Value.h"
#include "tools/CommandLine.h"
#include "tools/Commands.h"

namespace stowline {

namespace {

constexpr char kCommand[] = "fixture";

constexpr char kUsage[] =
    "usage: stowline fixture --root DIR --apps N [--vpn-only M] [--groups G]\n"
    "                        [--files-per-app F] [--bytes-per-file B] [--seed S]\n"
    "                        [--app-vpn V] [--placeholders P] [--builtin B]\n"
    "\n"
    "Writes an old layout below the system root DIR: N application containers\n"
    "(bundle, icon, data in Documents, Library, tmp and Tillbox, sometimes store\n"
    "metadata), M containers holding only a VPN plug-in, G group containers named\n"
    "in the old install map, a safe harbor map with one or two harbors, and\n"
    "WhereDidMyApplicationsGo.txt. The same seed gives the same tree, byte for byte.\n"
    "Refuses a root whose old container root is not empty or whose old install\n"
    "map or safe harbor map already exists.\n"
    "\n"
    "  --root DIR            the system root (required; must be a directory)\n"
    "  --apps N              application containers (required)\n"
    "  --vpn-only M          VPN-only containers (default 0); no application has\n"
    "                        their identifiers, so migrate leaves them in place\n"
    "  --groups G            group containers (default 0)\n"
    "  --files-per-app F     data files per application (default 3)\n"
    "  --bytes-per-file B    size of each data file (default 64)\n"
    "  --seed S              seed of the generator (default 1)\n"
    "  --app-vpn V           the first V application containers also hold a VPN\n"
    "                        plug-in, installed with the application (default 0)\n"
    "  --placeholders P      containers whose bundle carries the placeholder\n"
    "                        marker: migrate installs a placeholder for each and\n"
    "                        moves its data, but no bundle (default 0)\n"
    "  --builtin B           built-in applications below DIR/Applications, each\n"
    "                        with an old container holding an older copy and\n"
    "                        data: migrate moves the data into the built-in\n"
    "                        application's data container (default 0)\n";

// The access and modification time of every item written: 2021-01-01
// 00:00:00 UTC.
constexpr time_t kFixtureTime = 1609459200;

using sl::migrator::kGroupContainersKey;
using sl::migrator::kGroupContainerPathKey;
constexpr const char* kHarborMapName = sl::migrator::kSafeHarborMapName;
using sl::migrator::kHarborPathKey;
constexpr const char* kOldRootNoteName = sl::migrator::kWhereDidMyApplicationsGoName;
constexpr char kOldGroupsDirectory[] = "/private/var/mobile/Containers/OldGroups";
constexpr char kHarborsDirectory[] = "/private/var/stowd/Library/SafeHarbors";

constexpr std::array<const char*, 4> kDataDirectories = {"Documents", "Library", "tmp", "Tillbox"};

struct Options {
  std::string root;
  bool haveApps = false;
  uint64_t apps = 0;
  uint64_t vpnOnly = 0;
  uint64_t groups = 0;
  uint64_t filesPerApp = 3;
  uint64_t bytesPerFile = 64;
  uint64_t seed = 1;
  uint64_t appVPN = 0;
  uint64_t placeholders = 0;
  uint64_t builtIn = 0;
};

// splitmix64: small, fast and the same on every platform.
class Random {
 public:
  explicit Random(uint64_t seed) : state_(seed) {}

  uint64_t next() {
    uint64_t z = (state_ += 0x9E3779B97F4A7C15ULL);
    z = (z ^ (z >> 30)) * 0xBF58476D1CE4E5B9ULL;
    z = (z ^ (z >> 27)) * 0x94D049BB133111EBULL;
    return z ^ (z >> 31);
  }
  uint64_t below(uint64_t n) { return n == 0 ? 0 : next() % n; }

  // Bytes in a fixed (little-endian) order, whatever the host's order.
  void fill(uint8_t* out, size_t n) {
    while (n > 0) {
      uint64_t word = next();
      for (int i = 0; i < 8 && n > 0; ++i, --n, word >>= 8) *out++ = static_cast<uint8_t>(word);
    }
  }

  // A version 4 UUID, 8-4-4-4-12 uppercase hex, as the registry names
  // containers.
  std::string uuid() {
    uint8_t bytes[16];
    fill(bytes, sizeof bytes);
    bytes[6] = static_cast<uint8_t>((bytes[6] & 0x0F) | 0x40);
    bytes[8] = static_cast<uint8_t>((bytes[8] & 0x3F) | 0x80);
    static constexpr char kHex[] = "0123456789ABCDEF";
    std::string text;
    for (size_t i = 0; i < sizeof bytes; ++i) {
      if (i == 4 || i == 6 || i == 8 || i == 10) text += '-';
      text += kHex[bytes[i] >> 4];
      text += kHex[bytes[i] & 0x0F];
    }
    return text;
  }

 private:
  uint64_t state_;
};

std::span<const uint8_t> bytesOf(std::string_view text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

// A directory being written: its descriptor and its path for messages.
struct Directory {
  sl::UniqueFd fd;
  std::string path;
};

class FixtureWriter {
 public:
  FixtureWriter(const Options& options, SLGlobalConfiguration& configuration);

  // 0 when the whole layout was written; 1 after a failure (reported on
  // standard error). What was written before the failure stays.
  int run();

 private:
  bool fail(const char* call, const std::string& path, int savedErrno);

  // Opens the directory at an absolute path below the system root, making
  // the components that are missing. Components made here get the fixed
  // times at the end.
  bool openPath(const std::string& absolute, Directory* out);
  // Makes `name` (which must not exist yet) inside `parent` and opens it.
  bool makeDirectory(const Directory& parent, const std::string& name, Directory* out);
  // Gives a directory whose content is complete the fixed times; closes it.
  bool finish(Directory& directory);
  bool writeFile(const Directory& parent, const std::string& name, std::span<const uint8_t> bytes, mode_t mode);
  bool writeRandomFile(const Directory& parent, const std::string& name, uint64_t size);
  bool writePropertyList(const Directory& parent, const std::string& name, const sl::Value& value);

  bool makeIcon();
  bool writeGroup(const Directory& groups, uint64_t index);
  bool writeApplication(const Directory& root, uint64_t index);
  bool writeData(const Directory& container);
  bool writePlaceholderContainer(const Directory& root, uint64_t index);
  bool writeBuiltInApplication(const Directory& applications, const Directory& root, uint64_t index);
  bool writeExtras();
  bool writeVPNContainer(const Directory& root, uint64_t index);
  bool writeHarbors();
  bool writeSystemVersion();
  bool writeMaps();

  const Options& options_;
  std::string oldContainerPath_;
  std::string installMapPath_;
  std::string dataDirectoryPath_;
  Random random_;
  std::vector<uint8_t> icon_;
  std::vector<std::string> groupIdentifiers_;
  sl::Dictionary groupContainers_ = sl::Dictionary::create();
  sl::Dictionary harborMap_ = sl::Dictionary::create();
  // Directories whose times are set once everything is written: the ones
  // made by openPath and the ones the top-level items were written into.
  std::vector<Directory> finishLater_;
  uint64_t harborCount_ = 0;
  const struct timespec times_[2] = {{kFixtureTime, 0}, {kFixtureTime, 0}};
};

FixtureWriter::FixtureWriter(const Options& options, SLGlobalConfiguration& configuration)
    : options_(options),
      oldContainerPath_(configuration.oldContainerPath().path()),
      installMapPath_(configuration.oldInstallMapPath().path()),
      dataDirectoryPath_(configuration.dataDirectoryPath().path()),
      random_(options.seed) {}

bool FixtureWriter::fail(const char* call, const std::string& path, int savedErrno) {
  std::fprintf(stderr, "stowline fixture: %s of %s failed: %s\n", call, path.c_str(), std::strerror(savedErrno));
  return false;
}

bool FixtureWriter::openPath(const std::string& absolute, Directory* out) {
  const std::string& root = sl::systemRoot();
  Directory current{sl::UniqueFd(::open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)), root};
  if (!current.fd) return fail("open", root, errno);
  std::string_view rest(absolute);
  if (root != "/") rest.remove_prefix(root.size());
  for (const std::string& component : sl::pathComponents(rest)) {
    if (component == "/") continue;
    const std::string path = (current.path == "/" ? "" : current.path) + "/" + component;
    bool made = false;
    if (::mkdirat(current.fd.get(), component.c_str(), 0755) == 0) {
      made = true;
    } else if (errno != EEXIST) {
      return fail("mkdir", path, errno);
    }
    Directory next{
        sl::UniqueFd(::openat(current.fd.get(), component.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC)),
        path};
    if (!next.fd) return fail("open", path, errno);
    if (made) {
      sl::UniqueFd copy(::dup(next.fd.get()));
      if (!copy) return fail("dup", path, errno);
      finishLater_.push_back({std::move(copy), path});
    }
    current = std::move(next);
  }
  *out = std::move(current);
  return true;
}

bool FixtureWriter::makeDirectory(const Directory& parent, const std::string& name, Directory* out) {
  std::string path = parent.path + "/" + name;
  if (::mkdirat(parent.fd.get(), name.c_str(), 0755) != 0) return fail("mkdir", path, errno);
  sl::UniqueFd fd(::openat(parent.fd.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return fail("open", path, errno);
  *out = Directory{std::move(fd), std::move(path)};
  return true;
}

bool FixtureWriter::finish(Directory& directory) {
  if (::futimens(directory.fd.get(), times_) != 0) return fail("futimens", directory.path, errno);
  directory.fd.reset();
  return true;
}

bool FixtureWriter::writeFile(const Directory& parent, const std::string& name, std::span<const uint8_t> bytes,
                              mode_t mode) {
  const std::string path = parent.path + "/" + name;
  sl::UniqueFd fd(::openat(parent.fd.get(), name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, mode));
  if (!fd) return fail("open", path, errno);
  while (!bytes.empty()) {
    const ssize_t n = ::write(fd.get(), bytes.data(), bytes.size());
    if (n < 0) {
      if (errno == EINTR) continue;
      return fail("write", path, errno);
    }
    bytes = bytes.subspan(static_cast<size_t>(n));
  }
  if (::futimens(fd.get(), times_) != 0) return fail("futimens", path, errno);
  return true;
}

bool FixtureWriter::writeRandomFile(const Directory& parent, const std::string& name, uint64_t size) {
  const std::string path = parent.path + "/" + name;
  sl::UniqueFd fd(::openat(parent.fd.get(), name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0644));
  if (!fd) return fail("open", path, errno);
  uint8_t chunk[65536];
  while (size > 0) {
    const size_t n = static_cast<size_t>(std::min<uint64_t>(size, sizeof chunk));
    random_.fill(chunk, n);
    size_t done = 0;
    while (done < n) {
      const ssize_t written = ::write(fd.get(), chunk + done, n - done);
      if (written < 0) {
        if (errno == EINTR) continue;
        return fail("write", path, errno);
      }
      done += static_cast<size_t>(written);
    }
    size -= n;
  }
  if (::futimens(fd.get(), times_) != 0) return fail("futimens", path, errno);
  return true;
}

bool FixtureWriter::writePropertyList(const Directory& parent, const std::string& name, const sl::Value& value) {
  std::vector<uint8_t> bytes;
  sl::Error error;
  // XML where it can carry the value; a path below a root whose name is not
  // UTF-8 needs the binary form.
  if (!sl::dataFromPropertyList(value, sl::PropertyListFormat::XML, &bytes) &&
      !sl::dataFromPropertyList(value, sl::PropertyListFormat::Binary, &bytes, &error)) {
    std::fprintf(stderr, "stowline fixture: cannot encode %s/%s: %s\n", parent.path.c_str(), name.c_str(),
                 error.description().c_str());
    return false;
  }
  return writeFile(parent, name, bytes, 0644);
}

// One small icon for every application: a 32 x 32 square of a seeded colour
// with a lighter diagonal band.
bool FixtureWriter::makeIcon() {
  sl::Image image;
  image.width = 32;
  image.height = 32;
  image.pixels.resize(size_t{32} * 32 * 4);
  uint8_t colour[3];
  random_.fill(colour, sizeof colour);
  for (uint32_t y = 0; y < 32; ++y) {
    for (uint32_t x = 0; x < 32; ++x) {
      uint8_t* pixel = &image.pixels[(size_t{y} * 32 + x) * 4];
      const bool band = x + y >= 28 && x + y <= 34;
      for (int c = 0; c < 3; ++c) pixel[c] = band ? static_cast<uint8_t>(255 - colour[c] / 4) : colour[c];
      pixel[3] = 255;
    }
  }
  sl::MutableDataBuffer buffer;
  KVImageDestinationOwner destination(KVImageDestinationCreateWithData(buffer, kUTTypePNG, 1));
  if (!destination) {
    std::fputs("stowline fixture: cannot make a PNG encoder\n", stderr);
    return false;
  }
  KVImageDestinationAddImage(destination.get(), image);
  if (!KVImageDestinationFinalize(destination.get())) {
    std::fputs("stowline fixture: cannot encode the icon\n", stderr);
    return false;
  }
  icon_ = std::move(buffer.bytes);
  return true;
}

bool FixtureWriter::writeGroup(const Directory& groups, uint64_t index) {
  const std::string identifier = "group.com.example.fixture.group" + std::to_string(index);
  Directory container;
  if (!makeDirectory(groups, random_.uuid(), &container)) return false;
  Directory library;
  if (!writeRandomFile(container, "Shared.dat", options_.bytesPerFile) ||
      !makeDirectory(container, "Library", &library) ||
      !writeFile(library, "Group.txt", bytesOf(identifier + "\n"), 0644) || !finish(library) || !finish(container)) {
    return false;
  }
  groupIdentifiers_.push_back(identifier);
  groupContainers_.set(identifier, sl::Dictionary{{kGroupContainerPathKey, sl::String(container.path)}});
  return true;
}

bool FixtureWriter::writeApplication(const Directory& root, uint64_t index) {
  const std::string number = std::to_string(index);
  const std::string name = "App" + number;
  const std::string identifier = "com.example.fixture.app" + number;
  const std::string version = std::to_string(1 + random_.below(3)) + "." + std::to_string(random_.below(10));

  Directory container;
  if (!makeDirectory(root, random_.uuid(), &container)) return false;

  // The bundle.
  sl::Array groups = sl::Array::create();
  if (!groupIdentifiers_.empty()) {
    const uint64_t wanted = random_.below(3);  // 0, 1 or 2 groups
    std::vector<uint64_t> picked;
    for (uint64_t i = 0; i < wanted; ++i) {
      const uint64_t g = random_.below(groupIdentifiers_.size());
      if (std::find(picked.begin(), picked.end(), g) == picked.end()) picked.push_back(g);
    }
    std::sort(picked.begin(), picked.end());
    for (uint64_t g : picked) groups.append(sl::String(groupIdentifiers_[g]));
  }
  sl::Dictionary info{
      {"PBBundleIdentifier", sl::String(identifier)},
      {"PBBundleVersion", sl::String(version)},
      {"PBBundleShortVersionString", sl::String(version)},
      {"PBBundleDisplayName", sl::String("Fixture App " + number)},
      {"PBBundleExecutable", sl::String(name)},
  };
  if (!groups.isEmpty()) info.set("PBApplicationGroups", groups);
  Directory bundle;
  if (!makeDirectory(container, name + ".app", &bundle) || !writePropertyList(bundle, "Info.plist", info) ||
      !writeFile(bundle, name, bytesOf("#!/bin/sh\necho " + name + "\n"), 0755) ||
      !writeFile(bundle, "Icon.png", icon_, 0644) || !finish(bundle)) {
    return false;
  }

  // A VPN plug-in beside the application, for the first --app-vpn
  // containers. Nothing about it is drawn, so the rest of the tree is the
  // same with or without it.
  if (index <= options_.appVPN) {
    Directory plugin;
    const std::string pluginName = name + "Tunnel";
    const sl::Dictionary pluginInfo{{"PBBundleIdentifier", sl::String(identifier + ".tunnel")},
                                    {"PBBundleVersion", sl::String(version)},
                                    {"PBBundleDisplayName", sl::String("Fixture Tunnel of App " + number)},
                                    {"PBBundleExecutable", sl::String(pluginName)}};
    if (!makeDirectory(container, pluginName + ".vpnplugin", &plugin) ||
        !writePropertyList(plugin, "Info.plist", pluginInfo) ||
        !writeFile(plugin, pluginName, bytesOf("#!/bin/sh\necho " + pluginName + "\n"), 0755) || !finish(plugin)) {
      return false;
    }
  }

  if (!writeData(container)) return false;

  // Store metadata beside the bundle: none, the metadata and artwork, or
  // all four items.
  const uint64_t metadata = random_.below(3);
  if (metadata >= 1) {
    const sl::Dictionary store{{"itemId", sl::Number(static_cast<int64_t>(index))},
                               {"itemName", sl::String("Fixture App " + number)},
                               {"bundleVersion", sl::String(version)}};
    if (!writePropertyList(container, "JukoraMetadata.plist", store) ||
        !writeRandomFile(container, "JukoraArtwork", options_.bytesPerFile)) {
      return false;
    }
  }
  if (metadata == 2) {
    const sl::Dictionary manifest{{"PBBundleIdentifier", sl::String(identifier)}};
    if (!writePropertyList(container, "Manifest.plist", manifest) ||
        !writeFile(container, "GeoJSON", bytesOf("{\"type\":\"FeatureCollection\",\"features\":[]}\n"), 0644)) {
      return false;
    }
  }
  return finish(container);
}

// The data of one application, spread over the four data directories in
// turn.
bool FixtureWriter::writeData(const Directory& container) {
  std::array<Directory, kDataDirectories.size()> data;
  for (size_t i = 0; i < data.size(); ++i) {
    if (!makeDirectory(container, kDataDirectories[i], &data[i])) return false;
  }
  for (uint64_t f = 0; f < options_.filesPerApp; ++f) {
    if (!writeRandomFile(data[f % data.size()], "file" + std::to_string(f) + ".dat", options_.bytesPerFile)) {
      return false;
    }
  }
  for (Directory& directory : data) {
    if (!finish(directory)) return false;
  }
  return true;
}

// An application that was only ever a placeholder: its bundle carries the
// placeholder marker (4 bytes holding 1, little-endian), so migrate installs
// a placeholder from its Info.plist and moves its data, but installs no
// bundle.
bool FixtureWriter::writePlaceholderContainer(const Directory& root, uint64_t index) {
  const std::string number = std::to_string(index);
  const std::string name = "Placeholder" + number;
  const sl::Dictionary info{{"PBBundleIdentifier", sl::String("com.example.fixture.placeholder" + number)},
                            {"PBBundleVersion", sl::String("1.0")},
                            {"PBBundleShortVersionString", sl::String("1.0")},
                            {"PBBundleDisplayName", sl::String("Fixture Placeholder " + number)},
                            {"PBBundleExecutable", sl::String(name)}};
  Directory container;
  Directory bundle;
  if (!makeDirectory(root, random_.uuid(), &container) || !makeDirectory(container, name + ".app", &bundle) ||
      !writePropertyList(bundle, "Info.plist", info) || !writeFile(bundle, "Icon.png", icon_, 0644)) {
    return false;
  }
  static constexpr uint8_t kPlaceholderValue[4] = {1, 0, 0, 0};
  if (::fsetxattr(bundle.fd.get(), "user.com.vantor.stowd.placeholder", kPlaceholderValue, sizeof kPlaceholderValue,
                  0) != 0) {
    return fail("fsetxattr", bundle.path, errno);
  }
  return finish(bundle) && writeData(container) && finish(container);
}

// A built-in application (version 9.0, below the system's applications
// directory) and an old container holding its older copy (1.0) with data:
// the registry knows the identifier from the start and refuses the old
// copy as already installed, after the data has moved.
bool FixtureWriter::writeBuiltInApplication(const Directory& applications, const Directory& root, uint64_t index) {
  const std::string number = std::to_string(index);
  const std::string name = "BuiltIn" + number;
  auto info = [&](const char* version) {
    return sl::Dictionary{{"PBBundleIdentifier", sl::String("com.example.fixture.builtin" + number)},
                          {"PBBundleVersion", sl::String(version)},
                          {"PBBundleShortVersionString", sl::String(version)},
                          {"PBBundleDisplayName", sl::String("Fixture Built-in " + number)},
                          {"PBBundleExecutable", sl::String(name)}};
  };
  const std::string executable = "#!/bin/sh\necho " + name + "\n";
  Directory system;
  if (!makeDirectory(applications, name + ".app", &system) || !writePropertyList(system, "Info.plist", info("9.0")) ||
      !writeFile(system, name, bytesOf(executable), 0755) || !finish(system)) {
    return false;
  }
  Directory container;
  Directory bundle;
  return makeDirectory(root, random_.uuid(), &container) && makeDirectory(container, name + ".app", &bundle) &&
         writePropertyList(bundle, "Info.plist", info("1.0")) &&
         writeFile(bundle, name, bytesOf(executable), 0755) && finish(bundle) && writeData(container) &&
         finish(container);
}

// Placeholders and built-in applications come after everything else, so
// that the rest of the tree is the same whether or not they are asked for.
bool FixtureWriter::writeExtras() {
  if (options_.placeholders == 0 && options_.builtIn == 0) return true;
  Directory root;
  if (!openPath(oldContainerPath_, &root)) return false;
  for (uint64_t p = 1; p <= options_.placeholders; ++p) {
    if (!writePlaceholderContainer(root, p)) return false;
  }
  if (options_.builtIn > 0) {
    Directory applications;
    if (!openPath(sl::pathBelowSystemRoot("/Applications"), &applications)) return false;
    for (uint64_t b = 1; b <= options_.builtIn; ++b) {
      if (!writeBuiltInApplication(applications, root, b)) return false;
    }
    finishLater_.push_back(std::move(applications));
  }
  return true;
}

bool FixtureWriter::writeVPNContainer(const Directory& root, uint64_t index) {
  const std::string number = std::to_string(index);
  const std::string name = "Tunnel" + number;
  Directory container;
  Directory plugin;
  const sl::Dictionary info{{"PBBundleIdentifier", sl::String("com.example.fixture.vpn" + number)},
                            {"PBBundleVersion", sl::String("1.0")},
                            {"PBBundleDisplayName", sl::String("Fixture Tunnel " + number)},
                            {"PBBundleExecutable", sl::String(name)}};
  return makeDirectory(root, random_.uuid(), &container) && makeDirectory(container, name + ".vpnplugin", &plugin) &&
         writePropertyList(plugin, "Info.plist", info) &&
         writeFile(plugin, name, bytesOf("#!/bin/sh\necho " + name + "\n"), 0755) && finish(plugin) &&
         finish(container);
}

bool FixtureWriter::writeHarbors() {
  Directory harbors;
  if (!openPath(sl::pathBelowSystemRoot(kHarborsDirectory), &harbors)) return false;
  harborCount_ = 1 + random_.below(2);
  for (uint64_t h = 1; h <= harborCount_; ++h) {
    Directory harbor;
    Directory documents;
    if (!makeDirectory(harbors, random_.uuid(), &harbor) || !makeDirectory(harbor, "Documents", &documents) ||
        !writeRandomFile(documents, "harbor.dat", options_.bytesPerFile) || !finish(documents) || !finish(harbor)) {
      return false;
    }
    harborMap_.set("com.example.fixture.harbor" + std::to_string(h),
                   sl::Dictionary{{kHarborPathKey, sl::String(harbor.path)}});
  }
  finishLater_.push_back(std::move(harbors));
  return true;
}

bool FixtureWriter::writeMaps() {
  const sl::URL mapURL = sl::URL::fileURLWithPath(installMapPath_, false);
  Directory caches;
  Directory data;
  if (!openPath(mapURL.URLByDeletingLastPathComponent().path(), &caches) ||
      !writePropertyList(caches, mapURL.lastPathComponent(), sl::Dictionary{{kGroupContainersKey, groupContainers_}}) ||
      !openPath(dataDirectoryPath_, &data) || !writePropertyList(data, kHarborMapName, harborMap_)) {
    return false;
  }
  finishLater_.push_back(std::move(caches));
  finishLater_.push_back(std::move(data));
  return true;
}

// The system-version source of the sample system, unless the root already
// has one: a migration records the build it ran for.
bool FixtureWriter::writeSystemVersion() {
  Directory etc;
  if (!openPath(sl::pathBelowSystemRoot("/etc"), &etc)) return false;
  struct stat st;
  if (::fstatat(etc.fd.get(), "os-release", &st, AT_SYMLINK_NOFOLLOW) != 0) {
    if (!writeFile(etc, "os-release", bytesOf("NAME=\"Stowline Sample\"\nVERSION_ID=\"1.0\"\nBUILD_ID=\"S1000\"\n"), 0644)) {
      return false;
    }
  }
  finishLater_.push_back(std::move(etc));
  return true;
}

int FixtureWriter::run() {
  ::umask(022);  // the modes asked for are the modes written
  if (!makeIcon()) return 1;

  Directory groups;
  if (options_.groups > 0) {
    if (!openPath(sl::pathBelowSystemRoot(kOldGroupsDirectory), &groups)) return 1;
    for (uint64_t g = 1; g <= options_.groups; ++g) {
      if (!writeGroup(groups, g)) return 1;
    }
    finishLater_.push_back(std::move(groups));
  }

  Directory root;
  if (!openPath(oldContainerPath_, &root)) return 1;
  for (uint64_t k = 1; k <= options_.apps; ++k) {
    if (!writeApplication(root, k)) return 1;
  }
  for (uint64_t m = 1; m <= options_.vpnOnly; ++m) {
    if (!writeVPNContainer(root, m)) return 1;
  }
  if (!writeFile(root, kOldRootNoteName, bytesOf("Your applications have moved to their new containers.\n"), 0644)) {
    return 1;
  }
  finishLater_.push_back(std::move(root));

  if (!writeHarbors() || !writeMaps() || !writeSystemVersion() || !writeExtras()) return 1;
  for (Directory& directory : finishLater_) {
    if (!finish(directory)) return 1;
  }
  std::printf(
      "Wrote %llu application containers, %llu VPN plug-in containers, %llu group containers and %llu safe "
      "harbors below %s\n",
      static_cast<unsigned long long>(options_.apps), static_cast<unsigned long long>(options_.vpnOnly),
      static_cast<unsigned long long>(options_.groups), static_cast<unsigned long long>(harborCount_),
      sl::systemRoot().c_str());
  if (options_.appVPN > 0 || options_.placeholders > 0 || options_.builtIn > 0) {
    std::printf("with %llu VPN plug-ins beside applications, %llu placeholder containers and %llu built-in "
                "applications\n",
                static_cast<unsigned long long>(std::min(options_.appVPN, options_.apps)),
                static_cast<unsigned long long>(options_.placeholders),
                static_cast<unsigned long long>(options_.builtIn));
  }
  return 0;
}

// Stores the count; answers why it is refused, or "".
std::string parseCount(std::string_view option, std::string_view text, uint64_t* out) {
  const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), *out);
  if (ec != std::errc() || end != text.data() + text.size() || text.empty()) {
    return std::string(option) + " takes a whole number of 0 or more, not '" + std::string(text) + "'";
  }
  return {};
}

// The layout must be new: an old container root with something in it, or a
// map file already there, belongs to a layout that the fixture would mix into.
bool checkLayoutIsNew(const std::string& oldRoot, const std::string& installMap, const std::string& harborMap) {
  struct stat st;
  if (::lstat(oldRoot.c_str(), &st) == 0) {
    if (!S_ISDIR(st.st_mode)) {
      setupError(kCommand, "the old container root " + oldRoot + " exists and is not a directory");
      return false;
    }
    sl::UniqueFd fd(::open(oldRoot.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    sl::UniqueDir dir = fd ? sl::fdopendir(fd) : sl::UniqueDir();
    if (!dir) {
      setupError(kCommand, "cannot read the old container root " + oldRoot + ": " + std::strerror(errno));
      return false;
    }
    while (const struct dirent* entry = ::readdir(dir.get())) {
      if (std::strcmp(entry->d_name, ".") != 0 && std::strcmp(entry->d_name, "..") != 0) {
        setupError(kCommand, "the old container root " + oldRoot + " is not empty");
        return false;
      }
    }
  }
  for (const std::string& file : {installMap, harborMap}) {
    if (::lstat(file.c_str(), &st) == 0) {
      setupError(kCommand, file + " already exists");
      return false;
    }
  }
  return true;
}

}  // namespace

int fixtureCommand(Arguments args) {
  Options options;
  CommandLine line(kCommand, kUsage);
  line.value("--root", "a directory", &options.root);
  line.value("--apps", "a number", [&options](std::string_view text) {
    options.haveApps = true;
    return parseCount("--apps", text, &options.apps);
  });
  const auto count = [&](std::string_view name, uint64_t* out) {
    line.value(name, "a number", [name, out](std::string_view text) { return parseCount(name, text, out); });
  };
  count("--vpn-only", &options.vpnOnly);
  count("--groups", &options.groups);
  count("--files-per-app", &options.filesPerApp);
  count("--bytes-per-file", &options.bytesPerFile);
  count("--seed", &options.seed);
  count("--app-vpn", &options.appVPN);
  count("--placeholders", &options.placeholders);
  count("--builtin", &options.builtIn);
  if (std::optional<int> status = line.parse(args)) return *status;
  if (options.root.empty()) return usageError(kCommand, "--root DIR is required");
  if (!options.haveApps) return usageError(kCommand, "--apps N is required");
  if (!applyRoot(kCommand, options.root)) return 2;

  SLGlobalConfiguration& configuration = SLGlobalConfiguration::sharedInstance();
  const std::string harborMap =
      configuration.dataDirectoryPath().URLByAppendingPathComponent(kHarborMapName, false).path();
  if (!checkLayoutIsNew(configuration.oldContainerPath().path(), configuration.oldInstallMapPath().path(), harborMap)) {
    return 2;
  }
  return FixtureWriter(options, configuration).run();
}

}  // namespace stowline
