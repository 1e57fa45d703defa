// The store lock: an exclusive flock on a fixed file, shared by every
// writer of the catalogue on the system.

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <sys/file.h>
#include <unistd.h>

#include "monitor_queue.h"

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

constexpr int kAttempts = 5;
constexpr mode_t kLockFileMode = 0644;
// Close-on-exec: a service started while the lock is held must not inherit
// it.  No-follow: a root process never follows a link planted in /tmp.
constexpr int kLockFlags = O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_LARGEFILE;

}  // namespace

bool Lock(int& fd, const std::string& path) {
  for (int attempt = 1;; ++attempt) {
    fd = open(path.c_str(), kLockFlags, kLockFileMode);
    if (fd < 0) return false;
    if (flock(fd, LOCK_EX | LOCK_NB) == 0) return true;
    if (errno != EINTR && errno != EWOULDBLOCK) return false;
    usleep(static_cast<useconds_t>((rand() % 10) * 100000));
    if (attempt == kAttempts) return false;
    close(fd);
  }
}

void Unlock(int fd) {
  if (fd < 0) return;
  flock(fd, LOCK_UN);
  close(fd);
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
