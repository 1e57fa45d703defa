// Tests of the store lock: exclusion against other processes, the retries
// (counted through the C library's rand sequence, which each failed attempt
// draws from once), the lock file's mode and content, and the descriptors
// left open.

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <functional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/run_as.h"
#include "support/sandbox.h"

namespace ZORV {
namespace ZORVNOTIFYD {
namespace {

const char kLockFile[] = "/tmp/zorvnotifyd_monitor_q.lock";

// A process holding an exclusive flock on |path| (created when missing)
// for |hold_ms| milliseconds, or until it is killed when |hold_ms| is
// negative.  The lock is taken here and the descriptor handed to a child, so
// the lock is held when the constructor returns and the child is its only
// holder.
class LockHolder {
 public:
  LockHolder(const std::string& path, int hold_ms) {
    const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    if (fd >= 0 && flock(fd, LOCK_EX) == 0 && (pid_ = fork()) == 0) {
      if (hold_ms < 0) pause();
      usleep(static_cast<useconds_t>(hold_ms) * 1000);
      _exit(0);
    }
    if (fd >= 0) close(fd);
  }
  LockHolder(const LockHolder&) = delete;
  LockHolder& operator=(const LockHolder&) = delete;
  ~LockHolder() {
    if (pid_ > 0 && kill(pid_, SIGKILL) == 0) waitpid(pid_, nullptr, 0);
  }
  bool held() const { return pid_ > 0; }

 private:
  pid_t pid_ = -1;
};

// Seeds rand with the first seed whose first |count| values satisfy |want|
// and returns those values followed by the next one, so that a test can
// tell how many values the code under test drew.
std::vector<int> SeedSuchThat(int count, const std::function<bool(const std::vector<int>&)>& want) {
  for (unsigned seed = 1; seed < 10000000; ++seed) {
    srand(seed);
    std::vector<int> values(count + 1);
    for (int& value : values) value = rand();
    if (want(values)) {
      srand(seed);
      return values;
    }
  }
  return {};
}

// How many descriptors of this process refer to |path|.
int DescriptorsOf(const std::string& path) {
  int count = 0;
  DIR* dir = opendir("/proc/self/fd");
  if (dir == nullptr) return -1;
  while (const struct dirent* entry = readdir(dir)) {
    char target[4096];
    const std::string link = std::string("/proc/self/fd/") + entry->d_name;
    const ssize_t n = readlink(link.c_str(), target, sizeof target - 1);
    if (n > 0 && std::string(target, static_cast<size_t>(n)) == path) ++count;
  }
  closedir(dir);
  return count;
}

// 0 when a child process can take a shared flock on |path|, else its errno.
int ChildCanLock(const char* path) {
  const zorv_test::ChildResult child = zorv_test::RunInChild([path] {
    const int fd = open(path, O_RDONLY | O_CLOEXEC);
    const int result = fd >= 0 && flock(fd, LOCK_SH | LOCK_NB) == 0 ? 0 : errno;
    close(fd);
    return result;
  });
  return child.exited ? child.result : -1;
}

class StoreLockTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZORV_REQUIRE_SANDBOX();
    zorv_test::ResetStore();
  }
};

TEST_F(StoreLockTest, UncontendedLockIsExclusiveAndLeavesTheFileAlone) {
  const mode_t saved_umask = umask(077);
  int fd = -1;
  ASSERT_TRUE(Lock(fd, kLockFile));
  Unlock(fd);
  struct stat st;
  ASSERT_EQ(stat(kLockFile, &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0600u);  // the umask applies
  ASSERT_EQ(unlink(kLockFile), 0);
  umask(0);

  const std::vector<int> values = SeedSuchThat(0, [](const std::vector<int>&) { return true; });
  fd = -1;
  ASSERT_TRUE(Lock(fd, kLockFile));
  umask(saved_umask);
  EXPECT_EQ(rand(), values[0]);  // no retry
  ASSERT_GE(fd, 0);
  EXPECT_NE(fcntl(fd, F_GETFD) & FD_CLOEXEC, 0);
  EXPECT_EQ(DescriptorsOf(kLockFile), 1);
  EXPECT_EQ(ChildCanLock(kLockFile), EWOULDBLOCK);
  ASSERT_EQ(stat(kLockFile, &st), 0);
  EXPECT_TRUE(S_ISREG(st.st_mode));
  EXPECT_EQ(st.st_mode & 07777, 0644u);
  EXPECT_EQ(st.st_size, 0);

  Unlock(fd);
  EXPECT_EQ(fcntl(fd, F_GETFD), -1);
  EXPECT_EQ(DescriptorsOf(kLockFile), 0);
  EXPECT_EQ(ChildCanLock(kLockFile), 0);

  // An existing lock file keeps its mode and content.
  ASSERT_EQ(chmod(kLockFile, 0604), 0);
  const int writer = open(kLockFile, O_WRONLY | O_CLOEXEC);
  ASSERT_EQ(write(writer, "keep", 4), 4);
  close(writer);
  ASSERT_TRUE(Lock(fd, kLockFile));
  Unlock(fd);
  ASSERT_EQ(stat(kLockFile, &st), 0);
  EXPECT_EQ(st.st_size, 4);
  EXPECT_EQ(st.st_mode & 07777, 0604u);
}

TEST_F(StoreLockTest, LockHeldPastTheRetriesFailsWithOneDescriptorLeft) {
  LockHolder holder(kLockFile, -1);
  ASSERT_TRUE(holder.held());
  // Short sleeps keep the test quick; the count of draws is what matters.
  const std::vector<int> values = SeedSuchThat(5, [](const std::vector<int>& v) {
    for (int i = 0; i < 5; ++i) {
      if (v[i] % 10 > 1) return false;
    }
    return true;
  });
  ASSERT_EQ(values.size(), 6u);
  int fd = -1;
  EXPECT_FALSE(Lock(fd, kLockFile));
  EXPECT_EQ(rand(), values[5]);  // five failed attempts, five sleeps
  ASSERT_GE(fd, 0);
  EXPECT_EQ(DescriptorsOf(kLockFile), 1);  // failed attempts closed theirs
  Unlock(fd);
  EXPECT_EQ(DescriptorsOf(kLockFile), 0);
}

TEST_F(StoreLockTest, LockReleasedDuringTheRetriesIsTaken) {
  // The holder lets go after 300 ms; the first failed attempt sleeps 900 ms.
  LockHolder holder(kLockFile, 300);
  ASSERT_TRUE(holder.held());
  const std::vector<int> values =
      SeedSuchThat(1, [](const std::vector<int>& v) { return v[0] % 10 == 9; });
  ASSERT_EQ(values.size(), 2u);
  int fd = -1;
  EXPECT_TRUE(Lock(fd, kLockFile));
  EXPECT_EQ(rand(), values[1]);  // exactly one failed attempt
  EXPECT_EQ(DescriptorsOf(kLockFile), 1);
  Unlock(fd);
  EXPECT_EQ(DescriptorsOf(kLockFile), 0);
}

TEST_F(StoreLockTest, UnopenablePathsFailAndUnlockHandlesEveryDescriptor) {
  // A planted link is not followed, even to a file that could be created.
  ASSERT_EQ(symlink("/tmp/target", kLockFile), 0);
  int fd = -1;
  EXPECT_FALSE(Lock(fd, kLockFile));
  EXPECT_LT(fd, 0);
  struct stat st;
  EXPECT_NE(lstat("/tmp/target", &st), 0);
  Unlock(fd);

  fd = 0;
  EXPECT_FALSE(Lock(fd, "/tmp/missing-dir/lock"));
  EXPECT_LT(fd, 0);

  errno = 0;
  Unlock(-1);
  EXPECT_EQ(errno, 0);  // nothing was called

  fd = open("/tmp/plain", O_RDWR | O_CREAT | O_CLOEXEC, 0600);
  ASSERT_GE(fd, 0);
  Unlock(fd);
  EXPECT_EQ(fcntl(fd, F_GETFD), -1);
  EXPECT_EQ(errno, EBADF);
}

}  // namespace
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
