#include "TestSupport/TestSupport.h"

#include <fcntl.h>
#include <ftw.h>
#include <sys/fsuid.h>
#include <sys/mount.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include <gtest/gtest.h>

#include "Platform/HostLog.h"
#include "Platform/InstallerLog.h"
#include "Platform/Removefile.h"

namespace sl::test {

TempDir::TempDir(const char* parent) {
  std::string base = parent ? parent : (getenv("TMPDIR") ? getenv("TMPDIR") : "/tmp");
  std::string templ = base + "/sltest.XXXXXX";
  if (mkdtemp(templ.data()) == nullptr) {
    // A test must never fall back to paths below "/": stop it here.
    throw std::runtime_error("TempDir: mkdtemp under " + base + " failed: " + strerror(errno));
  }
  // Searchable by everyone, so that tests running as nobody reach their tree.
  chmod(templ.c_str(), 0755);
  path_ = templ;
}

TempDir::~TempDir() {
  if (!path_.empty()) forceRemove(path_);
}

void makeDirs(const std::string& path, mode_t mode) {
  for (size_t slash = path.find('/', 1);; slash = path.find('/', slash + 1)) {
    std::string prefix = path.substr(0, slash);
    if (mkdir(prefix.c_str(), mode) != 0 && errno != EEXIST) {
      ADD_FAILURE() << "mkdir " << prefix << ": " << strerror(errno);
      return;
    }
    if (slash == std::string::npos) break;
  }
}

void writeFile(const std::string& path, const std::string& content, mode_t mode) {
  size_t slash = path.rfind('/');
  if (slash != std::string::npos && slash > 0) makeDirs(path.substr(0, slash));
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, mode);
  if (fd < 0) {
    ADD_FAILURE() << "open " << path << ": " << strerror(errno);
    return;
  }
  if (write(fd, content.data(), content.size()) != static_cast<ssize_t>(content.size()))
    ADD_FAILURE() << "write " << path << ": " << strerror(errno);
  fchmod(fd, mode);
  close(fd);
}

void makeSymlink(const std::string& target, const std::string& linkPath) {
  size_t slash = linkPath.rfind('/');
  if (slash != std::string::npos && slash > 0) makeDirs(linkPath.substr(0, slash));
  if (symlink(target.c_str(), linkPath.c_str()) != 0)
    ADD_FAILURE() << "symlink " << linkPath << ": " << strerror(errno);
}

std::string readFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  std::ostringstream s;
  s << in.rdbuf();
  return s.str();
}

bool exists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}

void forceRemove(const std::string& path) {
  // Make every directory writable and searchable first, then remove depth
  // first; links are never followed.
  nftw(
      path.c_str(),
      [](const char* p, const struct stat* st, int type, FTW*) {
        if (type == FTW_D || type == FTW_DNR) chmod(p, (st->st_mode & 07777) | 0700);
        return 0;
      },
      64, FTW_PHYS);
  // The removal works on descriptors, so trees deeper than PATH_MAX (which
  // nftw cannot walk) go too.
  (void)sl::removefile(path.c_str(), nullptr, sl::REMOVEFILE_RECURSIVE);
}

LogCapture::LogCapture() {
  setInstallerLogSink([this](const LogRecord& r) {
    installer_.push_back({r.level, std::string(r.category), std::string(r.function), std::string(r.message)});
  });
  setHostLogSink([this](const LogRecord& r) {
    host_.push_back({r.level, std::string(r.category), std::string(r.function), std::string(r.message)});
  });
}

LogCapture::~LogCapture() {
  setInstallerLogSink(nullptr);
  setHostLogSink(nullptr);
}

std::vector<std::string> LogCapture::installerMessages() const {
  std::vector<std::string> out;
  for (const auto& l : installer_) out.push_back(l.message);
  return out;
}

void LogCapture::clear() {
  installer_.clear();
  host_.clear();
}

void expectRecord(const Error& record, std::string_view domain, int64_t code, const std::string& message,
                  const char* function) {
  ASSERT_FALSE(record.isNull()) << "expected a record: " << message;
  EXPECT_EQ(record.domain(), domain);
  EXPECT_EQ(record.code(), code) << record.description();
  EXPECT_EQ(record.localizedDescription().str(), message);
  if (function != nullptr) {
    EXPECT_EQ(record.userInfo().get("FunctionName").asString().str(), function);
    EXPECT_FALSE(record.userInfo().get("SourceFileLine").asNumber().isNull());
  }
}

ScopedUnprivileged::ScopedUnprivileged() {
  // setfsgid/setfsuid act on the calling thread only; leaving fsuid 0 drops
  // the file capabilities (CAP_DAC_OVERRIDE and the like) from the effective
  // set, and going back to 0 restores them.
  oldGid_ = static_cast<gid_t>(setfsgid(kGid));
  oldUid_ = static_cast<uid_t>(setfsuid(kUid));
}

ScopedUnprivileged::~ScopedUnprivileged() {
  setfsuid(oldUid_);
  setfsgid(oldGid_);
}

ScopedTmpfs::ScopedTmpfs(std::string at) : at_(std::move(at)) {
  if (::mount("tmpfs", at_.c_str(), "tmpfs", 0, "size=4m") != 0) error_ = errno;
}

ScopedTmpfs::~ScopedTmpfs() {
  if (mounted()) ::umount2(at_.c_str(), MNT_DETACH);
}

const char* ScopedTmpfs::error() const { return strerror(error_); }

}  // namespace sl::test
