// The test support itself: sandbox isolation, fake systemctl, syslog
// capture and forked children.

#include <dirent.h>
#include <fcntl.h>
#include <grp.h>
#include <sched.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <fstream>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/run_as.h"
#include "support/sandbox.h"
#include "support/syslog_capture.h"

extern "C" void __syslog_chk(int priority, int flag, const char* format, ...);

namespace zorv_test {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

// The last mount on |mount_point| in /proc/self/mountinfo: its type.
std::string FsTypeOf(const std::string& mount_point) {
  std::ifstream in("/proc/self/mountinfo");
  std::string type;
  for (std::string line; std::getline(in, line);) {
    std::istringstream fields(line);
    std::string field;
    std::vector<std::string> before_dash;
    while (fields >> field && field != "-") before_dash.push_back(field);
    if (before_dash.size() > 4 && before_dash[4] == mount_point) fields >> type;
  }
  return type;
}

std::vector<std::string> DirEntries(const char* path) {
  std::vector<std::string> names;
  DIR* dir = opendir(path);
  if (dir == nullptr) return names;
  while (dirent* entry = readdir(dir)) {
    std::string name = entry->d_name;
    if (name != "." && name != "..") names.push_back(name);
  }
  closedir(dir);
  return names;
}

// Runs /usr/bin/systemctl with |args|, an empty environment, /dev/null on
// its standard input and output, and descriptors from 3 up closed except
// |extra_fd|, as user |ruid| (effective root).  Returns the exit status, or
// 127 when it could not be run.
int RunSystemctl(const std::vector<const char*>& args, uid_t ruid = 0, int extra_fd = -1) {
  pid_t pid = fork();
  if (pid == 0) {
    int null_fd = open("/dev/null", O_RDWR);
    dup2(null_fd, 0);
    dup2(null_fd, 1);
    if (extra_fd >= 0) dup2(null_fd, extra_fd);
    for (int fd = 3; fd < 1024; ++fd) {
      if (fd != extra_fd) close(fd);
    }
    std::vector<char*> argv{const_cast<char*>("systemctl")};
    for (const char* arg : args) argv.push_back(const_cast<char*>(arg));
    argv.push_back(nullptr);
    char* envp[] = {nullptr};
    if (setresuid(ruid, 0, 0) != 0) _exit(126);
    execve("/usr/bin/systemctl", argv.data(), envp);
    _exit(127);
  }
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

class SandboxTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZORV_REQUIRE_SANDBOX();
    ResetStore();
  }
};

// Declared first: /tmp must still be as the sandbox left it.
TEST_F(SandboxTest, OverlayOnUsrAndEmptyTmp) {
  EXPECT_EQ(FsTypeOf("/usr"), "overlay");
  EXPECT_EQ(FsTypeOf("/tmp"), "tmpfs");
  EXPECT_THAT(DirEntries("/tmp"), IsEmpty());
  struct stat tmp;
  ASSERT_EQ(stat("/tmp", &tmp), 0);
  EXPECT_EQ(tmp.st_mode & 07777, 01777u);
}

TEST_F(SandboxTest, WritesStayInTheSandboxAndResetStoreRemovesThem) {
  const std::string marker = "zorv-sandbox-marker-" + std::to_string(getpid());
  ASSERT_EQ(mkdir("/usr/zorv", 0700), 0);
  ASSERT_EQ(mkdir("/usr/local/etc/zorvnotifyd", 0700), 0);
  ASSERT_EQ(mkdir("/tmp/zorvnotifyd_monitor_q.lock", 0700), 0);
  for (const std::string& path :
       {"/usr/zorv/" + marker, "/tmp/" + marker, "/usr/local/etc/zorvnotifyd/" + marker}) {
    std::ofstream(path) << "x";
  }

  // Look from the mount namespace of the process that started this one.
  const std::string parent_ns = "/proc/" + std::to_string(getppid()) + "/ns/mnt";
  ChildResult host = RunInChild([&] {
    struct stat ours, theirs;
    if (stat("/proc/self/ns/mnt", &ours) != 0 || stat(parent_ns.c_str(), &theirs) != 0) return 1;
    if (ours.st_ino == theirs.st_ino) return 2;
    // setns needs an unshared fs context; a sanitizer's helper thread may share it.
    int ns = open(parent_ns.c_str(), O_RDONLY | O_CLOEXEC);
    if (ns < 0) return 3;
    bool entered = unshare(CLONE_FS) == 0 && setns(ns, CLONE_NEWNS) == 0;
    close(ns);
    if (!entered) return 3;
    if (access(("/tmp/" + marker).c_str(), F_OK) == 0 ||
        access(("/usr/zorv/" + marker).c_str(), F_OK) == 0 ||
        access(("/usr/local/etc/zorvnotifyd/" + marker).c_str(), F_OK) == 0 ||
        access("/usr/lib/zorv-test", F_OK) == 0) {
      return 4;
    }
    return 0;
  });
  ASSERT_TRUE(host.exited) << host.error;
  EXPECT_EQ(host.result, 0) << "1: no ns, 2: same ns as the parent, 3: setns, 4: host sees writes";

  ResetStore();
  EXPECT_NE(access("/usr/zorv", F_OK), 0);
  EXPECT_NE(access("/usr/local/etc/zorvnotifyd", F_OK), 0);
  EXPECT_NE(access("/tmp/zorvnotifyd_monitor_q.lock", F_OK), 0);
  EXPECT_EQ(access("/usr/local/etc", F_OK), 0);
  EXPECT_EQ(access(("/tmp/" + marker).c_str(), F_OK), 0);  // only the store is reset
  unlink(("/tmp/" + marker).c_str());
}

TEST_F(SandboxTest, FakeSystemctlRecordsCallsStatusAndProcess) {
  EXPECT_EQ(RunSystemctl({"--no-block", "start", "zorvnotifyd"}), 0);
  SetSystemctlExitStatus(3);
  EXPECT_EQ(RunSystemctl({"--no-block", "stop", "zorvnotifyd"}, 0, 7), 3);
  EXPECT_EQ(RunSystemctl({"status"}, 1000), 3);
  EXPECT_THAT(SystemctlCalls(),
              ElementsAre("--no-block start zorvnotifyd", "--no-block stop zorvnotifyd", "status"));

  std::vector<SystemctlProcess> procs = SystemctlProcesses();
  ASSERT_EQ(procs.size(), 3u);
  EXPECT_EQ(procs[0].euid, 0u);
  EXPECT_EQ(procs[0].ruid, 0u);
  EXPECT_EQ(procs[0].egid, 0u);
  EXPECT_THAT(procs[0].fds, ElementsAre(0, 1, 2));
  EXPECT_TRUE(procs[0].stdin_null);
  EXPECT_TRUE(procs[0].stdout_null);
  EXPECT_THAT(procs[1].fds, ElementsAre(0, 1, 2, 7));  // a leaked descriptor shows
  // The shell gives up root when the real uid is another user's.
  EXPECT_EQ(procs[2].ruid, 1000u);
  EXPECT_EQ(procs[2].euid, 1000u);

  RemoveSystemctl();
  EXPECT_EQ(RunSystemctl({"start"}), 127);
  ResetStore();
  EXPECT_THAT(SystemctlCalls(), IsEmpty());
  EXPECT_THAT(SystemctlProcesses(), IsEmpty());
  EXPECT_EQ(RunSystemctl({"start", "x"}), 0);
  EXPECT_THAT(SystemctlCalls(), ElementsAre("start x"));
}

void CallVsyslog(int priority, const char* format, ...) {
  va_list args;
  va_start(args, format);
  vsyslog(priority, format, args);
  va_end(args);
}

TEST(SyslogCaptureTest, FormatsLinesKeepsErrnoAndFilters) {
  ClearLogs();
  // Not a literal: -Wpedantic rejects "%m" in a checked format.
  const char* errno_format = "%s:%d Failed [%m] %%m";
  errno = ENOENT;
  syslog(LOG_AUTH | LOG_ERR, errno_format, "src", 7);
  EXPECT_EQ(errno, ENOENT);
  errno = EACCES;
  CallVsyslog(LOG_INFO, "%s:%d v %m", "src", 8);
  EXPECT_EQ(errno, EACCES);
  __syslog_chk(LOG_ERR, 1, "%s:%d chk %s", "src", 9, std::string(2000, 'y').c_str());

  std::vector<LogLine> logs = CapturedLogs();
  ASSERT_EQ(logs.size(), 3u) << DumpLogs();
  EXPECT_EQ(logs[0].priority, 35);
  EXPECT_EQ(logs[0].format, "%s:%d Failed [%m] %%m");
  EXPECT_EQ(logs[0].text, "src:7 Failed [No such file or directory] %m");
  EXPECT_EQ(logs[1].priority, LOG_INFO);
  EXPECT_EQ(logs[1].text, "src:8 v Permission denied");
  EXPECT_EQ(logs[2].text, "src:9 chk " + std::string(2000, 'y'));

  ASSERT_EQ(LogsContaining("v Perm").size(), 1u);
  EXPECT_EQ(LogsContaining("v Perm")[0].text, logs[1].text);
  EXPECT_THAT(DumpLogs(), HasSubstr("35 src:7 Failed [No such file or directory] %m\n"));

  int openlogs = OpenlogCalls();
  openlog("x", 0, LOG_USER);
  EXPECT_EQ(OpenlogCalls(), openlogs + 1);
  ClearLogs();
  EXPECT_THAT(CapturedLogs(), IsEmpty());
}

TEST(SyslogCaptureTest, ConcurrentWritersLoseNothing) {
  ClearLogs();
  constexpr int kThreads = 4;
  constexpr int kLines = 500;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([t] {
      for (int i = 0; i < kLines; ++i) syslog(LOG_ERR, "%d %d", t, i);
    });
  }
  for (std::thread& thread : threads) thread.join();
  std::vector<LogLine> logs = CapturedLogs();
  ASSERT_EQ(logs.size(), static_cast<size_t>(kThreads * kLines));
  std::vector<int> next(kThreads, 0);
  for (const LogLine& line : logs) {
    int t = -1;
    int i = -1;
    ASSERT_EQ(sscanf(line.text.c_str(), "%d %d", &t, &i), 2) << line.text;
    ASSERT_EQ(i, next[t]++) << "lines of one thread out of order";
  }
  ClearLogs();
}

TEST(SyslogCaptureTest, CapturesLinesLoggedInsideTheLibrary) {
  ZORV_REQUIRE_SANDBOX();
  ResetStore();
  // Ids that cannot be raised: the library logs its failed switch.
  ChildResult child = RunAs(Ids{1000, 1000, 1000, 1000, 1000, 1000}, [] {
    ZORV::ZORVNOTIFYD::MonitorQueue::GetConfDir(ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR);
    return 0;
  });
  ASSERT_TRUE(child.exited) << child.error;
  std::vector<std::string> texts;
  for (const LogLine& line : child.logs) {
    EXPECT_THAT(line.text, ::testing::StartsWith("monitor_queue:"));
    texts.push_back(line.text);
  }
  EXPECT_THAT(texts, ::testing::Contains(
                         HasSubstr("Failed to create conf dir: /usr/zorv/etc/zorvnotifyd")));
}

class RunAsTest : public ::testing::Test {
 protected:
  void SetUp() override { ClearLogs(); }
};

TEST_F(RunAsTest, ReportsResultErrnoIdsAndOnlyTheChildsLogs) {
  const Ids before = CurrentIds();
  syslog(LOG_ERR, "parent line");
  const Ids ids{1000, 1001, 1002, 2000, 2001, 2002};
  ChildResult child = RunAs(ids, [] {
    syslog(LOG_ERR, "child %s", "line");
    for (int i = 0; i < 2000; ++i) syslog(LOG_INFO, "%0100d", i);  // more than a pipe holds
    errno = EACCES;
    return 42;
  });
  ASSERT_TRUE(child.exited) << child.error;
  EXPECT_EQ(child.result, 42);
  EXPECT_EQ(child.err, EACCES);
  EXPECT_EQ(child.after, ids);
  ASSERT_EQ(child.logs.size(), 2001u);
  EXPECT_EQ(child.logs[0].text, "child line");
  EXPECT_EQ(child.logs[0].format, "child %s");
  EXPECT_EQ(child.logs[2000].text, std::string(96, '0') + "1999");

  EXPECT_EQ(CurrentIds(), before);
  ASSERT_EQ(CapturedLogs().size(), 1u);
  EXPECT_EQ(CapturedLogs()[0].text, "parent line");

  // Supplementary groups are dropped: give the caller one first.
  ChildResult grouped = RunInChild([&ids] {
    gid_t group = 1234;
    if (setgroups(1, &group) != 0) return -1;
    ChildResult inner = RunAs(ids, [] { return getgroups(0, nullptr); });
    return inner.exited ? inner.result : -1;
  });
  ASSERT_TRUE(grouped.exited) << grouped.error;
  EXPECT_EQ(grouped.result, 0);

  ChildResult same = RunInChild([] { return 7; });
  ASSERT_TRUE(same.exited) << same.error;
  EXPECT_EQ(same.result, 7);
  EXPECT_EQ(same.err, 0);
  EXPECT_EQ(same.after, CurrentIds());
}

TEST_F(RunAsTest, ReportsChildrenThatDidNotFinish) {
  ChildResult killed = RunInChild([] { return raise(SIGKILL); });
  EXPECT_FALSE(killed.exited);
  EXPECT_THAT(killed.error, HasSubstr("signal 9"));

  ChildResult quit = RunInChild([]() -> int { _exit(3); });
  EXPECT_FALSE(quit.exited);
  EXPECT_THAT(quit.error, HasSubstr("status 3"));

  // Without root the child cannot take the ids it was given.
  ChildResult outer = RunAs(Ids{1000, 1000, 1000, 1000, 1000, 1000}, [] {
    ChildResult inner = RunAs(Ids{0, 0, 0, 0, 0, 0}, [] { return 0; });
    return !inner.exited && inner.error == "setgroups failed: Operation not permitted" ? 1 : 0;
  });
  ASSERT_TRUE(outer.exited) << outer.error;
  EXPECT_EQ(outer.result, 1);
}

}  // namespace
}  // namespace zorv_test
