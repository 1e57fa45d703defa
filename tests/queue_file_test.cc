// Tests of queue files: what a save writes and a load appends, the files a
// load refuses, the file mode, and the temporary files of the atomic write.

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <syslog.h>
#include <unistd.h>

#include <fstream>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/sandbox.h"
#include "support/syslog_capture.h"

namespace ZORV {
namespace ZORVNOTIFYD {
namespace {

const char kDir[] = "/tmp/queues";
const char kFile[] = "/tmp/queues/q";

MonitorQueue Queue(const std::string& name, const std::string& path = "/a", unsigned mask = 1,
                   const std::vector<std::string>& ignore = {}) {
  Json::Value config(Json::objectValue);
  config["path"] = path;
  config["mask"] = mask;
  config["ignore"] = Json::Value(Json::arrayValue);
  for (const std::string& pattern : ignore) config["ignore"].append(pattern);
  Json::Value value(Json::objectValue);
  value["queue"] = name;
  value["config"].append(config);
  return MonitorQueue(value);
}

// The records as one comparable text: names, then each configuration.
std::string Describe(const std::vector<MonitorQueue>& queues) {
  std::ostringstream out;
  for (const MonitorQueue& queue : queues) {
    out << "[" << queue._name;
    for (const MonitorQueue::MonitorQueueConfig& config : queue._configs) {
      out << " {" << config._path << " " << config._mask;
      for (const std::string& pattern : config._ignore) out << " " << pattern;
      out << "}";
    }
    out << "]";
  }
  return out.str();
}

void WriteFile(const std::string& path, const std::string& text) { std::ofstream(path) << text; }

// The names in |kDir|, "." and ".." left out.
std::set<std::string> DirEntries() {
  std::set<std::string> names;
  DIR* dir = opendir(kDir);
  if (dir == nullptr) return names;
  while (const struct dirent* entry = readdir(dir)) {
    const std::string name = entry->d_name;
    if (name != "." && name != "..") names.insert(name);
  }
  closedir(dir);
  return names;
}

// A process holding an exclusive flock on |path| (created when missing)
// until it is killed, like a writer killed in the middle of a save.  The
// lock is taken here and the descriptor handed to a child, so the child is
// the only holder.
class LockHolder {
 public:
  explicit LockHolder(const std::string& path) {
    const int fd = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd >= 0 && flock(fd, LOCK_EX) == 0 && (pid_ = fork()) == 0) {
      pause();
      _exit(0);
    }
    if (fd >= 0) close(fd);
  }
  LockHolder(const LockHolder&) = delete;
  LockHolder& operator=(const LockHolder&) = delete;
  ~LockHolder() { Kill(); }
  bool held() const { return pid_ > 0; }
  void Kill() {
    if (pid_ > 0 && kill(pid_, SIGKILL) == 0) waitpid(pid_, nullptr, 0);
    pid_ = -1;
  }

 private:
  pid_t pid_ = -1;
};

class QueueFileTest : public ::testing::Test {
 protected:
  void SetUp() override {
    ZORV_REQUIRE_SANDBOX();
    zorv_test::ResetStore();
    for (const std::string& name : DirEntries()) unlink((std::string(kDir) + "/" + name).c_str());
    rmdir(kDir);
    ASSERT_EQ(mkdir(kDir, 0700), 0);
    zorv_test::ClearLogs();
  }
};

TEST_F(QueueFileTest, SaveThenLoadAppendsTheSameQueuesInOrder) {
  const std::vector<MonitorQueue> saved = {Queue("a", "/a", 7, {"x.*", "[bad"}),
                                           Queue("b", "/share/b", 0xffffffffu), Queue("a", "/2")};
  WriteFile(kFile, "old");
  ASSERT_EQ(chmod(kFile, 0666), 0);
  ASSERT_TRUE(MonitorQueue::SaveToFile(saved, kFile));
  struct stat st;
  ASSERT_EQ(stat(kFile, &st), 0);
  EXPECT_EQ(st.st_mode & 07777, 0600u);

  std::vector<MonitorQueue> loaded = {Queue("p1"), Queue("p2")};
  ASSERT_TRUE(MonitorQueue::LoadFromFile(loaded, kFile));
  EXPECT_EQ(Describe(loaded), Describe({Queue("p1"), Queue("p2")}) + Describe(saved));

  // An empty vector is an empty array, which loads as nothing.
  ASSERT_TRUE(MonitorQueue::SaveToFile({}, kFile));
  Json::Value root;
  std::ifstream(kFile) >> root;
  EXPECT_EQ(root, Json::Value(Json::arrayValue));
  ASSERT_TRUE(MonitorQueue::LoadFromFile(loaded, kFile));
  EXPECT_EQ(loaded.size(), 5u);
  // So does a file that does not exist.
  ASSERT_TRUE(MonitorQueue::LoadFromFile(loaded, "/tmp/queues/missing"));
  EXPECT_EQ(loaded.size(), 5u);
  EXPECT_EQ(DirEntries(), std::set<std::string>{"q"});  // no temporary file left
  EXPECT_TRUE(zorv_test::CapturedLogs().empty()) << zorv_test::DumpLogs();
}

TEST_F(QueueFileTest, LoadOfEachKindOfFileAppendsWhatItCan) {
  const struct {
    const char* text;
    bool result;
    std::vector<std::string> names;  // after the queue already in the vector
  } kCases[] = {
      {"", false, {}},
      {"[{\"queue\": ", false, {}},
      {"[] []", false, {}},
      {"[] x", false, {}},
      {"{}", false, {}},
      {"\"[]\"", false, {}},
      {"null", false, {}},
      {"[]", true, {}},
      {R"([{"queue": "a"}, {"queue": "b"}, {"queue": ["c"]}, {"queue": "d"}])", false, {"a", "b"}},
      {R"([1, "x", null, [], {"queue": "a"}, {"queue": "a"}])", true, {"", "", "", "", "a", "a"}},
  };
  for (const auto& c : kCases) {
    SCOPED_TRACE(c.text);
    WriteFile(kFile, c.text);
    std::vector<MonitorQueue> queues = {Queue("pre")};
    EXPECT_EQ(MonitorQueue::LoadFromFile(queues, kFile), c.result);
    std::vector<std::string> names;
    for (const MonitorQueue& queue : queues) {
      names.push_back(queue._name);
      EXPECT_TRUE(!queue._name.empty() || queue._configs.empty());
    }
    names.erase(names.begin());
    EXPECT_EQ(names, c.names);
    EXPECT_EQ(queues[0]._name, "pre");
  }
  EXPECT_TRUE(zorv_test::CapturedLogs().empty()) << zorv_test::DumpLogs();
}

TEST_F(QueueFileTest, SaveIntoAMissingDirectoryFails) {
  EXPECT_FALSE(MonitorQueue::SaveToFile({Queue("a")}, "/tmp/queues/none/q"));
  const std::vector<zorv_test::LogLine> logs = zorv_test::CapturedLogs();
  ASSERT_EQ(logs.size(), 1u) << zorv_test::DumpLogs();
  EXPECT_EQ(logs[0].priority, LOG_ERR);
  EXPECT_EQ(logs[0].format, "%s:%d Failed to save json");
  EXPECT_EQ(logs[0].text.rfind("monitor_queue:", 0), 0u) << logs[0].text;
  EXPECT_EQ(logs[0].text.substr(logs[0].text.find(' ')), " Failed to save json");
  EXPECT_EQ(DirEntries(), std::set<std::string>{});
}

// A temporary file left by a killed writer goes with the next save of the
// same file; one whose writer still holds it stays until it is released.
TEST_F(QueueFileTest, SaveRemovesOnlyAbandonedTemporaryFiles) {
  const std::string stale = ".q.tmp.AbC123";
  WriteFile(std::string(kDir) + "/" + stale, "[");
  const std::string busy = ".q.tmp.XyZ789";
  LockHolder holder(std::string(kDir) + "/" + busy);
  ASSERT_TRUE(holder.held());
  ASSERT_TRUE(MonitorQueue::SaveToFile({Queue("a")}, kFile));
  EXPECT_EQ(DirEntries(), (std::set<std::string>{"q", busy}));
  holder.Kill();
  ASSERT_TRUE(MonitorQueue::SaveToFile({Queue("b")}, kFile));
  EXPECT_EQ(DirEntries(), std::set<std::string>{"q"});
  std::vector<MonitorQueue> queues;
  ASSERT_TRUE(MonitorQueue::LoadFromFile(queues, kFile));
  EXPECT_EQ(Describe(queues), Describe({Queue("b")}));
}

}  // namespace
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
