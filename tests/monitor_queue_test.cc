// Tests of the monitor queue record: JSON form and copies without compiled
// patterns.

#include <gtest/gtest.h>

#include "monitor_queue.h"

namespace ZORV {
namespace ZORVNOTIFYD {
namespace {

Json::Value Parse(const std::string& text) {
  Json::Value value;
  std::istringstream(text) >> value;
  return value;
}

TEST(MonitorQueueTest, NonObjectsAndMissingKeysGiveAnEmptyQueue) {
  for (const char* text : {"null", "[]", "\"q\"", "{}", R"({"config": {"path": "/a"}})"}) {
    const MonitorQueue queue(Parse(text));
    EXPECT_EQ(queue._name, "") << text;
    EXPECT_TRUE(queue._configs.empty()) << text;
    const Json::Value json = queue.ToJson();
    EXPECT_EQ(json["queue"], Json::Value(""));
    EXPECT_TRUE(json["config"].isArray());
    EXPECT_EQ(json["config"].size(), 0u);
  }
  EXPECT_EQ(MonitorQueue(Parse(R"({"queue": "q"})"))._name, "q");
}

TEST(MonitorQueueTest, EveryConfigElementGivesAConfiguration) {
  const MonitorQueue queue(Parse(
      R"({"queue": "q", "config": [{"path": "/a", "mask": 1}, 7, {"path": "/a", "mask": 1}]})"));
  ASSERT_EQ(queue._configs.size(), 3u);
  EXPECT_EQ(queue._configs[1]._path, "");
  EXPECT_EQ(queue._configs[1]._mask, 0u);
  // Order and duplicates survive a round trip.
  const MonitorQueue again(queue.ToJson());
  ASSERT_EQ(again._configs.size(), 3u);
  EXPECT_EQ(again._configs[0]._path, "/a");
  EXPECT_EQ(again._configs[1]._path, "");
  EXPECT_EQ(again._configs[2]._path, "/a");
  EXPECT_EQ(again.ToJson(), queue.ToJson());
}

TEST(MonitorQueueTest, CopiesCarryNoCompiledPatterns) {
  MonitorQueue queue(Parse(R"({"queue": "q", "config": [{"path": "/a", "ignore": ["x"]}]})"));
  queue._configs[0].PrepareRegex();
  const MonitorQueue copy(queue);
  EXPECT_FALSE(copy._configs[0]._prepared);
  EXPECT_TRUE(copy._configs[0]._regexes.empty());

  MonitorQueue assigned(Parse(R"({"queue": "other", "config": [{}, {}]})"));
  assigned._configs[1].PrepareRegex();
  assigned = queue;
  EXPECT_EQ(assigned._name, "q");
  ASSERT_EQ(assigned._configs.size(), 1u);
  EXPECT_FALSE(assigned._configs[0]._prepared);
  EXPECT_TRUE(queue._configs[0]._prepared);  // the source keeps its own cache

  // A growing list copies its queues: none of the copies holds patterns.
  std::vector<MonitorQueue> list;
  for (int i = 0; i < 20; ++i) list.push_back(queue);
  for (const MonitorQueue& entry : list) EXPECT_FALSE(entry._configs[0]._prepared);
}

TEST(MonitorQueueTest, ConversionErrorsLeaveTheConstructor) {
  EXPECT_THROW(MonitorQueue(Parse(R"({"queue": ["q"]})")), std::exception);
  EXPECT_THROW(MonitorQueue(Parse(R"({"queue": "q", "config": [{}, {"mask": "x"}]})")),
               std::exception);
}

}  // namespace
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
