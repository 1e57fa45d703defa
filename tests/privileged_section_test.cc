// Tests of the effective-id switching around store operations, run for real
// in forked children with chosen ids: the exact lines in order, the ids and
// errno afterwards, and callers that cannot become root being refused
// without any trace on disk.

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <fstream>
#include <functional>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/run_as.h"
#include "support/sandbox.h"
#include "support/syslog_capture.h"

namespace ZORV {
namespace ZORVNOTIFYD {
namespace {

using zorv_test::Ids;
using Lines = std::vector<std::string>;

constexpr _tag_monitor_queue_type_ kEtc = MONITOR_QUEUE_TYPE_ETC_DIR;
const char kEtcDir[] = "/usr/zorv/etc/zorvnotifyd";
const char kQueueFile[] = "/usr/zorv/etc/zorvnotifyd/q";

// "<priority> <message>" of each line, after checking that the format was
// passed verbatim ("%s:%d " first) and removing the "monitor_queue:<n> "
// prefix.  A line of another shape is kept whole, so it fails comparisons.
Lines Messages(const std::vector<zorv_test::LogLine>& logs) {
  const std::string source = "monitor_queue:";
  Lines out;
  for (const zorv_test::LogLine& line : logs) {
    const std::string& text = line.text;
    const size_t end = text.find_first_not_of("0123456789", source.size());
    const bool ok = line.format.rfind("%s:%d ", 0) == 0 && text.rfind(source, 0) == 0 &&
                    end != source.size() && end != std::string::npos && text[end] == ' ';
    out.push_back(ok ? std::to_string(line.priority) + " " + text.substr(end + 1)
                     : "malformed: " + line.format + " | " + text);
  }
  return out;
}

Lines Concat(Lines a, const Lines& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

const std::string kGidUp = "38 WARNING: setresgid(-1, 0, -1)";
const std::string kUidUp = "38 WARNING: setresuid(-1, 0, -1)";
const std::string kGidDenied = "35 ERROR: setresgid(-1, 0, -1) [Operation not permitted]";
const std::string kUidDenied = "35 ERROR: setresuid(-1, 0, -1) [Operation not permitted]";
const std::string kEnterFailed = "35 ERROR: ENTERCriticalSection";
const std::string kDenied = "3 Permission denied";

struct Case {
  const char* name;
  Ids ids;             // uid r/e/s, gid r/e/s of the caller
  Lines enter, leave;  // lines of the entry and of the leave
  bool root;           // the root check passes
  int err;             // errno after the operation
  Ids after;           // ids after the operation
};

const Ids kRoot{0, 0, 0, 0, 0, 0};
const Ids kGidRoot{1000, 1000, 0, 0, 0, 0};
const Ids kMaySwitch{1000, 1000, 0, 100, 100, 0};
const Ids kMayNot{1000, 1000, 1000, 100, 100, 100};
const Ids kGidOnly{1000, 1000, 1000, 100, 100, 0};
const Ids kGidOnlyOdd{1000, 1000, 1000, 100, 200, 0};  // egid 200 cannot be taken back

const Case kCases[] = {
    {"root", kRoot, {}, {}, true, 0, kRoot},
    {"gid 0, uid 1000", kGidRoot, {kUidUp}, {kUidUp}, true, 0, kGidRoot},
    {"may switch", kMaySwitch, {kGidUp, kUidUp}, {kUidUp}, true, 0, kMaySwitch},
    {"may not switch", kMayNot, {kGidDenied, kEnterFailed}, {}, false, 0, kMayNot},
    {"gid only", kGidOnly, {kGidUp, kUidDenied, kEnterFailed}, {}, false, 0, kGidOnly},
    {"gid only, egid lost",
     kGidOnlyOdd,
     {kGidUp, kUidDenied, kEnterFailed},
     {"35 ERROR: setresgid(-1, 200, -1) [Operation not permitted]",
      "35 ERROR: LEAVECriticalSection"},
     false,
     EPERM,
     {1000, 1000, 1000, 100, 0, 0}},
};

MonitorQueue Queue(const std::string& name) {
  Json::Value value(Json::objectValue);
  value["queue"] = name;
  return MonitorQueue(value);
}

class PrivilegedSectionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZORV_REQUIRE_SANDBOX();
    zorv_test::ResetStore();
    zorv_test::ClearLogs();
  }
};

// Runs |fn| as the case's caller and checks the lines, errno and ids.
void Expect(const Case& c, const char* op, const std::function<int()>& fn, int result,
            const Lines& middle) {
  SCOPED_TRACE(std::string(c.name) + " / " + op);
  const zorv_test::ChildResult child = zorv_test::RunAs(c.ids, fn);
  ASSERT_TRUE(child.exited) << child.error;
  EXPECT_EQ(child.result, result);
  EXPECT_EQ(Messages(child.logs), Concat(Concat(c.enter, middle), c.leave));
  EXPECT_EQ(child.err, c.err);
  EXPECT_EQ(child.after, c.after);
}

TEST_F(PrivilegedSectionTest, SwitchesLogsAndRestoresForEveryKindOfCaller) {
  ASSERT_EQ(MonitorQueue::GetConfDir(kEtc), kEtcDir);
  for (const Case& c : kCases) {
    // The directory is 0700 root: a caller that stayed unprivileged cannot
    // even see it and tries, and fails, to create it.
    Expect(
        c, "GetConfDir", [] { return MonitorQueue::GetConfDir(kEtc) == kEtcDir ? 1 : 0; }, 1,
        c.root ? Lines{} : Lines{std::string("3 Failed to create conf dir: ") + kEtcDir});

    unlink(kQueueFile);
    Expect(
        c, "SaveToFile", [] { return MonitorQueue::SaveToFile({Queue("a")}, kQueueFile) ? 1 : 0; },
        c.root, c.root ? Lines{} : Lines{kDenied});
    struct stat st;
    if (c.root) {
      ASSERT_EQ(stat(kQueueFile, &st), 0) << c.name;
      EXPECT_EQ(st.st_uid, 0u) << c.name;  // written with the raised ids
      EXPECT_EQ(st.st_mode & 07777, 0600u) << c.name;
    } else {
      EXPECT_NE(stat(kQueueFile, &st), 0) << c.name;
      ASSERT_TRUE(MonitorQueue::SaveToFile({Queue("a")}, kQueueFile));
    }

    Expect(
        c, "LoadFromFile",
        [] {
          std::vector<MonitorQueue> queues;
          return MonitorQueue::LoadFromFile(queues, kQueueFile) ? static_cast<int>(queues.size())
                                                                : -1;
        },
        c.root ? 1 : -1, c.root ? Lines{} : Lines{kDenied});
  }
}

// Every store operation of a caller that cannot become root is refused
// before it touches anything, even where the caller's own rights would have
// sufficed (/tmp is writable by everyone).
TEST_F(PrivilegedSectionTest, CallerThatCannotBecomeRootTouchesNothing) {
  const char kLockFile[] = "/tmp/zorvnotifyd_monitor_q.lock";
  const char kTmpQueues[] = "/tmp/queues";
  std::ofstream(kTmpQueues) << R"([{"queue": "x"}])";
  chmod(kTmpQueues, 0666);
  const char kNewFile[] = "/tmp/new";
  // Each child works on its own copy of these; an operation reports -1 when
  // it succeeded, else how many queues the vector holds afterwards.
  std::vector<MonitorQueue> queues{Queue("keep")};
  MonitorQueue queue = Queue("keep");
  const struct {
    const char* name;
    std::function<bool()> run;
    int left;  // LoadAll empties the vector whatever happens next
  } kOps[] = {
      {"SaveToFile", [&] { return MonitorQueue::SaveToFile(queues, kNewFile); }, 1},
      {"LoadFromFile", [&] { return MonitorQueue::LoadFromFile(queues, kTmpQueues); }, 1},
      {"LoadAllByType", [&] { return MonitorQueue::LoadAllByType(queues, kEtc); }, 1},
      {"LoadAll", [&] { return MonitorQueue::LoadAll(queues); }, 0},
      {"List", [&] { return MonitorQueue::List(queues, "q", kEtc); }, 1},
      {"Get", [&] { return MonitorQueue::Get(queue, "x", "q", kEtc) || queue._name != "keep"; }, 1},
      {"Upsert", [&] { return MonitorQueue::Upsert(queue, "q", kEtc); }, 1},
      {"Delete", [&] { return MonitorQueue::Delete("keep", "q", kEtc); }, 1},
  };
  for (const auto& op : kOps) {
    SCOPED_TRACE(op.name);
    const zorv_test::ChildResult child =
        zorv_test::RunAs(kMayNot, [&] { return op.run() ? -1 : static_cast<int>(queues.size()); });
    ASSERT_TRUE(child.exited) << child.error;
    EXPECT_EQ(child.result, op.left);
    const Lines lines = Messages(child.logs);
    EXPECT_NE(std::find(lines.begin(), lines.end(), kDenied), lines.end());
    struct stat st;
    EXPECT_NE(lstat(kLockFile, &st), 0);
    EXPECT_NE(lstat(kNewFile, &st), 0);
    EXPECT_NE(lstat("/usr/zorv", &st), 0);
  }
  EXPECT_TRUE(zorv_test::SystemctlCalls().empty());
}

}  // namespace
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
