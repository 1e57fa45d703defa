// The configuration directory of each queue type (its path, its creation
// when missing) and the catalogue queries: which directory entries a scan
// loads, the order of the whole catalogue, what List and Get append or copy,
// and the lines of their failures, a directory that cannot be made included.

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <regex>

#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/sandbox.h"
#include "support/syslog_capture.h"

namespace ZORV::ZORVNOTIFYD {

namespace fs = std::filesystem;
constexpr _tag_monitor_queue_type_ kEtc = MONITOR_QUEUE_TYPE_ETC_DIR;
const std::string kEtcDir = "/usr/zorv/etc/zorvnotifyd", kLocal = "/usr/local/etc/zorvnotifyd";

// Writes queue file |file| of |type|, its directory created as needed.
static void Write(int type, const std::string& file, const std::string& text) {
  std::ofstream(MonitorQueue::GetConfDir(_tag_monitor_queue_type_(type)) + "/" + file) << text;
}

// The names of |queues|, each followed by ",", then the captured lines as
// "<priority> <message>\n" with "monitor_queue:<line> " removed.
static std::string Seen(const std::vector<MonitorQueue>& queues) {
  std::string names;
  for (const MonitorQueue& queue : queues) names += queue._name + ",";
  return names + std::regex_replace(zorv_test::DumpLogs(), std::regex("monitor_queue:[0-9]+ "), "");
}

// Every type's directory is made when missing (0700, parents too) without a
// line; a scan loads only the regular, visible files in it.
TEST(CatalogueTest, DirectoriesAreMadeAndScansLoadOnlyRegularVisibleFiles) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  zorv_test::ClearLogs();
  const std::pair<int, std::string> kCases[] = {
      {1, kEtcDir}, {3, kEtcDir}, {-1, kEtcDir}, {0, "/usr/zorv/share/zorvnotifyd"}, {2, kLocal}};
  for (const auto& [type, dir] : kCases) {
    fs::remove(dir);  // nothing is cached: every call checks again
    EXPECT_EQ(MonitorQueue::GetConfDir(static_cast<_tag_monitor_queue_type_>(type)), dir) << type;
    EXPECT_TRUE(fs::is_directory(dir)) << type;
    for (const fs::path& made : {fs::path(dir), fs::path("/usr/zorv"), fs::path("/usr/zorv/etc")})
      EXPECT_EQ(fs::status(made).permissions(), fs::perms(0700)) << made;  // parents too
  }
  fs::permissions(kLocal, fs::perms(0751));  // an existing directory keeps its mode
  EXPECT_EQ(MonitorQueue::GetConfDir(MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR), kLocal);
  EXPECT_EQ(fs::status(kLocal).permissions(), fs::perms(0751));
  fs::remove(kEtcDir);
  std::vector<MonitorQueue> queues(1, Json::Value());
  ASSERT_TRUE(MonitorQueue::LoadAllByType(queues, kEtc));  // made again, empty
  EXPECT_EQ(Seen(queues), ",");                            // no line so far
  Write(1, "q", R"([{"queue": "q"}])");
  Write(1, ".hidden", R"([{"queue": "h"}])");
  fs::create_directory(kEtcDir + "/sub");
  Write(1, "sub/inner", R"([{"queue": "i"}])");
  fs::create_symlink("/tmp/none", kEtcDir + "/dangling");
  std::ofstream("/tmp/target") << R"([{"queue": "l"}])";
  fs::create_symlink("/tmp/target", kEtcDir + "/link");
  Write(1, "partial", R"([{"queue": "p"}, {"queue": {}}])");  // fails after its first queue
  const int saved = LOG_LEVEL;
  for (const int level : {6, 7, 8}) {
    LOG_LEVEL = level;
    zorv_test::ClearLogs();
    queues.clear();
    EXPECT_TRUE(MonitorQueue::LoadAllByType(queues, kEtc));
    std::string names = Seen(queues);
    std::sort(names.begin(), names.begin() + 6);  // the directory order is not fixed
    EXPECT_EQ(names, level != 7
                         ? ",,,lpq"
                         : ",,,lpq3 load monitor config fail, path=" + kEtcDir + "/partial\n");
  }
  LOG_LEVEL = saved;
}

TEST(CatalogueTest, LoadAllListAndGetReadTheFilesInOrder) {
  ZORV_REQUIRE_SANDBOX();
  zorv_test::ResetStore();
  zorv_test::ClearLogs();
  Write(2, "q", R"([{"queue": "l"}])");
  Write(1, "q", R"([{"queue": "a", "config": [{"path": "/1", "mask": 1, "ignore": ["x.*"]}]},
      {"queue": "b", "config": [{"path": "/b"}]}, {"queue": "a", "config": [{"path": "/2"}]}])");
  Write(1, "bad", "[");
  Write(0, "q", R"([{"queue": "s"}])");
  std::vector<MonitorQueue> queues(1, Json::Value());
  ASSERT_TRUE(MonitorQueue::LoadAll(queues));  // replaces what the vector held
  ASSERT_TRUE(MonitorQueue::List(queues, "q", kEtc));
  ASSERT_TRUE(MonitorQueue::List(queues, "none", kEtc));
  EXPECT_EQ(Seen(queues), "s,a,b,a,l,a,b,a,");
  MonitorQueue queue = queues[0];
  ASSERT_TRUE(MonitorQueue::Get(queue, "a", "q", kEtc));
  EXPECT_EQ(queue.ToJson(), queues[1].ToJson());  // the first of the name, configurations included
  queue = queues[2];
  // Names are case-sensitive, and a missing file holds no queue.
  for (const char* name_file : {"c/q", "A/q", "a/none", "a/bad"})
    EXPECT_FALSE(MonitorQueue::Get(queue, std::string(name_file, 1), name_file + 2, kEtc));
  EXPECT_EQ(queue.ToJson(), queues[2].ToJson());  // left as it was
  fs::remove_all(kLocal);  // a directory that cannot be listed fails its type only
  std::ofstream(kLocal) << R"([{"queue": "l"}])";
  EXPECT_FALSE(MonitorQueue::LoadAll(queues));
  EXPECT_TRUE(fs::is_regular_file(kLocal));  // a file in the directory's way is left in place
  EXPECT_EQ(zorv_test::LogsContaining("conf dir").at(0).format,
            "%s:%d Failed to create conf dir: %s");
  EXPECT_EQ(Seen(queues),
            "s,a,b,a,3 No such monitor queue: c\n3 No such monitor queue: A\n"
            "3 No such monitor queue: a\n3 LoadFromFile failed, path=" +
                kEtcDir + "/bad\n3 Failed to create conf dir: " + kLocal +
                "\n3 cannot open dir, path=" + kLocal + ", reason=Not a directory\n");
}

}  // namespace ZORV::ZORVNOTIFYD
