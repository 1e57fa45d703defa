// Path matching: the order of the mask, prefix, boundary and pattern tests,
// lazy compilation of ignore patterns, directory and union-mask queries, and
// that prepared queries make no C++ heap allocation.

#include <gtest/gtest.h>

#include <atomic>
#include <cstdlib>
#include <new>
#include <string>
#include <vector>

#include "monitor_queue.h"
#include "support/syslog_capture.h"

// Counting replacements of the global allocation functions.  They allocate
// with malloc and release with free, so AddressSanitizer still sees every
// block paired correctly.  The aligned forms are left to the runtime.
namespace {
std::atomic<long> g_allocations{0};

// Kept out of line so that the compiler does not pair a new-expression with
// free() when it inlines a delete.
[[gnu::noinline]] void Release(void* block) noexcept { std::free(block); }
}  // namespace

void* operator new(std::size_t size) {
  g_allocations.fetch_add(1, std::memory_order_relaxed);
  if (void* block = std::malloc(size == 0 ? 1 : size)) return block;
  throw std::bad_alloc();
}
void* operator new[](std::size_t size) { return ::operator new(size); }
void operator delete(void* block) noexcept { Release(block); }
void operator delete[](void* block) noexcept { Release(block); }
void operator delete(void* block, std::size_t) noexcept { Release(block); }
void operator delete[](void* block, std::size_t) noexcept { Release(block); }

namespace ZORV {
namespace ZORVNOTIFYD {
namespace {

using Config = MonitorQueue::MonitorQueueConfig;

struct Spec {
  std::string path;
  unsigned int mask;
  std::vector<std::string> ignore;
};

Config MakeConfig(const Spec& spec) {
  Json::Value value(Json::objectValue);
  value["path"] = spec.path;
  value["mask"] = spec.mask;
  value["ignore"] = Json::Value(Json::arrayValue);
  for (const std::string& pattern : spec.ignore) value["ignore"].append(pattern);
  return Config(value);
}

MonitorQueue MakeQueue(const std::vector<Spec>& specs) {
  Json::Value value(Json::objectValue);
  value["queue"] = "q";
  value["config"] = Json::Value(Json::arrayValue);
  for (const Spec& spec : specs) value["config"].append(MakeConfig(spec).ToJson());
  return MonitorQueue(value);
}

TEST(MatchingTest, MaskPrefixAndBoundaryComeBeforeCompiling) {
  struct Row {
    std::string config_path;
    unsigned int config_mask;
    std::string path;
    unsigned int mask;
    bool want;
  };
  const Row rows[] = {
      {"/a/b", 3, "/a/b/x", 2, true},   {"/a/b", 3, "/a/b/x", 4, false},
      {"/a/b", 3, "/a/b/x", 0, false},  {"/a/b", 0, "/a/b/x", ~0u, false},
      {"/a/b", 3, "/a/b", 1, true},     {"/a/b", 3, "/a/b/x/y", 1, true},
      {"/a/b", 3, "/a/bc", 1, false},   {"/a/b", 3, "/a", 1, false},
      {"/a/b", 3, "/a/", 1, false},     {"/a/b", 3, "", 1, false},
      {"/a/b/", 1, "/a/b/", 1, true},   {"/a/b/", 1, "/a/b//x", 1, true},
      {"/a/b/", 1, "/a/b/x", 1, false}, {"/a/b/", 1, "/a/b", 1, false},
      {"/", 1, "/", 1, true},           {"/", 1, "//x", 1, true},
      {"/", 1, "/x", 1, false},         {"", 1, "", 1, true},
      {"", 1, "/x", 1, true},           {"", 1, "x", 1, false},
  };
  for (const Row& row : rows) {
    SCOPED_TRACE("config " + row.config_path + ", path " + row.path);
    Config config = MakeConfig({row.config_path, row.config_mask, {}});
    EXPECT_EQ(config.IsMonitoring(row.path, row.mask), row.want);
    // Without patterns, a configuration is prepared exactly when its mask,
    // prefix and boundary tests passed.
    EXPECT_EQ(config._prepared, row.want);
  }
}

TEST(MatchingTest, IgnorePatternsAreCompiledOnceAndMatchTheWholePath) {
  zorv_test::ClearLogs();
  Config config = MakeConfig({"/a/b", 1, {"\\.tmp$", "(", "^/a/b/private", "^f\\.log$", "^x"}});
  EXPECT_FALSE(config.IsMonitoring("/a/b/f.tmp", 2));  // mask fails first
  EXPECT_FALSE(config._prepared);
  const struct {
    const char* path;
    bool want;
  } rows[] = {
      {"/a/b/f.tmp", false},   {"/a/b/f.tmp2", true},     {"/a/b/F.TMP", true},
      {"/a/b/private", false}, {"/a/b/private/x", false}, {"/a/b/f.log", true},
      {"/a/b/y\nx", true},
  };
  for (const auto& row : rows) {
    EXPECT_EQ(config.IsMonitoring(row.path, 1), row.want) << row.path;
    // The unbalanced pattern is dropped; the others compiled exactly once.
    EXPECT_TRUE(config._prepared);
    EXPECT_EQ(config._regexes.size(), 4u);
  }

  Config broken = MakeConfig({"/a", 1, {"("}});
  EXPECT_TRUE(broken.IsMonitoring("/a/x", 1));
  EXPECT_TRUE(broken._prepared);
  EXPECT_TRUE(broken._regexes.empty());
  EXPECT_EQ(zorv_test::DumpLogs(), "");  // dropped silently
}

TEST(MatchingTest, QueueStopsAtFirstConfigurationThatWantsThePath) {
  MonitorQueue queue = MakeQueue({{"/a", 1, {"^/a/p$"}}, {"/a", 1, {}}, {"/a", 1, {"x"}}});
  EXPECT_TRUE(queue.IsMonitoring("/a/p", 1));  // ignored by the first only
  EXPECT_TRUE(queue._configs[0]._prepared);
  EXPECT_TRUE(queue._configs[1]._prepared);
  EXPECT_FALSE(queue._configs[2]._prepared);
  EXPECT_TRUE(queue.IsMonitoring("/a/q", 1));
  EXPECT_FALSE(queue._configs[2]._prepared);
  EXPECT_FALSE(queue.IsMonitoring("/b", 1));
  EXPECT_FALSE(MakeQueue({}).IsMonitoring("/a", 1));
}

TEST(MatchingTest, DirectoryAndUnionMaskQueries) {
  const Config config = MakeConfig({"/a/b", 1, {}});
  for (const char* dir : {"/a", "/a/", "/", "/a/b", ""}) {
    EXPECT_TRUE(config.IsDirMonitoring(dir)) << dir;
  }
  for (const char* dir : {"/a/b/c", "/a/bc", "/ab", "/a/b/"}) {
    EXPECT_FALSE(config.IsDirMonitoring(dir)) << dir;
  }
  EXPECT_TRUE(MakeConfig({"", 1, {}}).IsDirMonitoring(""));
  EXPECT_FALSE(MakeConfig({"x", 1, {}}).IsDirMonitoring(""));
  EXPECT_TRUE(MakeConfig({"/a/b/", 1, {}}).IsDirMonitoring("/a/b"));

  const MonitorQueue queue =
      MakeQueue({{"/a", 1, {}}, {"/a/b", 2, {}}, {"/ab", 4, {}}, {"/c", 8, {}}});
  EXPECT_EQ(queue.GetUnionMask("/a"), 3u);
  EXPECT_EQ(queue.GetUnionMask("/a/b"), 2u);
  EXPECT_EQ(queue.GetUnionMask("/c"), 8u);
  EXPECT_EQ(queue.GetUnionMask("/a/"), 0u);
  EXPECT_EQ(queue.GetUnionMask("/"), 0u);
  EXPECT_TRUE(queue.IsDirMonitoring("/"));
  EXPECT_FALSE(queue.IsDirMonitoring("/d"));
  EXPECT_EQ(MakeQueue({}).GetUnionMask("/a"), 0u);

  // A directory with a trailing "/" selects, for the union mask, only
  // itself and paths that continue with a second "/".
  const MonitorQueue slashes =
      MakeQueue({{"/a/", 1, {}}, {"/a//b", 2, {}}, {"/a/b", 4, {}}, {"//x", 8, {}}, {"/", 16, {}}});
  EXPECT_EQ(slashes.GetUnionMask("/a/"), 3u);
  EXPECT_EQ(slashes.GetUnionMask("/"), 24u);

  EXPECT_FALSE(MonitorQueue::IsDirMonitoring({}, "/"));
  const std::vector<MonitorQueue> queues = {MakeQueue({}), MakeQueue({{"/x", 0, {}}}), queue};
  EXPECT_TRUE(MonitorQueue::IsDirMonitoring(queues, "/x"));
  EXPECT_TRUE(MonitorQueue::IsDirMonitoring(queues, "/c"));
  EXPECT_FALSE(MonitorQueue::IsDirMonitoring(queues, "/d"));
}

TEST(MatchingTest, PreparedQueriesMakeNoHeapAllocation) {
  // Paths longer than the small-string buffer, so that a copy of a path or
  // of any part of it would reach the heap.
  const std::string root = "/volume1/share/documents";
  MonitorQueue queue = MakeQueue({{root + "/archive", 1, {"\\.tmp$"}}, {root, 3, {"~$"}}});
  const std::vector<std::string> paths = {root + "/archive/2024/report.txt",
                                          root + "/drafts/report.txt~", root + "/archivex",
                                          "/volume2/share/documents/x"};
  const std::vector<std::string> dirs = {"/volume1/share", root + "/archive/2024", "/volume1/sh"};
  for (const std::string& path : paths) queue.IsMonitoring(path, 1);  // prepares both
  ASSERT_TRUE(queue._configs[0]._prepared && queue._configs[1]._prepared);

  int answers = 0;
  const long before = g_allocations.load();
  for (const std::string& path : paths) {
    answers += queue.IsMonitoring(path, 1);
    answers += queue.IsMonitoring(path, 4);
  }
  for (const std::string& dir : dirs) answers += queue.IsDirMonitoring(dir);
  const long allocations = g_allocations.load() - before;
  EXPECT_EQ(allocations, 0);
  EXPECT_EQ(answers, 3);  // report.txt, archivex and /volume1/share
}

}  // namespace
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
