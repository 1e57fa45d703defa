// Tests of the watch configuration record: JSON form and ownership of the
// compiled-pattern cache.

#include <dlfcn.h>
#include <regex.h>

#include <map>
#include <utility>

#include <gtest/gtest.h>

#include "monitor_queue.h"

namespace {

// Every pattern the library compiles and frees, keyed by the compiled
// program a regex_t points to (the regex_t itself is copied around).  The
// test program's definitions take the place of the C library's for the
// shared library too, so ownership mistakes show as counts, not only as
// crashes.
std::map<const void*, int> live_patterns;
int double_frees = 0;

}  // namespace

extern "C" int regcomp(regex_t* preg, const char* pattern, int cflags) {
  using Fn = int (*)(regex_t*, const char*, int);
  static Fn real = reinterpret_cast<Fn>(dlsym(RTLD_NEXT, "regcomp"));
  const int rc = real(preg, pattern, cflags);
  if (rc == 0) ++live_patterns[preg->buffer];
  return rc;
}

extern "C" void regfree(regex_t* preg) {
  using Fn = void (*)(regex_t*);
  static Fn real = reinterpret_cast<Fn>(dlsym(RTLD_NEXT, "regfree"));
  const void* program = preg->buffer;
  real(preg);
  if (live_patterns.erase(program) == 0) ++double_frees;
}

namespace ZORV {
namespace ZORVNOTIFYD {
namespace {

using Config = MonitorQueue::MonitorQueueConfig;

Json::Value Parse(const std::string& text) {
  Json::Value value;
  Json::CharReaderBuilder builder;
  std::string errors;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  EXPECT_TRUE(reader->parse(text.data(), text.data() + text.size(), &value, &errors)) << errors;
  return value;
}

Config Prepared(const std::string& text) {
  Config config(Parse(text));
  config.PrepareRegex();
  return config;
}

class MonitorQueueConfigTest : public ::testing::Test {
 protected:
  void SetUp() override {
    live_patterns.clear();
    double_frees = 0;
  }
  void TearDown() override {
    EXPECT_TRUE(live_patterns.empty()) << live_patterns.size() << " compiled patterns leaked";
    EXPECT_EQ(double_frees, 0);
  }
};

TEST_F(MonitorQueueConfigTest, NonObjectsAndMissingKeysGiveDefaults) {
  for (const Json::Value& value :
       {Json::Value(), Json::Value(Json::arrayValue), Json::Value("text"), Parse("{}"),
        Parse(R"({"ignore": "x.*", "other": 1})")}) {
    const Config config(value);
    EXPECT_EQ(config._path, "");
    EXPECT_EQ(config._mask, 0u);
    EXPECT_TRUE(config._ignore.empty());
    EXPECT_FALSE(config._prepared);
    const Json::Value json = config.ToJson();
    EXPECT_EQ(json["path"], Json::Value(""));
    EXPECT_EQ(json["mask"], Json::Value(0u));
    EXPECT_TRUE(json["ignore"].isArray());
    EXPECT_EQ(json["ignore"].size(), 0u);
  }
  const Config only_path(Parse(R"({"path": "/a/b/"})"));
  EXPECT_EQ(only_path._path, "/a/b/");  // trailing "/" kept
  EXPECT_EQ(only_path._mask, 0u);
}

TEST_F(MonitorQueueConfigTest, RoundTripKeepsEveryField) {
  const Config config(
      Parse(R"({"path": "/vol/share/", "mask": 4294967295, "ignore": ["(", "a$", "a$"]})"));
  EXPECT_EQ(config._ignore, (std::vector<std::string>{"(", "a$", "a$"}));
  const Config again(config.ToJson());
  EXPECT_EQ(again._path, "/vol/share/");
  EXPECT_EQ(again._mask, 4294967295u);
  EXPECT_EQ(again._ignore, config._ignore);
  EXPECT_EQ(again.ToJson(), config.ToJson());
}

TEST_F(MonitorQueueConfigTest, PrepareDropsPatternsThatDoNotCompile) {
  const Config config = Prepared(R"({"ignore": ["(", "a$", "b$"]})");
  EXPECT_TRUE(config._prepared);
  EXPECT_EQ(config._regexes.size(), 2u);
  EXPECT_EQ(config._ignore.size(), 3u);
  EXPECT_EQ(live_patterns.size(), 2u);
}

TEST_F(MonitorQueueConfigTest, CopiesNeverCarryCompiledPatterns) {
  Config original = Prepared(R"({"path": "/a", "mask": 3, "ignore": ["x", "y"]})");
  Config copy(original);
  EXPECT_FALSE(copy._prepared);
  EXPECT_TRUE(copy._regexes.empty());
  EXPECT_EQ(copy._ignore, original._ignore);

  Config assigned(Json::Value{});
  assigned = Prepared(R"({"ignore": ["z"]})");  // move-assigned: owns one pattern
  EXPECT_EQ(assigned._regexes.size(), 1u);
  assigned = original;  // copy assignment releases its own pattern first
  EXPECT_FALSE(assigned._prepared);
  EXPECT_TRUE(assigned._regexes.empty());
  EXPECT_EQ(assigned._path, "/a");
  EXPECT_EQ(live_patterns.size(), 2u);  // only the original's remain

  Config& self = original;
  original = self;  // self-assignment discards the cache and nothing else
  EXPECT_FALSE(original._prepared);
  EXPECT_TRUE(original._regexes.empty());
  EXPECT_EQ(original._path, "/a");
  EXPECT_EQ(original._ignore.size(), 2u);
  EXPECT_TRUE(live_patterns.empty());
}

TEST_F(MonitorQueueConfigTest, MovesTransferCompiledPatterns) {
  Config source = Prepared(R"({"path": "/a", "mask": 5, "ignore": ["x", "y"]})");
  const regex_t* first = &source._regexes[0];
  Config moved(std::move(source));
  EXPECT_TRUE(moved._prepared);
  EXPECT_EQ(&moved._regexes[0], first);  // the same compiled pattern, not a new one
  EXPECT_FALSE(source._prepared);        // NOLINT: checking the moved-from state
  EXPECT_TRUE(source._regexes.empty());
  EXPECT_TRUE(source._ignore.empty());
  EXPECT_TRUE(source._path.empty());
  EXPECT_EQ(source._mask, 5u);

  Config target = Prepared(R"({"ignore": ["z"]})");
  target = std::move(moved);
  EXPECT_TRUE(target._prepared);
  EXPECT_EQ(target._regexes.size(), 2u);
  EXPECT_EQ(live_patterns.size(), 2u);  // target's own pattern was released
  EXPECT_TRUE(moved._regexes.empty());  // NOLINT
  source = target;                      // a moved-from record may be assigned to
  EXPECT_EQ(source._path, "/a");
}

TEST_F(MonitorQueueConfigTest, ConversionErrorsLeaveTheConstructor) {
  EXPECT_THROW(Config(Parse(R"({"path": ["x"]})")), std::exception);
  EXPECT_THROW(Config(Parse(R"({"mask": -1})")), std::exception);
  EXPECT_THROW(Config(Parse(R"({"path": "/a", "ignore": ["x", {}]})")), std::exception);
}

}  // namespace
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
