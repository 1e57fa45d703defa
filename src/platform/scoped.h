// Small scoped owners of system resources, so that every descriptor and
// directory stream is released on every path, exceptions included.
#ifndef ZORVNOTIFYD_SRC_PLATFORM_SCOPED_H_
#define ZORVNOTIFYD_SRC_PLATFORM_SCOPED_H_

#include <dirent.h>
#include <unistd.h>

namespace ZORV {
namespace ZORVNOTIFYD {
namespace platform {

// Owns a file descriptor; closes it on destruction unless released.
class ScopedFd {
 public:
  explicit ScopedFd(int fd = -1) : fd_(fd) {}
  ScopedFd(const ScopedFd&) = delete;
  ScopedFd& operator=(const ScopedFd&) = delete;
  ~ScopedFd() { Reset(); }

  int get() const { return fd_; }
  bool valid() const { return fd_ >= 0; }
  // Closes the current descriptor, if any, and owns |fd| instead.
  void Reset(int fd = -1) {
    if (fd_ >= 0) close(fd_);
    fd_ = fd;
  }
  // Gives up ownership and returns the descriptor.
  int Release() {
    const int fd = fd_;
    fd_ = -1;
    return fd;
  }

 private:
  int fd_;
};

// Owns a directory stream; closes it on destruction.
class ScopedDir {
 public:
  explicit ScopedDir(DIR* dir) : dir_(dir) {}
  ScopedDir(const ScopedDir&) = delete;
  ScopedDir& operator=(const ScopedDir&) = delete;
  ~ScopedDir() {
    if (dir_ != nullptr) closedir(dir_);
  }

  DIR* get() const { return dir_; }

 private:
  DIR* dir_;
};

}  // namespace platform
}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_SRC_PLATFORM_SCOPED_H_
