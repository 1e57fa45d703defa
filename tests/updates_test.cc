// Upsert and Delete: the queue files after each call, the service requests
// seen by the sandbox's systemctl, refused calls that change nothing, and
// concurrent writers in several processes.

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <fstream>
#include <iterator>
#include <set>
#include <sstream>

#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/run_as.h"
#include "support/sandbox.h"

namespace ZORV::ZORVNOTIFYD {
namespace {

constexpr auto kShare = MONITOR_QUEUE_TYPE_SHARE_DIR;
constexpr auto kEtc = MONITOR_QUEUE_TYPE_ETC_DIR;
constexpr auto kLocal = MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR;
const char kFile[] = "/usr/zorv/etc/zorvnotifyd/q";
const char kLock[] = "/tmp/zorvnotifyd_monitor_q.lock";

MonitorQueue Queue(const std::string& name, const std::string& path = "/a") {
  Json::Value value;
  value["queue"] = name;
  value["config"][0]["path"] = path;
  value["config"][0]["mask"] = 1u;
  return MonitorQueue(value);
}

// "name@path" of each queue of the file, in order, separated by blanks.
std::string Names(const std::string& file = "q", _tag_monitor_queue_type_ type = kEtc) {
  std::vector<MonitorQueue> queues;
  EXPECT_TRUE(MonitorQueue::List(queues, file, type));
  std::string names;
  for (const MonitorQueue& q : queues)
    names += (names.empty() ? "" : " ") + q._name + "@" +
             (q._configs.empty() ? "" : q._configs[0]._path);
  return names;
}

std::string ReadFile(const std::string& path) {
  return {std::istreambuf_iterator<char>(std::ifstream(path).rdbuf()), {}};
}

class UpdatesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZORV_REQUIRE_SANDBOX();
    zorv_test::ResetStore();
    zorv_test::ClearLogs();
  }
};

// A run of calls on four queue files; after each, the content of the file
// the call named and the service request the call made.
TEST_F(UpdatesTest, UpsertAndDeleteStepByStep) {
  const struct {
    char op;  // 'U' Upsert, 'D' Delete, 'L' only look, 'W' write |name| as the file
    const char* name;
    const char* path;  // of the upserted queue
    const char* file;
    _tag_monitor_queue_type_ type;
    const char* after;    // Names(file, type) afterwards
    const char* service;  // the request: "start", "stop" or "" for none
  } kSteps[] = {
      {'U', "a", "/a", "q", kEtc, "a@/a", "start"},  // a new file
      {'U', "b", "/a", "q", kEtc, "a@/a b@/a", "start"},
      {'U', "A", "/a", "q", kEtc, "a@/a b@/a A@/a", "start"},  // case counts
      {'U', "", "/a", "q", kEtc, "a@/a b@/a A@/a @/a", "start"},
      {'U', "a", "/n", "q", kEtc, "a@/n b@/a A@/a @/a", "start"},  // in place
      {'U', "", "/e", "q", kEtc, "a@/n b@/a A@/a @/e", "start"},
      {'U', "", "/e", "q", kEtc, "a@/n b@/a A@/a @/e", "start"},  // the same again
      {'U', "a", "/r", "r", kEtc, "a@/r", "start"},
      {'U', "a", "/s", "q", kShare, "a@/s", "start"},
      {'D', "a", "", "q", kEtc, "b@/a A@/a @/e", ""},
      {'L', "", "", "r", kEtc, "a@/r", ""},  // other files and types untouched
      {'L', "", "", "q", kShare, "a@/s", ""},
      {'D', "B", "", "q", kEtc, "b@/a A@/a @/e", ""},  // not found: no write
      {'D', "b ", "", "q", kEtc, "b@/a A@/a @/e", ""},
      {'D', "a", "", "q", kEtc, "b@/a A@/a @/e", ""},
      {'D', "a", "", "missing", kEtc, "", ""},  // not created
      {'D', "", "", "q", kEtc, "b@/a A@/a", ""},
      {'W', R"([{"queue": "d"}, {"queue": "d"}])", "", "q", kEtc, "d@ d@", ""},
      {'U', "d", "/1", "q", kEtc, "d@/1 d@", "start"},  // only the first of a name
      {'D', "d", "", "q", kEtc, "d@", ""},
      {'D', "d", "", "q", kEtc, "", ""},
      // The service stops when no queue is left in any of the three types.
      {'D', "a", "", "r", kEtc, "", ""},  // type 0 holds one
      {'U', "a", "/l", "q", kLocal, "a@/l", "start"},
      {'D', "a", "", "q", kShare, "", ""},  // type 2 holds one
      {'U', "a", "/r", "r", kEtc, "a@/r", "start"},
      {'D', "a", "", "q", kLocal, "", ""},  // type 1 holds one
      {'D', "a", "", "r", kEtc, "", "stop"},
  };
  std::vector<std::string> requests;
  for (const auto& s : kSteps) {
    SCOPED_TRACE(std::string(1, s.op) + " \"" + s.name + "\" " + s.file + std::to_string(s.type));
    const std::string path = MonitorQueue::GetConfDir(s.type) + "/" + s.file;
    const std::string names = Names(s.file, s.type), text = ReadFile(path);
    struct stat was = {}, is = {};
    const int existed = stat(path.c_str(), &was);
    if (s.op == 'W') std::ofstream(path) << s.name;
    EXPECT_TRUE(s.op != 'U' || MonitorQueue::Upsert(Queue(s.name, s.path), s.file, s.type));
    EXPECT_TRUE(s.op != 'D' || MonitorQueue::Delete(s.name, s.file, s.type));
    if (*s.service) requests.push_back(std::string("--no-block ") + s.service + " zorvnotifyd");
    EXPECT_EQ(zorv_test::SystemctlCalls(), requests);
    EXPECT_EQ(Names(s.file, s.type), s.after);
    // A file stays on disk, also when emptied (Names() read it as an empty
    // list); a missing one is not created.
    EXPECT_EQ(stat(path.c_str(), &is), s.op == 'D' && existed != 0 ? -1 : 0);
    if (s.op == 'D' && names == s.after) {  // nothing removed: the file as it was
      EXPECT_EQ(ReadFile(path), text);
      EXPECT_TRUE(is.st_ino == was.st_ino && is.st_mtim.tv_sec == was.st_mtim.tv_sec &&
                  is.st_mtim.tv_nsec == was.st_mtim.tv_nsec);
    }
  }
  EXPECT_TRUE(zorv_test::CapturedLogs().empty()) << zorv_test::DumpLogs();
}

// A set-user-ID-root style caller (real uid 1000, saved uid 0): systemctl
// runs with every id 0, its standard streams on /dev/null and no inherited
// descriptor, although the store lock is held while it runs.  A failing or
// missing systemctl is logged with the platform's error and leaves the
// result true.
TEST_F(UpdatesTest, TheServiceRequestGetsRootIdsAndNoDescriptorAndMayFail) {
  const zorv_test::Ids caller = {1000, 1000, 0, 100, 100, 0};
  const zorv_test::ChildResult child =
      zorv_test::RunAs(caller, [] { return MonitorQueue::Upsert(Queue("a"), "q", kEtc); });
  EXPECT_TRUE(child.exited && child.result == 1 && child.after == caller) << child.error;
  const std::vector<zorv_test::SystemctlProcess> runs = zorv_test::SystemctlProcesses();
  ASSERT_EQ(runs.size(), 1u);
  const zorv_test::SystemctlProcess& run = runs[0];
  EXPECT_EQ((zorv_test::Ids{run.ruid, run.euid, run.suid, run.rgid, run.egid, run.sgid}),
            zorv_test::Ids{});
  EXPECT_EQ(run.fds, (std::vector<int>{0, 1, 2}));
  EXPECT_TRUE(run.stdin_null && run.stdout_null);

  zorv_test::SetSystemctlExitStatus(3);
  EXPECT_TRUE(MonitorQueue::Delete("a", "q", kEtc));
  EXPECT_TRUE(MonitorQueue::Upsert(Queue("a"), "q", kEtc));
  zorv_test::RemoveSystemctl();  // exec fails in the child, which exits 127
  EXPECT_TRUE(MonitorQueue::Upsert(Queue("a", "/b"), "q", kEtc));
  EXPECT_EQ(Names(), "a@/b");
  const auto logs = zorv_test::CapturedLogs();
  ASSERT_EQ(logs.size(), 3u) << zorv_test::DumpLogs();
  const char* const kWant[][2] = {
      {"Stop", "0x0203 service.cc:"}, {"Start", "0x0203 service.cc:"}, {"Start", "0x027F "}};
  for (size_t i = 0; i < logs.size(); ++i) {
    const std::string failed = std::string("ZORBService") + kWant[i][0] + " failed: err=[";
    EXPECT_EQ(std::to_string(logs[i].priority) + " " + logs[i].format,
              "3 %s:%d " + failed + "0x%04X %s:%d]");
    EXPECT_NE(logs[i].text.find(failed + kWant[i][1]), std::string::npos) << logs[i].text;
  }
}

// Refused calls return false, log why and leave a malformed file as it was,
// with no service request.  With the lock held by another writer the file is
// not even read.
TEST_F(UpdatesTest, RefusedCallsChangeNothing) {
  ASSERT_EQ(MonitorQueue::GetConfDir(kEtc) + "/q", kFile);
  const std::string malformed = R"([{"queue": "a"},)";
  std::ofstream(kFile) << malformed;
  for (const bool lock_held : {false, true}) {
    int held = -1;  // another writer (this process) holds the store lock
    ASSERT_TRUE(!lock_held || Lock(held, kLock));
    for (const bool upsert : {true, false}) {
      zorv_test::ClearLogs();
      EXPECT_FALSE(upsert ? MonitorQueue::Upsert(Queue("b"), "q", kEtc)
                          : MonitorQueue::Delete("a", "q", kEtc));
      const std::vector<zorv_test::LogLine> logs = zorv_test::CapturedLogs();
      ASSERT_EQ(logs.size(), 1u) << zorv_test::DumpLogs();
      const std::string& line = logs[0].text;  // "monitor_queue:<line> <message>"
      EXPECT_EQ(
          line.substr(0, line.find(':')) + line.substr(line.find(' ')),
          std::string("monitor_queue ") +
              (lock_held ? "Lock failed" : "LoadFromFile failed, path=" + std::string(kFile)));
    }
    Unlock(held);
  }
  EXPECT_EQ(ReadFile(kFile), malformed);
  EXPECT_TRUE(zorv_test::SystemctlCalls().empty());
}

// Several processes upsert and delete distinct queues of one file at once.
// Afterwards the file holds exactly the queues whose last successful call was
// an upsert, and every refused call logged "Lock failed".
TEST_F(UpdatesTest, ConcurrentWritersLoseNothing) {
  constexpr char kWriters = 4, kRounds = 12;
  const auto name = [](int w, int r) {
    return "w" + std::to_string(w) + "-" + std::to_string(r % 5);
  };
  int report[2];
  ASSERT_EQ(pipe(report), 0);
  for (char w = 0; w < kWriters; ++w) {
    if (fork() != 0) continue;
    srand(static_cast<unsigned>(getpid()));
    for (char r = 0; r < kRounds; ++r) {
      zorv_test::ClearLogs();
      const bool ok = r % 3 != 2 ? MonitorQueue::Upsert(Queue(name(w, r)), "q", kEtc)
                                 : MonitorQueue::Delete(name(w, r), "q", kEtc);
      const char record[4] = {w, r, ok, !zorv_test::LogsContaining("Lock failed").empty()};
      (void)!write(report[1], record, sizeof record);  // atomic: shorter than PIPE_BUF
    }
    _exit(0);
  }
  close(report[1]);
  std::set<std::string> expected;
  int calls = 0;
  for (char rec[4]; read(report[0], rec, sizeof rec) == sizeof rec; ++calls) {
    const std::string queue = name(rec[0], rec[1]) + "@/a";
    EXPECT_TRUE(rec[2] || rec[3]) << queue << " refused without \"Lock failed\"";
    if (rec[2] && rec[1] % 3 != 2) expected.insert(queue);
    if (rec[2] && rec[1] % 3 == 2) expected.erase(queue);
  }
  close(report[0]);
  for (int status = 0; wait(&status) > 0;)
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_EQ(calls, kWriters * kRounds);
  std::istringstream names(Names());
  EXPECT_EQ(std::multiset<std::string>(std::istream_iterator<std::string>(names), {}),
            std::multiset<std::string>(expected.begin(), expected.end()));
}

}  // namespace
}  // namespace ZORV::ZORVNOTIFYD
