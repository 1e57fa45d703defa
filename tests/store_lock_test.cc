// The store lock: exclusion, the retries, the lock file's mode and content,
// and the descriptors left open.

#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/sandbox.h"

static int g_draws = 0, g_release_at = 0, g_other = -1;
static pid_t g_holder = -1;
static bool g_replace = false;

// Ends the holder process, which releases the lock with its descriptor, and
// closes |g_other|, which releases the lock it holds.
static void EndHolder() {
  if (g_holder > 0 && kill(g_holder, SIGKILL) == 0) waitpid(g_holder, nullptr, 0);
  g_holder = -1;
  if (g_other >= 0) close(g_other);
  g_other = -1;
}

// The library's flock lands here as well.  Once |g_replace| is set, the lock
// file is replaced before the next flock, and the new file is locked through
// |g_other|, as by a writer that came after the replacement.
extern "C" int flock(int fd, int operation) noexcept {
  if (g_replace && unlink("/tmp/zorvnotifyd_monitor_q.lock") == 0) {
    g_other = open("/tmp/zorvnotifyd_monitor_q.lock", O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    syscall(SYS_flock, g_other, LOCK_EX | LOCK_NB);
  }
  g_replace = false;
  return static_cast<int>(syscall(SYS_flock, fd, operation));
}

// The library's rand lands here, as its syslog does (the executable comes
// first in symbol lookup): it counts the failed attempts, each of which
// draws once, makes their sleeps 0 and ends the holder at draw
// |g_release_at|.
extern "C" int rand() noexcept {
  if (++g_draws == g_release_at) EndHolder();
  return 0;
}

namespace ZORV::ZORVNOTIFYD {

namespace fs = std::filesystem;
const char kLockFile[] = "/tmp/zorvnotifyd_monitor_q.lock";

// How many descriptors of this process refer to the lock file.
static int LockFileDescriptors() {
  int count = 0;
  std::error_code error;  // the iterator's own descriptor is gone by then
  for (const auto& fd : fs::directory_iterator("/proc/self/fd"))
    count += fs::read_symlink(fd.path(), error) == kLockFile;
  return count;
}

// Exclusion, the lock file left alone, and the retries of a held or replaced lock.
TEST(StoreLockTest, LockIsExclusiveLeavesTheFileAloneAndRetriesFiveTimes) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  int fd = -1, other = -1;
  for (const mode_t mask : {077, 0}) {
    const mode_t saved = umask(mask);
    g_draws = 0;
    EXPECT_TRUE(Lock(fd, kLockFile));
    umask(saved);
    EXPECT_EQ(g_draws, 0);  // no retry
    EXPECT_NE(fcntl(fd, F_GETFD) & FD_CLOEXEC, 0);
    EXPECT_FALSE(Lock(other, kLockFile));  // even for another descriptor of this process
    Unlock(other);
    Unlock(fd);
    EXPECT_EQ(fs::status(kLockFile).permissions(), fs::perms(0644 & ~mask));  // created so
    EXPECT_EQ(fs::file_size(kLockFile), 0u);
    fs::remove(kLockFile);
  }
  std::ofstream(kLockFile) << "keep";  // an existing file is neither truncated nor written
  EXPECT_TRUE(Lock(fd, kLockFile));
  Unlock(fd);
  EXPECT_EQ(fs::file_size(kLockFile), 4u);
  fs::remove(kLockFile);  // a planted link is not followed
  fs::create_symlink("/tmp/target", kLockFile);
  EXPECT_FALSE(Lock(fd, kLockFile));
  EXPECT_LT(fd, 0);
  EXPECT_FALSE(fs::exists("/tmp/target"));
  fs::remove(kLockFile);

  // Held by another process or replaced before the flock, released never or
  // at that draw: a lock held past the five attempts is not taken, one
  // released during them is.  A lock on a replaced file counts as held; the
  // descriptor left is one of the file at the path, and no attempt leaves one.
  const std::pair<bool, int> kCases[] = {{false, 0}, {false, 3}, {true, 0}, {true, 2}};
  for (const auto& [replace, release_at] : kCases) {
    SCOPED_TRACE(std::to_string(replace) + " " + std::to_string(release_at));
    if (!replace) {
      int holder_fd = -1;
      ASSERT_TRUE(Lock(holder_fd, kLockFile));
      if ((g_holder = fork()) == 0)
        for (;;) pause();  // the only holder once our descriptor is closed
      close(holder_fd);
      ASSERT_GT(g_holder, 0);
    }
    g_draws = 0;
    g_release_at = release_at;
    g_replace = replace;
    EXPECT_EQ(Lock(fd, kLockFile), release_at != 0);
    EXPECT_EQ(g_draws, release_at ? release_at : 5);
    // The failed attempts closed theirs; the writer after a replacement may hold one.
    EXPECT_EQ(LockFileDescriptors(), 1 + (g_other >= 0));
    struct stat held, named;
    EXPECT_TRUE(fstat(fd, &held) == 0 && stat(kLockFile, &named) == 0 &&
                held.st_ino == named.st_ino);
    Unlock(fd);
    EndHolder();
    EXPECT_EQ(LockFileDescriptors(), 0);
  }
  g_release_at = 0;
}

}  // namespace ZORV::ZORVNOTIFYD
