// Tests of the monitor queue record and its watch configurations: JSON form
// and ownership of the compiled-pattern cache.

#include <dlfcn.h>

#include <set>
#include <sstream>

#include <gtest/gtest.h>

#include "monitor_queue.h"

// The compiled programs (what a regex_t points to; the regex_t itself is
// copied around) that are alive.  These definitions take the place of the C
// library's for the shared library too, so a pattern freed twice or never
// fails a test, not only a sanitizer.  Never destroyed: a pattern freed
// while the program exits still finds it.
static std::set<const void*>& live_patterns = *new std::set<const void*>;

extern "C" int regcomp(regex_t* preg, const char* pattern, int cflags) {
  static auto real = reinterpret_cast<decltype(&regcomp)>(dlsym(RTLD_NEXT, "regcomp"));
  const int rc = real(preg, pattern, cflags);
  if (rc == 0) live_patterns.insert(preg->buffer);
  return rc;
}

extern "C" void regfree(regex_t* preg) {
  static auto real = reinterpret_cast<decltype(&regfree)>(dlsym(RTLD_NEXT, "regfree"));
  if (live_patterns.erase(preg->buffer) == 0) ADD_FAILURE() << "regfree of a dead pattern";
  real(preg);
}

namespace ZORV::ZORVNOTIFYD {

using Config = MonitorQueue::MonitorQueueConfig;

static Json::Value Parse(const std::string& text) {
  Json::Value value;
  std::istringstream(text) >> value;
  return value;
}

// A record's JSON form followed by the state of its cache: the number of
// compiled patterns, then " prepared" when it is prepared.
static std::string State(const Config& c) {
  return c.ToJson().toStyledString() + std::to_string(c._regexes.size()) +
         (c._prepared ? " prepared" : "");
}
static std::string State(const std::string& json, const char* cache) {
  return Parse(json).toStyledString() + cache;
}

// Copies, moves and assignments of configurations and queues leave each
// compiled pattern one owner, freed once.
TEST(MonitorQueueConfigTest, CompiledPatternsHaveExactlyOneOwner) {
  const char* fields = R"({"path": "/a", "mask": 5, "ignore": ["(", "x", "y"]})";
  {
    Config original = Parse(fields), target = Parse(R"({"ignore": ["z"]})");
    original.PrepareRegex();  // "(" does not compile: dropped, its text kept
    target.PrepareRegex();
    EXPECT_EQ(State(original), State(fields, "2 prepared"));
    const void* program = original._regexes[0].buffer;

    // Copies never carry compiled patterns; assignment releases the target's own.
    Config copy(original);
    target = original;
    for (Config* copied : {&copy, &target}) EXPECT_EQ(State(*copied), State(fields, "0"));
    EXPECT_EQ(live_patterns.size(), 2u);

    // Moves transfer them and leave the source its mask only.
    Config moved(std::move(original));
    target.PrepareRegex();
    target = std::move(moved);
    EXPECT_EQ(State(target), State(fields, "2 prepared"));
    EXPECT_TRUE(target._regexes[0].buffer == program && live_patterns.size() == 2);
    EXPECT_EQ(State(original), State(R"({"path": "", "mask": 5, "ignore": []})", "0"));
    EXPECT_TRUE(moved._ignore.empty() && moved._regexes.empty() && !moved._prepared);

    original = target;  // a moved-from record may be assigned to
    Config& self = target;
    target = self;  // discards the compiled patterns and nothing else
    for (Config* copied : {&target, &original}) EXPECT_EQ(State(*copied), State(fields, "0"));
    EXPECT_TRUE(live_patterns.empty());
    target.PrepareRegex();  // released by the destructor

    // Queues copy their name and configurations so; assignment frees the surplus one's.
    MonitorQueue queue = Parse(R"({"queue": "q", "config": [{"ignore": ["x"]}]})");
    MonitorQueue assigned = Parse(R"({"config": [{}, {"ignore": ["y"]}]})");
    queue._configs[0].PrepareRegex();
    assigned._configs[1].PrepareRegex();
    assigned = queue;
    MonitorQueue copied(queue);
    for (const MonitorQueue* q : {&copied, &assigned})
      EXPECT_TRUE(q->ToJson() == queue.ToJson() && q->_configs[0]._regexes.empty() &&
                  !q->_configs[0]._prepared);
    EXPECT_EQ(live_patterns.size(), 3u);  // target's two and the source queue's own
  }
  EXPECT_TRUE(live_patterns.empty()) << live_patterns.size() << " compiled patterns not released";
}

// Both records' defaults, their round trips, and the conversions they refuse.
TEST(MonitorQueueTest, JsonFormDefaultsAndConversionErrors) {
  // Non-objects, missing keys and a "config" that is not an array give the defaults.
  for (const char* input : {"null", "[]", "\"q\"", "{}", R"({"config": {"path": "/a"}})"})
    EXPECT_EQ(MonitorQueue(Parse(input)).ToJson(), Parse(R"({"queue": "", "config": []})"))
        << input;
  // Every element gives a configuration, non-objects, missing keys and an
  // "ignore" that is not an array the defaults.  Order, duplicates and every
  // field, a trailing "/" of the path included, survive a round trip.
  const std::string full =
      R"({"path": "/vol/share/", "mask": 4294967295, "ignore": ["(", "a$", "a$"]})";
  const std::string odd = R"(null, [], "x", {}, {"ignore": "x.*", "other": 1},
                             {"ignore": {"k": "x"}})";
  const MonitorQueue back =
      MonitorQueue(Parse(R"({"queue": "q", "config": [)" + full + ", " + odd + ", " + full + "]}"))
          .ToJson();
  std::string seen = back._name, expected = "q" + State(full, "0");
  for (const Config& config : back._configs) seen += State(config);
  for (int i = 0; i < 6; ++i) expected += State(R"({"path": "", "mask": 0, "ignore": []})", "0");
  EXPECT_EQ(seen, expected + State(full, "0"));
  for (const char* input : {R"({"queue": ["q"]})", R"({"config": [{}, {"mask": "x"}]})",
                            R"({"config": [{"path": ["x"]}]})", R"({"config": [{"mask": -1}]})",
                            R"({"config": [{"path": "/a", "ignore": ["x", {}]}]})"})
    EXPECT_THROW(MonitorQueue{Parse(input)}, std::exception) << input;
}

}  // namespace ZORV::ZORVNOTIFYD
