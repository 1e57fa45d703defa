// Tests of the catalogue queries: which directory entries a scan loads, the
// order of the whole catalogue, what List and Get append or copy, and the
// lines of their failures.

#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/sandbox.h"
#include "support/syslog_capture.h"

namespace ZORV {
namespace ZORVNOTIFYD {
namespace {

using Names = std::vector<std::string>;

constexpr _tag_monitor_queue_type_ kEtc = MONITOR_QUEUE_TYPE_ETC_DIR;
const std::string kEtcDir = "/usr/zorv/etc/zorvnotifyd";

// A JSON array of queues named |names|, each watching "/<name>".
std::string QueuesText(const Names& names) {
  Json::Value root(Json::arrayValue);
  for (const std::string& name : names) {
    Json::Value config(Json::objectValue);
    config["path"] = "/" + name;
    config["mask"] = 1u;
    Json::Value queue(Json::objectValue);
    queue["queue"] = name;
    queue["config"].append(config);
    root.append(queue);
  }
  return root.toStyledString();
}

void WriteFile(const std::string& path, const std::string& text) { std::ofstream(path) << text; }

// Writes queue file |file| of |type|, creating the directory as needed.
void WriteQueues(_tag_monitor_queue_type_ type, const std::string& file, const Names& names) {
  WriteFile(MonitorQueue::GetConfDir(type) + "/" + file, QueuesText(names));
}

Names NamesOf(const std::vector<MonitorQueue>& queues) {
  Names names;
  for (const MonitorQueue& queue : queues) names.push_back(queue._name);
  return names;
}

// The captured lines as "<priority> <message>", the "monitor_queue:<n> "
// prefix checked and removed and the format checked to start "%s:%d ".
Names Messages() {
  const std::string source = "monitor_queue:";
  Names out;
  for (const zorv_test::LogLine& line : zorv_test::CapturedLogs()) {
    const std::string& text = line.text;
    const size_t end = text.find_first_not_of("0123456789", source.size());
    const bool ok = line.format.rfind("%s:%d ", 0) == 0 && text.rfind(source, 0) == 0 &&
                    end != source.size() && end != std::string::npos && text[end] == ' ';
    out.push_back(ok ? std::to_string(line.priority) + " " + text.substr(end + 1)
                     : "malformed: " + text);
  }
  return out;
}

// Puts LOG_LEVEL back when the test ends, however it ends.
class LogLevelGuard {
 public:
  LogLevelGuard() : saved_(LOG_LEVEL) {}
  LogLevelGuard(const LogLevelGuard&) = delete;
  LogLevelGuard& operator=(const LogLevelGuard&) = delete;
  ~LogLevelGuard() { LOG_LEVEL = saved_; }

 private:
  int saved_;
};

class CatalogueTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZORV_REQUIRE_SANDBOX();
    zorv_test::ResetStore();
    zorv_test::ClearLogs();
  }
};

TEST_F(CatalogueTest, ScanLoadsOnlyRegularVisibleFiles) {
  std::vector<MonitorQueue> queues = {MonitorQueue(Json::Value())};
  ASSERT_TRUE(MonitorQueue::LoadAllByType(queues, kEtc));  // the directory is created empty
  EXPECT_EQ(NamesOf(queues), Names{""});

  WriteQueues(kEtc, "q1", {"q1"});
  WriteQueues(kEtc, ".hidden", {"hidden"});
  ASSERT_EQ(mkdir((kEtcDir + "/sub").c_str(), 0700), 0);
  WriteFile(kEtcDir + "/sub/inner", QueuesText({"inner"}));
  ASSERT_EQ(symlink("/tmp/none", (kEtcDir + "/dangling").c_str()), 0);
  WriteFile("/tmp/target", QueuesText({"linked"}));
  ASSERT_EQ(symlink("/tmp/target", (kEtcDir + "/link").c_str()), 0);
  WriteFile(kEtcDir + "/bad", "[{\"queue\": \"broken\"}");
  WriteFile(kEtcDir + "/partial", R"([{"queue": "p"}, {"queue": {}}])");

  LogLevelGuard guard;
  for (int level : {3, 6, 7}) {
    SCOPED_TRACE(level);
    LOG_LEVEL = level;
    zorv_test::ClearLogs();
    queues.clear();
    ASSERT_TRUE(MonitorQueue::LoadAllByType(queues, kEtc));
    Names names = NamesOf(queues);
    std::sort(names.begin(), names.end());  // directory order is not fixed
    EXPECT_EQ(names, (Names{"linked", "p", "q1"}));
    Names lines = Messages();
    std::sort(lines.begin(), lines.end());
    const Names failed = {"3 load monitor config fail, path=" + kEtcDir + "/bad",
                          "3 load monitor config fail, path=" + kEtcDir + "/partial"};
    EXPECT_EQ(lines, level == 7 ? failed : Names{});
  }
}

TEST_F(CatalogueTest, LoadAllReplacesTheVectorWithTypesInOrder) {
  WriteQueues(MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR, "q", {"local"});
  WriteQueues(kEtc, "q", {"etc1", "etc2"});
  WriteQueues(MONITOR_QUEUE_TYPE_SHARE_DIR, "q", {"share"});
  std::vector<MonitorQueue> queues = {MonitorQueue(Json::Value())};
  ASSERT_TRUE(MonitorQueue::LoadAll(queues));
  EXPECT_EQ(NamesOf(queues), (Names{"share", "etc1", "etc2", "local"}));
  EXPECT_TRUE(Messages().empty()) << zorv_test::DumpLogs();

  // A directory that cannot be listed fails its type only.
  ASSERT_EQ(unlink("/usr/local/etc/zorvnotifyd/q"), 0);
  ASSERT_EQ(rmdir("/usr/local/etc/zorvnotifyd"), 0);
  WriteFile("/usr/local/etc/zorvnotifyd", QueuesText({"local"}));
  EXPECT_FALSE(MonitorQueue::LoadAll(queues));
  EXPECT_EQ(NamesOf(queues), (Names{"share", "etc1", "etc2"}));
  EXPECT_EQ(Messages(),
            (Names{"3 Failed to create conf dir: /usr/local/etc/zorvnotifyd",
                   "3 cannot open dir, path=/usr/local/etc/zorvnotifyd, reason=Not a directory"}));
}

TEST_F(CatalogueTest, ListAppendsAndGetCopiesTheFirstOfTheName) {
  WriteQueues(kEtc, "q", {"a", "b", "a"});
  std::vector<MonitorQueue> queues = {MonitorQueue(Json::Value())};
  ASSERT_TRUE(MonitorQueue::List(queues, "q", kEtc));
  ASSERT_TRUE(MonitorQueue::List(queues, "missing", kEtc));
  EXPECT_EQ(NamesOf(queues), (Names{"", "a", "b", "a"}));

  std::vector<MonitorQueue> file = {queues[1], queues[2], queues[3]};
  file[2]._configs[0]._path = "/second";
  file[0]._configs[0]._ignore = {"x.*"};
  ASSERT_TRUE(MonitorQueue::SaveToFile(file, kEtcDir + "/q"));
  MonitorQueue queue = queues[2];
  ASSERT_TRUE(MonitorQueue::Get(queue, "a", "q", kEtc));
  EXPECT_EQ(queue._name, "a");
  ASSERT_EQ(queue._configs.size(), 1u);
  EXPECT_EQ(queue._configs[0]._path, "/a");
  EXPECT_EQ(queue._configs[0]._ignore, Names{"x.*"});
  EXPECT_TRUE(Messages().empty()) << zorv_test::DumpLogs();

  WriteFile(kEtcDir + "/bad", "[");
  const struct {
    const char* name;
    const char* file;
    std::string line;
  } kFailures[] = {
      {"c", "q", "3 No such monitor queue: c"},
      {"A", "q", "3 No such monitor queue: A"},  // names are case-sensitive
      {"a", "missing", "3 No such monitor queue: a"},
      {"a", "bad", "3 LoadFromFile failed, path=" + kEtcDir + "/bad"},
  };
  for (const auto& c : kFailures) {
    SCOPED_TRACE(c.file + std::string(" ") + c.name);
    zorv_test::ClearLogs();
    MonitorQueue kept = queues[2];
    EXPECT_FALSE(MonitorQueue::Get(kept, c.name, c.file, kEtc));
    EXPECT_EQ(kept._name, "b");
    ASSERT_EQ(kept._configs.size(), 1u);
    EXPECT_EQ(kept._configs[0]._path, "/b");
    EXPECT_EQ(Messages(), Names{c.line});
  }
}

}  // namespace
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
