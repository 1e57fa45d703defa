// Tests of Upsert and Delete: file content after each case, the service
// requests seen by the sandbox's systemctl, failure paths that leave the
// file as it was, and concurrent writers in several processes.

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <fstream>
#include <set>
#include <sstream>

#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/run_as.h"
#include "support/sandbox.h"
#include "support/syslog_capture.h"

namespace ZORV {
namespace ZORVNOTIFYD {
namespace {

constexpr _tag_monitor_queue_type_ kEtc = MONITOR_QUEUE_TYPE_ETC_DIR;
const char kEtcFile[] = "/usr/zorv/etc/zorvnotifyd/q";
const std::vector<std::string> kStart = {"--no-block start zorvnotifyd"};
const std::vector<std::string> kStop = {"--no-block stop zorvnotifyd"};

MonitorQueue Queue(const std::string& name, const std::string& path = "/a") {
  Json::Value config(Json::objectValue);
  config["path"] = path;
  config["mask"] = 1u;
  Json::Value value(Json::objectValue);
  value["queue"] = name;
  value["config"].append(config);
  return MonitorQueue(value);
}

// "name@path" of every queue of the file, in order.
std::vector<std::string> Names(_tag_monitor_queue_type_ type = kEtc,
                               const std::string& file = "q") {
  std::vector<MonitorQueue> queues;
  EXPECT_TRUE(MonitorQueue::List(queues, file, type));
  std::vector<std::string> names;
  for (const MonitorQueue& queue : queues) {
    names.push_back(queue._name + "@" + (queue._configs.empty() ? "" : queue._configs[0]._path));
  }
  return names;
}

std::string ReadFile(const std::string& path) {
  std::ifstream in(path);
  std::stringstream text;
  text << in.rdbuf();
  return text.str();
}

void WriteFile(const std::string& path, const std::string& text) { std::ofstream(path) << text; }

class UpdatesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZORV_REQUIRE_SANDBOX();
    zorv_test::ResetStore();
    zorv_test::ClearLogs();
  }
};

TEST_F(UpdatesTest, UpsertAppendsOrReplacesTheFirstOfTheName) {
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("a"), "q", kEtc));  // the file does not exist yet
  EXPECT_EQ(Names(), (std::vector<std::string>{"a@/a"}));
  struct stat st;
  ASSERT_EQ(stat(kEtcFile, &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0600u);

  ASSERT_TRUE(MonitorQueue::Upsert(Queue("b"), "q", kEtc));
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("A"), "q", kEtc));  // names are case-sensitive
  ASSERT_TRUE(MonitorQueue::Upsert(Queue(""), "q", kEtc));   // an empty name is a name
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("a", "/new"), "q", kEtc));
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("", "/empty"), "q", kEtc));
  EXPECT_EQ(Names(), (std::vector<std::string>{"a@/new", "b@/a", "A@/a", "@/empty"}));

  // Only the first of two queues of one name is overwritten.
  WriteFile(kEtcFile, R"([{"queue": "d", "config": []}, {"queue": "d", "config": []}])");
  chmod(kEtcFile, 0644);
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("d", "/1"), "q", kEtc));
  EXPECT_EQ(Names(), (std::vector<std::string>{"d@/1", "d@"}));
  ASSERT_EQ(stat(kEtcFile, &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0600u);

  // The same queue stored twice: same content, the file rewritten, the
  // service asked again.
  const std::string before = ReadFile(kEtcFile);
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("d", "/1"), "q", kEtc));
  EXPECT_EQ(ReadFile(kEtcFile), before);
  EXPECT_EQ(zorv_test::SystemctlCalls(), std::vector<std::string>(8, kStart[0]));
  EXPECT_TRUE(zorv_test::CapturedLogs().empty()) << zorv_test::DumpLogs();
}

TEST_F(UpdatesTest, OtherFilesAndTypesAreNotLookedAt) {
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("a", "/other-file"), "r", kEtc));
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("a", "/share"), "q", MONITOR_QUEUE_TYPE_SHARE_DIR));
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("a", "/etc"), "q", kEtc));
  ASSERT_TRUE(MonitorQueue::Delete("a", "q", kEtc));
  EXPECT_EQ(Names(kEtc, "r"), (std::vector<std::string>{"a@/other-file"}));
  EXPECT_EQ(Names(MONITOR_QUEUE_TYPE_SHARE_DIR), (std::vector<std::string>{"a@/share"}));
  EXPECT_EQ(Names(), std::vector<std::string>{});
}

TEST_F(UpdatesTest, DeleteRemovesTheFirstAndStopsOnlyAnEmptyCatalogue) {
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("a", "/1"), "q", kEtc));
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("b"), "q", MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR));
  WriteFile(kEtcFile, R"([{"queue": "a", "config": []}, {"queue": "x"}, {"queue": "a"}])");
  const std::vector<std::string> starts = zorv_test::SystemctlCalls();

  ASSERT_TRUE(MonitorQueue::Delete("a", "q", kEtc));
  EXPECT_EQ(Names(), (std::vector<std::string>{"x@", "a@"}));
  ASSERT_TRUE(MonitorQueue::Delete("a", "q", kEtc));
  ASSERT_TRUE(MonitorQueue::Delete("x", "q", kEtc));
  EXPECT_EQ(Names(), std::vector<std::string>{});
  Json::Value on_disk;
  std::istringstream(ReadFile(kEtcFile)) >> on_disk;
  EXPECT_EQ(on_disk, Json::Value(Json::arrayValue));  // the file stays, holding []
  EXPECT_EQ(zorv_test::SystemctlCalls(), starts);     // a queue of type 2 remains

  ASSERT_TRUE(MonitorQueue::Delete("b", "q", MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR));
  std::vector<std::string> expected = starts;
  expected.push_back(kStop[0]);
  EXPECT_EQ(zorv_test::SystemctlCalls(), expected);
  EXPECT_TRUE(zorv_test::CapturedLogs().empty()) << zorv_test::DumpLogs();
}

TEST_F(UpdatesTest, DeleteOfAnAbsentNameWritesNothing) {
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("Name"), "q", kEtc));
  struct stat before;
  ASSERT_EQ(stat(kEtcFile, &before), 0);
  const std::string text = ReadFile(kEtcFile);
  const std::vector<std::string> calls = zorv_test::SystemctlCalls();
  for (const char* name : {"name", "Name ", ""}) EXPECT_TRUE(MonitorQueue::Delete(name, "q", kEtc));
  EXPECT_TRUE(MonitorQueue::Delete("Name", "missing", kEtc));
  struct stat after;
  ASSERT_EQ(stat(kEtcFile, &after), 0);
  EXPECT_EQ(ReadFile(kEtcFile), text);
  EXPECT_EQ(after.st_ino, before.st_ino);  // not even replaced by an equal file
  EXPECT_EQ(after.st_mtim.tv_nsec, before.st_mtim.tv_nsec);
  EXPECT_EQ(after.st_mtim.tv_sec, before.st_mtim.tv_sec);
  EXPECT_NE(access("/usr/zorv/etc/zorvnotifyd/missing", F_OK), 0);
  EXPECT_EQ(zorv_test::SystemctlCalls(), calls);
  EXPECT_TRUE(zorv_test::CapturedLogs().empty()) << zorv_test::DumpLogs();
}

TEST_F(UpdatesTest, ServiceFailuresAreLoggedAndDoNotChangeTheResult) {
  zorv_test::SetSystemctlExitStatus(3);
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("a"), "q", kEtc));
  ASSERT_TRUE(MonitorQueue::Delete("a", "q", kEtc));
  zorv_test::RemoveSystemctl();
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("a"), "q", kEtc));
  EXPECT_EQ(Names(), (std::vector<std::string>{"a@/a"}));

  const std::vector<zorv_test::LogLine> logs = zorv_test::CapturedLogs();
  ASSERT_EQ(logs.size(), 3u) << zorv_test::DumpLogs();
  EXPECT_EQ(logs[0].format, "%s:%d ZORBServiceStart failed: err=[0x%04X %s:%d]");
  EXPECT_EQ(logs[0].priority, LOG_ERR);
  EXPECT_NE(logs[0].text.find("ZORBServiceStart failed: err=[0x0203 service.cc:"),
            std::string::npos)
      << logs[0].text;
  EXPECT_NE(logs[1].text.find("ZORBServiceStop failed: err=[0x0203 service.cc:"), std::string::npos)
      << logs[1].text;
  // A host without systemctl: exec fails in the child, which exits 127.
  EXPECT_NE(logs[2].text.find("ZORBServiceStart failed: err=[0x027F "), std::string::npos)
      << logs[2].text;
}

// A set-user-ID-root style caller (real uid 1000, saved uid 0): systemctl
// runs with every id 0, standard streams on /dev/null and no inherited
// descriptor, although the store lock is held while it runs.
TEST_F(UpdatesTest, TheServiceRequestInheritsNoPrivilegeGapAndNoDescriptor) {
  const zorv_test::Ids setuid_caller = {1000, 1000, 0, 100, 100, 0};
  const zorv_test::ChildResult child = zorv_test::RunAs(
      setuid_caller, [] { return MonitorQueue::Upsert(Queue("a"), "q", kEtc) ? 1 : 0; });
  ASSERT_TRUE(child.exited);
  EXPECT_EQ(child.result, 1);
  EXPECT_EQ(child.after.euid, 1000u);
  EXPECT_EQ(child.after.egid, 100u);
  const std::vector<zorv_test::SystemctlProcess> runs = zorv_test::SystemctlProcesses();
  ASSERT_EQ(runs.size(), 1u);
  const zorv_test::SystemctlProcess& run = runs[0];
  EXPECT_EQ(std::vector<unsigned>({run.ruid, run.euid, run.suid, run.rgid, run.egid, run.sgid}),
            std::vector<unsigned>(6, 0));
  EXPECT_EQ(run.fds, (std::vector<int>{0, 1, 2}));
  EXPECT_TRUE(run.stdin_null);
  EXPECT_TRUE(run.stdout_null);
}

TEST_F(UpdatesTest, FailuresLeaveTheFileAsItWas) {
  ASSERT_EQ(MonitorQueue::GetConfDir(kEtc), "/usr/zorv/etc/zorvnotifyd");
  const std::string malformed = "[{\"queue\": \"a\"},";
  WriteFile(kEtcFile, malformed);
  zorv_test::ClearLogs();
  EXPECT_FALSE(MonitorQueue::Upsert(Queue("b"), "q", kEtc));
  EXPECT_FALSE(MonitorQueue::Delete("a", "q", kEtc));
  EXPECT_EQ(ReadFile(kEtcFile), malformed);
  ASSERT_EQ(zorv_test::CapturedLogs().size(), 2u) << zorv_test::DumpLogs();
  for (const zorv_test::LogLine& line : zorv_test::CapturedLogs()) {
    EXPECT_EQ(line.format, "%s:%d LoadFromFile failed, path=%s");
    EXPECT_NE(line.text.find("LoadFromFile failed, path=/usr/zorv/etc/zorvnotifyd/q"),
              std::string::npos);
  }

  // The store lock held by another process past the retries: the file is
  // not even read (it is still malformed, yet only "Lock failed" shows).
  const int held = open("/tmp/zorvnotifyd_monitor_q.lock", O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  ASSERT_GE(held, 0);
  const pid_t holder = fork();
  if (holder == 0) {
    flock(held, LOCK_EX);
    pause();
    _exit(0);
  }
  close(held);
  usleep(100000);
  srand(7);
  zorv_test::ClearLogs();
  EXPECT_FALSE(MonitorQueue::Upsert(Queue("b"), "q", kEtc));
  EXPECT_FALSE(MonitorQueue::Delete("a", "q", kEtc));
  kill(holder, SIGKILL);
  waitpid(holder, nullptr, 0);
  ASSERT_EQ(zorv_test::CapturedLogs().size(), 2u) << zorv_test::DumpLogs();
  EXPECT_EQ(zorv_test::LogsContaining("Lock failed").size(), 2u);
  EXPECT_EQ(ReadFile(kEtcFile), malformed);
  EXPECT_TRUE(zorv_test::SystemctlCalls().empty());
}

TEST_F(UpdatesTest, ACallerThatCannotBecomeRootChangesNothing) {
  const zorv_test::Ids user = {1000, 1000, 1000, 100, 100, 100};
  ASSERT_TRUE(MonitorQueue::Upsert(Queue("a"), "q", kEtc));
  const std::string text = ReadFile(kEtcFile);
  unlink("/tmp/zorvnotifyd_monitor_q.lock");
  const std::vector<std::string> calls = zorv_test::SystemctlCalls();
  for (const bool upsert : {true, false}) {
    const zorv_test::ChildResult child = zorv_test::RunAs(user, [upsert] {
      return upsert ? MonitorQueue::Upsert(Queue("b"), "q", kEtc)
                    : MonitorQueue::Delete("a", "q", kEtc);
    });
    ASSERT_TRUE(child.exited);
    EXPECT_EQ(child.result, 0);
    ASSERT_GE(child.logs.size(), 3u);
    const size_t n = child.logs.size();
    EXPECT_NE(child.logs[n - 3].text.find("ERROR: setresgid(-1, 0, -1) ["), std::string::npos);
    EXPECT_NE(child.logs[n - 2].text.find("ERROR: ENTERCriticalSection"), std::string::npos);
    EXPECT_EQ(child.logs[n - 1].format, "%s:%d Permission denied");
    EXPECT_EQ(child.after.euid, 1000u);
  }
  EXPECT_EQ(ReadFile(kEtcFile), text);
  EXPECT_NE(access("/tmp/zorvnotifyd_monitor_q.lock", F_OK), 0);  // no lock was taken
  EXPECT_EQ(zorv_test::SystemctlCalls(), calls);
}

// Several processes upsert and delete distinct queues of one file at once.
// Afterwards the file parses and holds exactly the queues whose last
// successful call was an upsert, and every refused call saw "Lock failed".
TEST_F(UpdatesTest, NothingIsLostUnderConcurrentWriters) {
  constexpr int kWriters = 4;
  constexpr int kRounds = 12;
  int pipes[kWriters][2];
  std::vector<pid_t> children;
  for (int w = 0; w < kWriters; ++w) {
    ASSERT_EQ(pipe(pipes[w]), 0);
    const pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
      srand(static_cast<unsigned>(getpid()));
      std::string report;
      for (int round = 0; round < kRounds; ++round) {
        const std::string name = "w" + std::to_string(w) + "-" + std::to_string(round % 5);
        const bool upsert = round % 3 != 2;
        zorv_test::ClearLogs();
        const bool ok = upsert ? MonitorQueue::Upsert(Queue(name), "q", kEtc)
                               : MonitorQueue::Delete(name, "q", kEtc);
        const bool lock_failed = !zorv_test::LogsContaining("Lock failed").empty();
        report +=
            (upsert ? "U " : "D ") + name + (ok ? " 1" : " 0") + (lock_failed ? " L\n" : " -\n");
      }
      (void)!write(pipes[w][1], report.data(), report.size());
      _exit(0);
    }
    close(pipes[w][1]);
    children.push_back(pid);
  }
  std::set<std::string> expected;
  for (int w = 0; w < kWriters; ++w) {
    std::string report;
    char buffer[4096];
    ssize_t n;
    while ((n = read(pipes[w][0], buffer, sizeof buffer)) > 0) report.append(buffer, n);
    close(pipes[w][0]);
    int status = 0;
    ASSERT_EQ(waitpid(children[w], &status, 0), children[w]);
    ASSERT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
    std::istringstream lines(report);
    std::string op, name, ok, lock;
    int calls = 0;
    while (lines >> op >> name >> ok >> lock) {
      ++calls;
      if (ok == "0") {
        EXPECT_EQ(lock, "L") << op << " " << name << " failed without \"Lock failed\"";
        continue;
      }
      if (op == "U") expected.insert(name);
      if (op == "D") expected.erase(name);
    }
    EXPECT_EQ(calls, kRounds);
  }
  std::vector<std::string> names;
  for (const std::string& entry : Names()) names.push_back(entry.substr(0, entry.find('@')));
  EXPECT_EQ(std::set<std::string>(names.begin(), names.end()), expected);
  EXPECT_EQ(names.size(), expected.size());  // no queue stored twice
}

}  // namespace
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
