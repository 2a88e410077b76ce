// stowline manifest: every user-data item of the old layout, as JSON.
//
// Read-only below the root: the configuration is asked only for computed
// paths, the migrator's classification only reads, the registry is not
// opened, and every walk goes through directory descriptors opened with
// O_NOFOLLOW, so a link is recorded with its target and never followed.

#include <dirent.h>
#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "AppMigrator/Classification.h"
#include "AppMigrator/OldLayout.h"
#include "Configuration/SLGlobalConfiguration.h"
#include "Platform/InstallerLog.h"
#include "Platform/PropertyList.h"
#include "Platform/SystemRoot.h"
#include "Platform/UniqueFd.h"
#include "tools/CommandLine.h"
#include "tools/Commands.h"
#include "tools/ManifestItem.h"
#include "tools/Json.h"

namespace stowline {

namespace {

namespace mg = sl::migrator;

constexpr char kCommand[] = "manifest";
constexpr char kUsage[] =
    "usage: stowline manifest [--root DIR] [--output FILE]\n"
    "\n"
    "Writes, as JSON, every user-data item of the old layout: for each\n"
    "application identifier the items below its data items (Documents, Library,\n"
    "tmp, Tillbox), and for each group the items of its old group container,\n"
    "with relative path, type, size, mode, SHA-256 (files) and link target\n"
    "(links). Links are recorded, never followed. Nothing below the root is\n"
    "changed. 'stowline verify' checks a migrated layout against it.\n"
    "\n"
    "  --root DIR     the system root (default: $STOWLINE_ROOT, else /)\n"
    "  --output FILE  write the manifest to FILE instead of standard output\n"
    "  --help         this text\n";

struct EvpFree {
  void operator()(EVP_MD_CTX* context) const { EVP_MD_CTX_free(context); }
};

// The SHA-256 of what `fd` reads, as lowercase hex; empty with *err set on
// failure.
std::string sha256OfDescriptor(int fd, int* err) {
  std::unique_ptr<EVP_MD_CTX, EvpFree> context(EVP_MD_CTX_new());
  if (!context || EVP_DigestInit_ex(context.get(), EVP_sha256(), nullptr) != 1) {
    *err = ENOMEM;
    return {};
  }
  std::vector<unsigned char> buffer(65536);
  for (;;) {
    const ssize_t n = ::read(fd, buffer.data(), buffer.size());
    if (n < 0) {
      const int readErrno = errno;
      if (readErrno == EINTR) continue;
      *err = readErrno;
      return {};
    }
    if (n == 0) break;
    EVP_DigestUpdate(context.get(), buffer.data(), static_cast<size_t>(n));
  }
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int size = 0;
  EVP_DigestFinal_ex(context.get(), digest, &size);
  static const char kHex[] = "0123456789abcdef";
  std::string hex;
  for (unsigned int i = 0; i < size; ++i) {
    hex += kHex[digest[i] >> 4];
    hex += kHex[digest[i] & 15];
  }
  return hex;
}

struct Walk {
  std::vector<ManifestItem> items;
  std::vector<std::string> problems;  // what could not be recorded, one line each
};

// Records `relative` below `baseFd` and, for a directory, everything below
// it, in name order.
void walkItem(int baseFd, const std::string& relative, const std::string& shownBase, Walk& walk) {
  int err = 0;
  std::optional<ManifestItem> item = describeManifestItem(baseFd, relative, &err);
  if (!item) {
    walk.problems.push_back(shownBase + "/" + relative + ": " + std::strerror(err));
    return;
  }
  const bool directory = item->type == "directory";
  walk.items.push_back(std::move(*item));
  if (!directory) return;

  sl::UniqueFd fd(::openat(baseFd, relative.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) {
    const int openErrno = errno;
    walk.problems.push_back(shownBase + "/" + relative + ": " + std::strerror(openErrno));
    return;
  }
  sl::UniqueDir dir = sl::fdopendir(fd);
  if (!dir) {
    const int dirErrno = errno;
    walk.problems.push_back(shownBase + "/" + relative + ": " + std::strerror(dirErrno));
    return;
  }
  std::vector<std::string> names;
  errno = 0;
  while (const dirent* entry = ::readdir(dir.get())) {
    const std::string name = entry->d_name;
    if (name != "." && name != "..") names.push_back(name);
    errno = 0;
  }
  if (const int readErrno = errno; readErrno != 0) {
    walk.problems.push_back(shownBase + "/" + relative + ": " + std::strerror(readErrno));
  }
  std::sort(names.begin(), names.end());
  for (const std::string& name : names) walkItem(baseFd, relative + "/" + name, shownBase, walk);
}

// The entries of a directory that the walk starts from: every name in it.
std::vector<std::string> topNames(int fd, std::vector<std::string>& problems, const std::string& shown) {
  std::vector<std::string> names;
  sl::UniqueFd copy(::openat(fd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!copy) {
    const int openErrno = errno;
    problems.push_back(shown + ": " + std::strerror(openErrno));
    return names;
  }
  sl::UniqueDir dir = sl::fdopendir(copy);
  if (!dir) {
    const int dirErrno = errno;
    problems.push_back(shown + ": " + std::strerror(dirErrno));
    return names;
  }
  while (const dirent* entry = ::readdir(dir.get())) {
    const std::string name = entry->d_name;
    if (name != "." && name != "..") names.push_back(name);
  }
  std::sort(names.begin(), names.end());
  return names;
}

void writeItems(JsonWriter& w, const std::vector<ManifestItem>& items) {
  w.beginArray();
  for (const ManifestItem& item : items) {
    w.beginObject();
    w.key("path").string(item.path);
    w.key("type").string(item.type);
    w.key("size").number(item.size);
    w.key("mode").number(static_cast<uint64_t>(item.mode));
    if (item.type == "file") w.key("sha256").string(item.sha256);
    if (item.type == "link") w.key("target").string(item.target);
    w.endObject();
  }
  w.endArray();
}

}  // namespace

std::optional<ManifestItem> describeManifestItem(int baseFd, const std::string& relative, int* err) {
  // The parents are opened one at a time with O_NOFOLLOW: a link on the way
  // is not followed.
  sl::UniqueFd parent;
  int at = baseFd;
  size_t begin = 0;
  std::string name = relative;
  for (size_t slash; (slash = relative.find('/', begin)) != std::string::npos; begin = slash + 1) {
    const std::string component = relative.substr(begin, slash - begin);
    sl::UniqueFd next(::openat(at, component.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    if (!next) {
      const int openErrno = errno;
      *err = openErrno == ELOOP || openErrno == ENOTDIR ? ENOENT : openErrno;
      return std::nullopt;
    }
    parent = std::move(next);
    at = parent.get();
    name = relative.substr(slash + 1);
  }
  struct stat st;
  if (::fstatat(at, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
    const int statErrno = errno;
    *err = statErrno;
    return std::nullopt;
  }
  ManifestItem item;
  item.path = relative;
  item.mode = st.st_mode & 07777;
  item.size = static_cast<uint64_t>(st.st_size);
  if (S_ISREG(st.st_mode)) {
    item.type = "file";
    sl::UniqueFd fd(::openat(at, name.c_str(), O_RDONLY | O_NOFOLLOW | O_NOCTTY | O_NONBLOCK | O_CLOEXEC));
    if (!fd) {
      const int openErrno = errno;
      *err = openErrno;
      return std::nullopt;
    }
    item.sha256 = sha256OfDescriptor(fd.get(), err);
    if (item.sha256.empty()) return std::nullopt;
  } else if (S_ISDIR(st.st_mode)) {
    item.type = "directory";
  } else if (S_ISLNK(st.st_mode)) {
    item.type = "link";
    std::vector<char> buffer(static_cast<size_t>(st.st_size) + 2);
    for (;;) {
      const ssize_t n = ::readlinkat(at, name.c_str(), buffer.data(), buffer.size());
      if (n < 0) {
        const int readErrno = errno;
        *err = readErrno;
        return std::nullopt;
      }
      if (static_cast<size_t>(n) < buffer.size()) {
        item.target.assign(buffer.data(), static_cast<size_t>(n));
        break;
      }
      buffer.resize(buffer.size() * 2);
    }
  } else if (S_ISFIFO(st.st_mode)) {
    item.type = "fifo";
  } else {
    item.type = "other";
  }
  return item;
}

int manifestCommand(Arguments args) {
  std::string root, output;
  CommandLine line(kCommand, kUsage);
  line.value("--root", "a directory", &root).value("--output", "a file", &output);
  if (std::optional<int> status = line.parse(args)) return *status;
  if (!applyRoot(kCommand, root)) return 2;

  // Errors of the classification still reach the user; its notices do not.
  sl::setInstallerLogSink([](const sl::LogRecord& record) {
    if (record.level <= sl::kLogLevelError) {
      std::fprintf(stderr, "stowline manifest: %.*s\n", static_cast<int>(record.message.size()),
                   record.message.data());
    }
  });

  SLGlobalConfiguration& configuration = SLGlobalConfiguration::sharedInstance();
  const std::string containerRoot = configuration.oldContainerPath().path();
  const std::vector<std::string> dataItemNames = configuration.appUserDataItemNames();
  std::vector<std::string> problems;

  // Applications: each entry of the old container root that classifies as
  // a record (a marker's record included: its container is taken as it
  // stands, whatever already moved).
  std::map<std::string, std::vector<ManifestItem>> applications;
  std::map<std::string, std::string> containers;
  sl::UniqueFd rootFd(::open(containerRoot.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!rootFd) {
    const int openErrno = errno;
    if (openErrno != ENOENT) problems.push_back(containerRoot + ": " + std::strerror(openErrno));
  } else {
    for (const std::string& entry : topNames(rootFd.get(), problems, containerRoot)) {
      struct stat st;
      if (::fstatat(rootFd.get(), entry.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISDIR(st.st_mode)) continue;
      const mg::Decision decision =
          mg::classifyContainer(sl::URL::fileURLWithPath(containerRoot + "/" + entry, true));
      if (decision.record.isNull()) continue;
      const sl::String identifier = decision.record.get(mg::kBundleIdentifierKey).asString();
      const sl::String container = decision.record.get(mg::kContainerPathKey).asString();
      if (identifier.isNull() || container.isNull()) continue;
      sl::UniqueFd containerFd(::open(container.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
      if (!containerFd) {
        const int openErrno = errno;
        problems.push_back(container.str() + ": " + std::strerror(openErrno));
        continue;
      }
      containers[identifier.str()] = container.str();
      Walk walk;
      for (const std::string& name : dataItemNames) {
        struct stat itemStat;
        if (::fstatat(containerFd.get(), name.c_str(), &itemStat, AT_SYMLINK_NOFOLLOW) != 0) continue;
        walkItem(containerFd.get(), name, container.str(), walk);
      }
      std::vector<ManifestItem>& items = applications[identifier.str()];
      items.insert(items.end(), walk.items.begin(), walk.items.end());
      problems.insert(problems.end(), walk.problems.begin(), walk.problems.end());
    }
  }

  // Groups: the old install map's group containers, by group identifier.
  std::map<std::string, std::vector<ManifestItem>> groups;
  std::map<std::string, std::string> groupContainers;
  const sl::Dictionary installMap = sl::dictionaryWithContentsOfURL(configuration.oldInstallMapPath());
  const sl::Dictionary groupMap = installMap.get(mg::kGroupContainersKey).asDictionary();
  if (!groupMap.isNull()) {
    for (const auto& [group, entry] : groupMap.entries()) {
      const sl::String path = entry.asDictionary().get(mg::kGroupContainerPathKey).asString();
      if (path.isNull()) continue;
      sl::UniqueFd groupFd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
      if (!groupFd) {
        const int openErrno = errno;
        if (openErrno != ENOENT) problems.push_back(path.str() + ": " + std::strerror(openErrno));
        continue;
      }
      groupContainers[group] = path.str();
      Walk walk;
      for (const std::string& name : topNames(groupFd.get(), walk.problems, path.str())) {
        walkItem(groupFd.get(), name, path.str(), walk);
      }
      groups[group] = std::move(walk.items);
      problems.insert(problems.end(), walk.problems.begin(), walk.problems.end());
    }
  }

  JsonWriter w;
  w.beginObject();
  w.key("root").string(sl::systemRoot());
  w.key("applications").beginObject();
  for (const auto& [identifier, items] : applications) {
    w.key(identifier);
    writeItems(w, items);
  }
  w.endObject();
  w.key("groups").beginObject();
  for (const auto& [group, items] : groups) {
    w.key(group);
    writeItems(w, items);
  }
  w.endObject();
  // Where each was found, so that verify can tell an item that stayed
  // behind.
  w.key("containers").beginObject();
  for (const auto& [identifier, path] : containers) w.key(identifier).string(path);
  w.endObject();
  w.key("groupContainers").beginObject();
  for (const auto& [group, path] : groupContainers) w.key(group).string(path);
  w.endObject();
  w.endObject();

  const std::string text = w.str() + "\n";
  if (output.empty()) {
    std::fwrite(text.data(), 1, text.size(), stdout);
  } else {
    sl::UniqueFd fd(::open(output.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
    if (!fd) {
      const int openErrno = errno;
      return setupError(kCommand, "cannot write " + output + ": " + std::strerror(openErrno));
    }
    for (size_t done = 0; done < text.size();) {
      const ssize_t n = ::write(fd.get(), text.data() + done, text.size() - done);
      if (n < 0) {
        const int writeErrno = errno;
        if (writeErrno == EINTR) continue;
        std::fprintf(stderr, "stowline manifest: cannot write %s: %s\n", output.c_str(), std::strerror(writeErrno));
        return 1;
      }
      done += static_cast<size_t>(n);
    }
  }
  for (const std::string& problem : problems) std::fprintf(stderr, "stowline manifest: cannot record %s\n", problem.c_str());
  return problems.empty() ? 0 : 1;
}

}  // namespace stowline
