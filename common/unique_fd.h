// A file descriptor owned by exactly one object and closed with it: the
// one scoped descriptor of the tool and the daemon.
#ifndef ZORVNOTIFYD_COMMON_UNIQUE_FD_H_
#define ZORVNOTIFYD_COMMON_UNIQUE_FD_H_

#include <unistd.h>

#include <utility>

namespace zorvcommon {

// Owns |fd| (negative: nothing) and closes it when destroyed or replaced.
// Move-only.
class UniqueFd {
 public:
  explicit UniqueFd(int fd = -1) : fd_(fd) {}
  UniqueFd(UniqueFd&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  UniqueFd& operator=(UniqueFd&& other) noexcept {
    if (this != &other) {
      Reset();
      fd_ = std::exchange(other.fd_, -1);
    }
    return *this;
  }
  UniqueFd(const UniqueFd&) = delete;
  UniqueFd& operator=(const UniqueFd&) = delete;
  ~UniqueFd() { Reset(); }

  // The descriptor, still owned by this object.
  int get() const { return fd_; }
  // Closes the descriptor now; get() then returns -1.
  void Reset() {
    if (fd_ >= 0) close(fd_);
    fd_ = -1;
  }

 private:
  int fd_;
};

}  // namespace zorvcommon

#endif  // ZORVNOTIFYD_COMMON_UNIQUE_FD_H_
