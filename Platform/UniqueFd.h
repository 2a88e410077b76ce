// Move-only owners for file descriptors and directory streams.
//
// Every descriptor and DIR* of the system is held by one of these from the
// line that creates it; ownership leaves only through release(), and the
// call site says so in a comment when the callee keeps it even on failure.
#pragma once

#include <dirent.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

namespace sl {

class UniqueFd {
 public:
  UniqueFd() = default;
  explicit UniqueFd(int fd) : fd_(fd) {}
  UniqueFd(UniqueFd&& other) noexcept : fd_(other.release()) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    reset(other.release());
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  ~UniqueFd() { reset(); }

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  explicit operator bool() const { return valid(); }

  [[nodiscard]] int release() { return std::exchange(fd_, -1); }

  // Closes the held descriptor, keeping errno as the caller left it: a close
  // on a cleanup path must not overwrite the errno of the failure that led
  // there.
  void reset(int fd = -1) {
    if (fd_ >= 0) {
      int saved = errno;
      ::close(fd_);
      errno = saved;
    }
    fd_ = fd;
  }

 private:
  int fd_ = -1;
};

class UniqueDir {
 public:
  UniqueDir() = default;
  explicit UniqueDir(DIR* dir) : dir_(dir) {}
  UniqueDir(UniqueDir&& other) noexcept : dir_(other.release()) {}
  UniqueDir& operator=(UniqueDir&& other) noexcept {
    reset(other.release());
    return *this;
  }
  UniqueDir(const UniqueDir&) = delete;
  UniqueDir& operator=(const UniqueDir&) = delete;
  ~UniqueDir() { reset(); }

  DIR* get() const { return dir_; }
  explicit operator bool() const { return dir_ != nullptr; }
  [[nodiscard]] DIR* release() { return std::exchange(dir_, nullptr); }

  // closedir also closes the descriptor the stream was made from.
  void reset(DIR* dir = nullptr) {
    if (dir_ != nullptr) {
      int saved = errno;
      ::closedir(dir_);
      errno = saved;
    }
    dir_ = dir;
  }

 private:
  DIR* dir_ = nullptr;
};

// Makes a stream of fd. On success the stream owns the descriptor; on failure
// the descriptor stays with `fd` and errno says why.
inline UniqueDir fdopendir(UniqueFd& fd) {
  DIR* dir = ::fdopendir(fd.get());
  if (dir == nullptr) return UniqueDir();
  (void)fd.release();  // now owned by the stream
  return UniqueDir(dir);
}

}  // namespace sl
