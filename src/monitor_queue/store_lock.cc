// The store lock: an exclusive flock on a fixed file, shared by every
// writer of the catalogue on the system.

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <sys/file.h>
#include <sys/stat.h>
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

// True when |fd| is the file that |path| names now.  A lock taken on a file
// that was removed or replaced since it was opened excludes nobody who opens
// the path afterwards, so it does not count as the store lock.
bool IsFileAt(int fd, const std::string& path) {
  struct stat held;
  struct stat named;
  return fstat(fd, &held) == 0 && lstat(path.c_str(), &named) == 0 && held.st_dev == named.st_dev &&
         held.st_ino == named.st_ino;
}

}  // namespace

bool Lock(int& fd, const std::string& path) {
  for (int attempt = 1;; ++attempt) {
    fd = open(path.c_str(), kLockFlags, kLockFileMode);
    if (fd < 0) return false;
    if (flock(fd, LOCK_EX | LOCK_NB) == 0) {
      if (IsFileAt(fd, path)) return true;
      flock(fd, LOCK_UN);  // a stale file: retried like a held lock
    } else if (errno != EINTR && errno != EWOULDBLOCK) {
      return false;
    }
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
