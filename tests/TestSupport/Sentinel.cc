#include "TestSupport/Sentinel.h"

#include <dirent.h>
#include <fcntl.h>
#include <openssl/evp.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>

#include <gtest/gtest.h>

#include "Platform/UniqueFd.h"

namespace sl::test {

namespace {

std::string hex(const unsigned char* bytes, size_t length) {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string out;
  for (size_t i = 0; i < length; ++i) {
    out += kDigits[bytes[i] >> 4];
    out += kDigits[bytes[i] & 15];
  }
  return out;
}

// SHA-256 of a regular file's content, read without following a link.
std::string digestOf(const std::string& path) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!fd) return std::string("unreadable: ") + strerror(errno);
  std::unique_ptr<EVP_MD_CTX, void (*)(EVP_MD_CTX*)> context(EVP_MD_CTX_new(), EVP_MD_CTX_free);
  EVP_DigestInit_ex(context.get(), EVP_sha256(), nullptr);
  unsigned char buffer[65536];
  for (;;) {
    ssize_t n = ::read(fd.get(), buffer, sizeof buffer);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return std::string("unreadable: ") + strerror(errno);
    if (n == 0) break;
    EVP_DigestUpdate(context.get(), buffer, static_cast<size_t>(n));
  }
  unsigned char digest[EVP_MAX_MD_SIZE];
  unsigned int length = 0;
  EVP_DigestFinal_ex(context.get(), digest, &length);
  return hex(digest, length);
}

// "name=hexvalue;..." of every attribute of the item itself, sorted.
std::string attributesOf(const std::string& path) {
  ssize_t size = ::llistxattr(path.c_str(), nullptr, 0);
  if (size <= 0) return size == 0 ? "" : std::string("unreadable: ") + strerror(errno);
  std::string names(static_cast<size_t>(size), '\0');
  size = ::llistxattr(path.c_str(), names.data(), names.size());
  if (size < 0) return std::string("unreadable: ") + strerror(errno);
  std::vector<std::string> entries;
  for (size_t at = 0; at < static_cast<size_t>(size);) {
    std::string name(names.c_str() + at);
    at += name.size() + 1;
    unsigned char value[4096];
    ssize_t length = ::lgetxattr(path.c_str(), name.c_str(), value, sizeof value);
    entries.push_back(name + "=" + (length < 0 ? "?" : hex(value, static_cast<size_t>(length))));
  }
  std::sort(entries.begin(), entries.end());
  std::string out;
  for (const std::string& entry : entries) out += entry + ";";
  return out;
}

const char* typeName(mode_t mode) {
  if (S_ISDIR(mode)) return "directory";
  if (S_ISREG(mode)) return "file";
  if (S_ISLNK(mode)) return "link";
  if (S_ISFIFO(mode)) return "fifo";
  return "other";
}

void record(const std::string& top, const std::string& relative, Sentinel::Snapshot& out) {
  const std::string path = relative == "." ? top : top + "/" + relative;
  struct stat st;
  if (::lstat(path.c_str(), &st) != 0) {
    out[relative]["lstat"] = strerror(errno);
    return;
  }
  auto& fields = out[relative];
  fields["type"] = typeName(st.st_mode);
  char mode[16];
  snprintf(mode, sizeof mode, "%o", st.st_mode & 07777);
  fields["mode"] = mode;
  fields["uid"] = std::to_string(st.st_uid);
  fields["gid"] = std::to_string(st.st_gid);
  fields["inode"] = std::to_string(st.st_ino);
  fields["mtime"] = std::to_string(st.st_mtim.tv_sec) + "." + std::to_string(st.st_mtim.tv_nsec);
  fields["xattrs"] = attributesOf(path);
  if (S_ISREG(st.st_mode)) {
    fields["size"] = std::to_string(st.st_size);
    fields["sha256"] = digestOf(path);
  } else if (S_ISLNK(st.st_mode)) {
    char target[4096];
    ssize_t n = ::readlink(path.c_str(), target, sizeof target);
    fields["target"] = n < 0 ? std::string("unreadable") : std::string(target, static_cast<size_t>(n));
  } else if (S_ISDIR(st.st_mode)) {
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
    UniqueDir dir = fd ? sl::fdopendir(fd) : UniqueDir();
    if (!dir) {
      fields["listing"] = strerror(errno);
      return;
    }
    std::vector<std::string> names;
    while (const struct dirent* d = ::readdir(dir.get())) {
      if (strcmp(d->d_name, ".") != 0 && strcmp(d->d_name, "..") != 0) names.push_back(d->d_name);
    }
    std::sort(names.begin(), names.end());
    for (const std::string& name : names) record(top, relative == "." ? name : relative + "/" + name, out);
  }
}

void setAttribute(const std::string& path, const char* name, const std::string& value) {
  if (::lsetxattr(path.c_str(), name, value.data(), value.size(), 0) != 0)
    ADD_FAILURE() << "setxattr " << path << " " << name << ": " << strerror(errno);
}

}  // namespace

Sentinel::Sentinel(const char* parent) : dir_(parent) {
  writeFile(dir_ / "secret.txt", "the sentinel's secret\n", 0600);
  setAttribute(dir_ / "secret.txt", "user.sentinel.a", "alpha");
  setAttribute(dir_ / "secret.txt", "user.sentinel.b", std::string("\0\1\2", 3));
  makeDirs(dir_ / "nested", 0700);
  setAttribute(dir_ / "nested", "user.sentinel.dir", "nested");
  writeFile(dir_ / "nested/deep.txt", std::string(100000, 'x'), 0600);
  makeSymlink("secret.txt", dir_ / "link-to-secret");
  for (const char* p : {".", "secret.txt", "nested", "nested/deep.txt"}) {
    if (::chown((dir_ / p).c_str(), 0, 0) != 0) ADD_FAILURE() << "chown " << p << ": " << strerror(errno);
  }
  ::lchown((dir_ / "link-to-secret").c_str(), 0, 0);
  recorded_ = snapshot();
}

Sentinel::Snapshot Sentinel::snapshot() const {
  Snapshot out;
  record(dir_.path(), ".", out);
  return out;
}

std::vector<std::string> Sentinel::changes() const {
  const Snapshot now = snapshot();
  std::vector<std::string> out;
  for (const auto& [path, fields] : recorded_) {
    auto current = now.find(path);
    if (current == now.end()) {
      out.push_back(path + ": missing");
      continue;
    }
    for (const auto& [field, value] : fields) {
      auto it = current->second.find(field);
      const std::string newValue = it == current->second.end() ? "(none)" : it->second;
      if (newValue != value) out.push_back(path + ": " + field + " was " + value + ", now " + newValue);
    }
  }
  for (const auto& [path, fields] : now) {
    if (!recorded_.count(path)) out.push_back(path + ": added");
  }
  return out;
}

}  // namespace sl::test
