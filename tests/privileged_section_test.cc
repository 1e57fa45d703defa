// Effective-id switching around store operations, run for real in forked
// children with chosen ids: the exact lines in order, the ids and errno
// afterwards, and callers that cannot become root refused without a trace.

#include <unistd.h>

#include <functional>
#include <regex>
#include <tuple>

#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/run_as.h"
#include "support/sandbox.h"

namespace ZORV::ZORVNOTIFYD {

using zorv_test::Ids;

constexpr _tag_monitor_queue_type_ kEtc = MONITOR_QUEUE_TYPE_ETC_DIR;
const std::string kEtcDir = "/usr/zorv/etc/zorvnotifyd", kDenied = "3 Permission denied\n";
const std::string kGidUp = "38 WARNING: setresgid(-1, 0, -1)\n";
const std::string kUidUp = "38 WARNING: setresuid(-1, 0, -1)\n";
const std::string kGidFail = "35 ERROR: setresgid(-1, 0, -1) [Operation not permitted]\n";
const std::string kUidFail = "35 ERROR: setresuid(-1, 0, -1) [Operation not permitted]\n";
const std::string kEnterFail = "35 ERROR: ENTERCriticalSection\n";
const std::string kLeaveFail = "35 ERROR: LEAVECriticalSection\n";
const std::string kConfFail = "3 Failed to create conf dir: " + kEtcDir + "\n";
const Ids kRoot{0, 0, 0, 0, 0, 0}, kEgid0{1000, 1000, 0, 0, 0, 0};
const Ids kMaySwitch{1000, 1000, 0, 100, 100, 0}, kMayNot{1000, 1000, 1000, 100, 100, 100};
// Only the gid can be raised, and egid 200 cannot be taken back.
const Ids kLost{1000, 1000, 1000, 100, 200, 0}, kLostAfter{1000, 1000, 1000, 100, 0, 0};

// One "<priority> <message>\n" per line, "monitor_queue:<line> " removed;
// "?" marks a line whose format was not passed verbatim.
static std::string Messages(const std::vector<zorv_test::LogLine>& logs) {
  std::string out;
  for (const auto& l : logs)
    out += std::to_string(l.priority) + (l.format.rfind("%s:%d ", 0) ? " ?" : " ") + l.text + "\n";
  return std::regex_replace(out, std::regex("monitor_queue:[0-9]+ "), "");
}

// Callers that cannot become root are refused before anything is touched,
// even where their own rights would have sufficed (/tmp is writable by
// everyone).  Then, for every kind of caller, the exact lines of the entry
// and of the leave, the ids and errno afterwards.
TEST(PrivilegedSectionTest, SwitchesLogsAndRestoresForEveryKindOfCaller) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  std::vector<MonitorQueue> queues(1, Json::Value());  // each child has its own copy
  MonitorQueue queue{Json::Value()};
  const std::function<bool()> kRefused[] = {
      [&] { return MonitorQueue::SaveToFile(queues, "/tmp/new"); },
      [&] { return MonitorQueue::LoadFromFile(queues, "/tmp/none"); },
      [&] { return MonitorQueue::LoadAllByType(queues, kEtc); },
      [&] { return MonitorQueue::LoadAll(queues); },  // empties the vector first
      [&] { return MonitorQueue::List(queues, "q", kEtc); },
      [&] { return MonitorQueue::Get(queue, "x", "q", kEtc); },
      [&] { return MonitorQueue::Upsert(queue, "q", kEtc); },
      [&] { return MonitorQueue::Delete("x", "q", kEtc); },
  };
  for (const auto& op : kRefused) {
    const zorv_test::ChildResult child =
        zorv_test::RunAs(kMayNot, [&] { return op() ? -1 : static_cast<int>(queues.size()); });
    ASSERT_TRUE(child.exited) << child.error;
    EXPECT_EQ(child.result, &op == &kRefused[3] ? 0 : 1) << &op - kRefused;
    EXPECT_EQ(child.after, kMayNot) << &op - kRefused;
    EXPECT_NE(Messages(child.logs).find(kDenied), std::string::npos) << &op - kRefused;
    for (const char* path : {"/tmp/zorvnotifyd_monitor_q.lock", "/tmp/new", "/usr/zorv"})
      EXPECT_NE(access(path, F_OK), 0) << path;
  }
  EXPECT_TRUE(zorv_test::SystemctlCalls().empty());

  // 0700 root: a caller left unprivileged cannot see it and fails to create it.
  ASSERT_EQ(MonitorQueue::GetConfDir(kEtc), kEtcDir);
  // The caller's ids before and after, the lines of the entry and of the
  // leave, whether the root check passes, and errno afterwards.
  const std::tuple<Ids, Ids, std::string, std::string, bool, int> kCases[] = {
      {kRoot, kRoot, "", "", true, 0},
      {kEgid0, kEgid0, kUidUp, kUidUp, true, 0},
      {kMaySwitch, kMaySwitch, kGidUp + kUidUp, kUidUp, true, 0},
      {kMayNot, kMayNot, kGidFail + kEnterFail, "", false, 0},
      {kLost, kLostAfter, kGidUp + kUidFail + kEnterFail,
       "35 ERROR: setresgid(-1, 200, -1) [Operation not permitted]\n" + kLeaveFail, false, 1},
  };
  const std::function<int()> kOps[] = {
      [] { return MonitorQueue::GetConfDir(kEtc) == kEtcDir; },  // goes on without root
      [] { return MonitorQueue::SaveToFile({Json::Value()}, kEtcDir + "/q"); },
      [&] { return MonitorQueue::LoadFromFile(queues, kEtcDir + "/q"); },
  };
  for (const auto& [ids, after, enter, leave, root, err] : kCases) {
    for (const auto& op : kOps) {
      SCOPED_TRACE(testing::Message() << ids << ", operation " << &op - kOps);
      const zorv_test::ChildResult child = zorv_test::RunAs(ids, op);
      ASSERT_TRUE(child.exited) << child.error;
      EXPECT_EQ(child.result, root || &op == kOps);
      const std::string& refused = &op == kOps ? kConfFail : kDenied;
      EXPECT_EQ(Messages(child.logs), enter + (root ? "" : refused) + leave);
      EXPECT_EQ(child.err, err);
      EXPECT_EQ(child.after, after);
    }
  }
}

}  // namespace ZORV::ZORVNOTIFYD
