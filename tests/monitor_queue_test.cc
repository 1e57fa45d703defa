// Tests of the monitor queue record: JSON form and copies without compiled
// patterns.

#include <sstream>

#include <gtest/gtest.h>

#include "monitor_queue.h"

namespace ZORV::ZORVNOTIFYD {

static Json::Value Parse(const std::string& text) {
  Json::Value value;
  std::istringstream(text) >> value;
  return value;
}

static std::string Styled(const std::string& text) { return Parse(text).toStyledString(); }
static std::string Written(const MonitorQueue& queue) { return queue.ToJson().toStyledString(); }

TEST(MonitorQueueTest, JsonFormDefaultsAndConversionErrors) {
  // Non-objects, missing keys and a "config" that is not an array give the defaults.
  for (const char* input : {"null", "[]", "\"q\"", "{}", R"({"config": {"path": "/a"}})"})
    EXPECT_EQ(Written(Parse(input)), Styled(R"({"queue": "", "config": []})")) << input;
  // Every element gives a configuration, a non-object an empty one; order and
  // duplicates survive a round trip.
  const MonitorQueue queue = Parse(R"({"queue": "q", "config": [{"path": "/a", "mask": 1}, 7,
                                       {"path": "/a", "mask": 1}]})");
  EXPECT_EQ(Written(MonitorQueue(queue.ToJson())), Styled(R"({"queue": "q", "config": [
      {"path": "/a", "mask": 1, "ignore": []}, {"path": "", "mask": 0, "ignore": []},
      {"path": "/a", "mask": 1, "ignore": []}]})"));
  for (const char* input :
       {R"({"queue": ["q"]})", R"({"queue": "q", "config": [{}, {"mask": "x"}]})"})
    EXPECT_THROW(MonitorQueue{Parse(input)}, std::exception) << input;
}

TEST(MonitorQueueTest, CopiesCarryNoCompiledPatterns) {
  MonitorQueue queue = Parse(R"({"queue": "q", "config": [{"path": "/a", "ignore": ["x"]}]})");
  MonitorQueue assigned = Parse(R"({"queue": "other", "config": [{}, {"ignore": ["y"]}]})");
  queue._configs[0].PrepareRegex();
  assigned._configs[1].PrepareRegex();
  assigned = queue;  // the surplus configuration goes, with its compiled pattern
  MonitorQueue copy(queue);
  for (const MonitorQueue* copied : {&copy, &assigned}) {
    EXPECT_EQ(Written(*copied), Written(queue));
    EXPECT_TRUE(!copied->_configs[0]._prepared && copied->_configs[0]._regexes.empty());
  }
  EXPECT_EQ(queue._configs[0]._regexes.size(), 1u);  // the source keeps its own
}

}  // namespace ZORV::ZORVNOTIFYD
