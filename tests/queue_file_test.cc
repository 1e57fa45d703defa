// Queue files: what a save writes and a load appends, the files a load
// refuses, the file mode, and the temporary files of the atomic write.

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <sstream>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "platform/platform.h"
#include "support/run_as.h"
#include "support/sandbox.h"
#include "support/syslog_capture.h"

static std::string g_link_to;

// The library's rename lands here, as its syslog does.  Once |g_link_to| is
// set, the next rename is followed by a link to it put in place of the
// renamed file, as another user could do in a directory open to them; a
// link that cannot be put makes the rename fail, so the test sees it.
extern "C" int rename(const char* from, const char* to) noexcept {
  int result = renameat(AT_FDCWD, from, AT_FDCWD, to);
  if (result == 0 && !g_link_to.empty() &&
      (unlink(to) != 0 || symlink(g_link_to.c_str(), to) != 0)) {
    result = -1;
  }
  g_link_to.clear();
  return result;
}

namespace ZORV::ZORVNOTIFYD {

namespace fs = std::filesystem;
const std::string kDir = "/usr/zorv", kFile = kDir + "/q";  // the store reset removes it

// The queues of a JSON array text.
static std::vector<MonitorQueue> Parse(const std::string& text) {
  Json::Value root;
  std::istringstream(text) >> root;
  return std::vector<MonitorQueue>(root.begin(), root.end());
}

// The records as comparable text, their bytes as they are.
static std::string Describe(const std::vector<MonitorQueue>& queues) {
  std::string out;
  for (const MonitorQueue& queue : queues) {
    out += "queue " + queue._name + "\n";
    for (const auto& config : queue._configs) {
      out += " path " + config._path + " mask " + std::to_string(config._mask) + "\n";
      for (const std::string& pattern : config._ignore) out += "  ignore " + pattern + "\n";
    }
  }
  return out;
}

TEST(QueueFileTest, LoadAppendsWhatAFileHoldsAndSaveWritesItBack) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  zorv_test::ClearLogs();
  ASSERT_TRUE(fs::create_directory(kDir));
  // File text, then the result and the names in the vector afterwards, "+" per configuration.
  std::vector<std::pair<std::string, std::string>> cases = {
      {"[]", "1 pre,"},
      {R"([{"queue":"a"},{"queue":"b"},{"queue":["c"]},{"queue":"d"}])", "0 pre,a,b,"},
      {R"([1, "x", null, [], {"queue": "a"}, {"queue": "a"}])", "1 pre,,,,,a,a,"},
      {R"([{"queue":"a"}, {"config":[{"mask":4294967296}]}, {"queue":"b"}])", "0 pre,a,"}};
  for (const char* bad : {"", "[{\"queue\": ", "[] []", "{}", "\"[]\"", "null"})
    cases.emplace_back(bad, "0 pre,");  // not JSON, or not an array
  for (const auto& [text, seen] : cases) {
    std::ofstream(kFile) << text;
    std::vector<MonitorQueue> queues = Parse(R"([{"queue": "pre"}])");
    std::string got = MonitorQueue::LoadFromFile(queues, kFile) ? "1 " : "0 ";
    for (const auto& q : queues) got += q._name + std::string(q._configs.size(), '+') + ",";
    EXPECT_EQ(got, seen) << text;
  }
  // Whatever reads a file, the records are those of the JSON reader's value:
  // plain files with escapes, raw bytes and missing members, and files with
  // comments, \u escapes, repeated keys (the last wins), other keys and
  // numbers in other forms.
  for (const std::string text :
       {"[ {\"config\":[{},{\"ignore\":[]}]} "
        ",\r\n\t{\"queue\":\"\\\"\\\\\\/\\b\\f\\n\\r\\t\x01\xff\","
        "\"config\":[{\"mask\":0,\"ignore\":[\"\",\"a\"],\"path\":\"/p\"}]}]\n",
        R"([{"queue":"a","queue":"b","config":[{"mask":7,"mask":9,"path":"x","path":"y"}]}])",
        R"([{"queue":"a"}, {"queue":"\u00e9\ud83d\ude00\u0000x"}])",
        R"([/**/{"queue":"a","x":1,"config":[{"mask":1e1},{"mask":0012}]}] // end)"}) {
    std::ofstream(kFile) << text;
    std::vector<MonitorQueue> queues = Parse(R"([{"queue": "pre"}])");
    EXPECT_TRUE(MonitorQueue::LoadFromFile(queues, kFile)) << text;
    EXPECT_EQ(Describe(queues), Describe(Parse(R"([{"queue": "pre"}])")) + Describe(Parse(text)));
  }

  const std::vector<MonitorQueue> saved = Parse(R"([
      {"queue": "a", "config": [{"path": "/a", "mask": 7, "ignore": ["x.*", "[bad"]}]},
      {"queue": "b", "config": [{"path": "/share/b", "mask": 4294967295}]}, {"queue": "a"}])");
  fs::permissions(kFile, fs::perms(0666));
  std::ofstream(kDir + "/.q.tmp.AbC123") << "[";  // left by a killed writer
  ASSERT_TRUE(MonitorQueue::SaveToFile(saved, kFile));
  EXPECT_EQ(fs::status(kFile).permissions(), fs::perms(0600));
  EXPECT_EQ(std::distance(fs::directory_iterator(kDir), fs::directory_iterator()), 1);  // q only
  std::vector<MonitorQueue> loaded = Parse(R"([{"queue": "p1"}, {"queue": "p2"}])");
  const std::string before = Describe(loaded);
  ASSERT_TRUE(MonitorQueue::LoadFromFile(loaded, kFile));
  EXPECT_EQ(Describe(loaded), before + Describe(saved));
  // An empty vector is saved as a file that loads as nothing, as a missing file does.
  ASSERT_TRUE(MonitorQueue::SaveToFile({}, kFile));
  ASSERT_TRUE(MonitorQueue::LoadFromFile(loaded, kFile));
  ASSERT_TRUE(MonitorQueue::LoadFromFile(loaded, kDir + "/missing"));
  EXPECT_EQ(loaded.size(), 5u);
  EXPECT_FALSE(MonitorQueue::SaveToFile(saved, kDir + "/none/q"));
  EXPECT_THAT(zorv_test::DumpLogs(),  // the only line of the whole test
              testing::MatchesRegex("3 monitor_queue:[0-9]+ Failed to save json\n"));
  EXPECT_EQ(zorv_test::CapturedLogs().at(0).format, "%s:%d Failed to save json");

  std::ofstream(kDir + "/other") << "x";
  fs::permissions(kDir + "/other", fs::perms(0644));
  g_link_to = kDir + "/other";  // swapped in right after the rename
  EXPECT_TRUE(MonitorQueue::SaveToFile(saved, kFile));
  EXPECT_EQ(fs::status(kDir + "/other").permissions(), fs::perms(0644));  // not followed
}

TEST(QueueFileTest, LoadRefusesAtOnceFilesNotRegularOrTooLarge) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  const std::string dir = MonitorQueue::GetConfDir(MONITOR_QUEUE_TYPE_ETC_DIR);
  ASSERT_EQ(mkfifo((dir + "/fifo").c_str(), 0600), 0);
  fs::create_symlink("/dev/zero", dir + "/zero");
  const zorv_test::ChildResult child = zorv_test::RunAs({0, 0, 0, 0, 0, 0}, [&dir] {
    alarm(3);  // a load that blocks or reads without end kills the child
    std::vector<MonitorQueue> queues;
    return MonitorQueue::LoadFromFile(queues, dir + "/fifo") +
           2 * MonitorQueue::LoadFromFile(queues, dir + "/zero") +
           4 * MonitorQueue::Upsert(MonitorQueue(Json::Value()), "fifo",
                                    MONITOR_QUEUE_TYPE_ETC_DIR);
  });
  ASSERT_TRUE(child.exited) << child.error;
  EXPECT_EQ(child.result, 0);
  ASSERT_EQ(child.logs.size(), 1u);
  EXPECT_THAT(child.logs[0].text, testing::EndsWith(" LoadFromFile failed, path=" + dir + "/fifo"));
  EXPECT_TRUE(fs::is_fifo(dir + "/fifo"));

  // A file of the largest size loads; one byte more and it is refused.
  std::string text = "[" + std::string(platform::kMaxJsonFileSize - 2, ' ') + "]";
  std::vector<MonitorQueue> queues;
  std::ofstream(kFile) << text;
  EXPECT_TRUE(MonitorQueue::LoadFromFile(queues, kFile));
  std::ofstream(kFile) << text << ' ';
  EXPECT_FALSE(MonitorQueue::LoadFromFile(queues, kFile));

  // A save whose text would exceed what a load reads fails before writing:
  // the file keeps its content and no temporary file is left.
  std::ofstream(kFile, std::ios::trunc) << "[]";
  Json::Value big;
  big["queue"] = "big";
  for (int i = 0; i < 3; ++i)
    big["config"][0]["ignore"].append(std::string(platform::kMaxJsonFileSize / 3, 'x'));
  zorv_test::ClearLogs();
  EXPECT_FALSE(MonitorQueue::SaveToFile({MonitorQueue(big)}, kFile));
  EXPECT_THAT(zorv_test::DumpLogs(),
              testing::MatchesRegex("3 monitor_queue:[0-9]+ Failed to save json\n"));
  EXPECT_EQ(fs::file_size(kFile), 2u);
  EXPECT_EQ(std::distance(fs::directory_iterator(kDir), fs::directory_iterator()), 2);  // q, etc
}

}  // namespace ZORV::ZORVNOTIFYD
