// Tests of the configuration directory of each queue type: the path, the
// creation of a missing directory and the handling of one that cannot be
// created.

#include <fcntl.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <string>

#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/sandbox.h"
#include "support/syslog_capture.h"

namespace ZORV {
namespace ZORVNOTIFYD {
namespace {

// The permission bits of |path|, or -1 when it does not exist; links are
// not followed.
int ModeOf(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode) ? static_cast<int>(st.st_mode & 07777)
                                                              : -1;
}

class ConfDirTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZORV_REQUIRE_SANDBOX();
    zorv_test::ResetStore();
    zorv_test::ClearLogs();
  }
};

TEST_F(ConfDirTest, EachTypeHasItsDirectoryCreatedWhenMissing) {
  const struct {
    int type;
    const char* dir;
    const char* created_parent;  // missing before the call, created with it
  } kCases[] = {
      {0, "/usr/zorv/share/zorvnotifyd", "/usr/zorv"},
      {1, "/usr/zorv/etc/zorvnotifyd", "/usr/zorv/etc"},
      {2, "/usr/local/etc/zorvnotifyd", nullptr},
      {3, "/usr/zorv/etc/zorvnotifyd", nullptr},
      {-1, "/usr/zorv/etc/zorvnotifyd", nullptr},
  };
  for (const auto& c : kCases) {
    SCOPED_TRACE(c.type);
    EXPECT_EQ(MonitorQueue::GetConfDir(static_cast<_tag_monitor_queue_type_>(c.type)), c.dir);
    EXPECT_EQ(ModeOf(c.dir), 0700);
    if (c.created_parent != nullptr) {
      EXPECT_EQ(ModeOf(c.created_parent), 0700);
    }
  }
  EXPECT_TRUE(zorv_test::CapturedLogs().empty()) << zorv_test::DumpLogs();

  // Nothing is cached: a directory removed behind the library's back is
  // created again by the next call.
  ASSERT_EQ(rmdir("/usr/zorv/etc/zorvnotifyd"), 0);
  EXPECT_EQ(MonitorQueue::GetConfDir(MONITOR_QUEUE_TYPE_ETC_DIR), "/usr/zorv/etc/zorvnotifyd");
  EXPECT_EQ(ModeOf("/usr/zorv/etc/zorvnotifyd"), 0700);
}

TEST_F(ConfDirTest, ExistingDirectoryIsLeftAsItIs) {
  const char kDir[] = "/usr/local/etc/zorvnotifyd";
  ASSERT_EQ(mkdir(kDir, 0755), 0);
  ASSERT_EQ(chmod(kDir, 0751), 0);
  struct stat before;
  ASSERT_EQ(stat(kDir, &before), 0);
  EXPECT_EQ(MonitorQueue::GetConfDir(MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR), kDir);
  struct stat after;
  ASSERT_EQ(stat(kDir, &after), 0);
  EXPECT_EQ(after.st_ino, before.st_ino);
  EXPECT_EQ(after.st_mode & 07777, 0751u);
  EXPECT_TRUE(zorv_test::CapturedLogs().empty()) << zorv_test::DumpLogs();
}

TEST_F(ConfDirTest, CreationFailureIsLoggedAndThePathStillReturned) {
  const int fd = open("/usr/zorv", O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  ASSERT_GE(fd, 0);
  close(fd);
  EXPECT_EQ(MonitorQueue::GetConfDir(MONITOR_QUEUE_TYPE_ETC_DIR), "/usr/zorv/etc/zorvnotifyd");
  const std::vector<zorv_test::LogLine> logs = zorv_test::CapturedLogs();
  ASSERT_EQ(logs.size(), 1u) << zorv_test::DumpLogs();
  EXPECT_EQ(logs[0].priority, LOG_ERR);
  EXPECT_EQ(logs[0].format, "%s:%d Failed to create conf dir: %s");
  const std::string& text = logs[0].text;
  const size_t end = text.find(' ');
  EXPECT_EQ(text.substr(0, 14), "monitor_queue:");
  EXPECT_GT(end, 14u);
  EXPECT_EQ(text.find_first_not_of("0123456789", 14), end) << text;
  EXPECT_EQ(text.substr(end), " Failed to create conf dir: /usr/zorv/etc/zorvnotifyd");
  struct stat st;
  ASSERT_EQ(lstat("/usr/zorv", &st), 0);
  EXPECT_TRUE(S_ISREG(st.st_mode));  // the obstacle is not replaced
}

}  // namespace
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
