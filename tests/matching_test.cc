// Path matching: the order of the mask, prefix, boundary and pattern tests,
// lazy compilation of ignore patterns, directory and union-mask queries, and
// that prepared queries make no C++ heap allocation.  The share set: the
// first two components of each absolute configuration path, byte for byte,
// gathered without duplicates.

#include <gtest/gtest.h>

#include <cstdlib>
#include <new>
#include <set>
#include <tuple>

#include "monitor_queue.h"
#include "support/allocation_count.h"
#include "support/syslog_capture.h"

namespace ZORV::ZORVNOTIFYD {

using Config = MonitorQueue::MonitorQueueConfig;

// Paths and masks of watch configurations without ignore patterns.
using Watches = std::vector<std::pair<std::string, unsigned int>>;

static MonitorQueue MakeQueue(const Watches& watches) {
  MonitorQueue queue{Json::Value()};
  for (const auto& [path, mask] : watches) {
    Config& config = queue._configs.emplace_back(Json::Value());
    config._path = path;
    config._mask = mask;
  }
  return queue;
}

TEST(MatchingTest, ConfigurationMatchesMaskPrefixAndBoundary) {
  // Configuration path and mask, the path (or directory) asked about, the
  // event mask, then the answers of IsMonitoring and IsDirMonitoring.
  const std::tuple<const char*, unsigned int, const char*, unsigned int, bool, bool> rows[] = {
      {"/a/b", 3, "/a/b/x", 2, true, false},   {"/a/b", 3, "/a/b", 1, true, true},
      {"/a/b", 3, "/a/b/x", 4, false, false},  {"/a/b", 3, "/a", 1, false, true},
      {"/a/b", 3, "/a/b", 0, false, true},     {"/a/b", 3, "/a/", 1, false, true},
      {"/a/b", 0, "/a/b", ~0u, false, true},   {"/a/b", 3, "/", 1, false, true},
      {"/a/b", 3, "/a/b/x/y", 1, true, false}, {"/a/b", 3, "", 1, false, true},
      {"/a/b", 3, "/a/bc", 1, false, false},   {"/", 1, "/", 1, true, true},
      {"/a/b", 3, "/ab", 1, false, false},     {"/", 1, "//x", 1, true, false},
      {"/a/b", 3, "/a/b/", 1, true, false},    {"/", 1, "/x", 1, false, false},
      {"/a/b/", 1, "/a/b/", 1, true, true},    {"", 1, "", 1, true, true},
      {"/a/b/", 1, "/a/b//x", 1, true, false}, {"", 1, "/x", 1, true, false},
      {"/a/b/", 1, "/a/b/x", 1, false, false}, {"", 1, "x", 1, false, false},
      {"/a/b/", 1, "/a/b", 1, false, true},    {"x", 1, "", 1, false, false},
  };
  for (const auto& [config_path, config_mask, path, mask, monitoring, dir_monitoring] : rows) {
    SCOPED_TRACE(std::string("configuration ") + config_path + ", path " + path);
    Config config = MakeQueue({{config_path, config_mask}})._configs[0];
    EXPECT_EQ(config.IsDirMonitoring(path), dir_monitoring);
    EXPECT_EQ(config.IsMonitoring(path, mask), monitoring);
    EXPECT_EQ(config._prepared, monitoring);  // no patterns: prepared once mask and path pass
  }
}

TEST(MatchingTest, IgnorePatternsCompileOnceAndMatchTheWholePath) {
  MonitorQueue queue = MakeQueue({{"/a/b", 1}, {"/c", 1}});
  Config &config = queue._configs[0], &broken = queue._configs[1];
  config._ignore = {"\\.tmp$", "(", "^/a/b/private", "^f\\.log$", "^x"};
  broken._ignore = {"("};
  const std::pair<const char*, bool> rows[] = {
      {"/a/b/f.tmp", false},   {"/a/b/f.tmp2", true},     {"/a/b/F.TMP", true},
      {"/a/b/private", false}, {"/a/b/private/x", false}, {"/a/b/f.log", true},
      {"/a/b/y\nx", true},
  };
  for (const auto& [path, monitoring] : rows) {
    EXPECT_EQ(config.IsMonitoring(path, 1), monitoring) << path;
    EXPECT_EQ(config._regexes.size(), 4u);  // "(" dropped, the others compiled once
  }
  // A configuration whose only pattern does not compile monitors what its path admits.
  EXPECT_TRUE(broken.IsMonitoring("/c/x", 1) && broken._prepared && broken._regexes.empty());
  // Once a pattern is dropped, the compiled ones no longer line up with the texts.
  Config shifted = MakeQueue({{"/c", 1}})._configs[0];
  shifted._ignore = {"(", "y$", "x$"};
  EXPECT_FALSE(shifted.IsMonitoring("/c/x", 1));
  EXPECT_EQ(zorv_test::DumpLogs(), "");  // dropped silently
}

TEST(MatchingTest, LiteralPatternsAnswerAsTheRegexEngine) {
  // A pattern, a path below "/x" and whether the pattern ignores it: literal
  // shapes, and near misses whose operators, classes and anchors only the
  // regex engine reads right.
  const std::tuple<const char*, std::string, bool> rows[] = {
      {"\\.tmp$", "/x/a.tmp", true},
      {"\\.tmp$", "/x/a.tmp/b", false},
      {"\\.tmp$", std::string("/x/a.tmp\0b", 10), true},  // regexec stops at NUL
      {"~$", "/x/a~b", false},
      {"^/x/a(/|$)", "/x/a/b", true},
      {"^/x/a(/|$)", "/x/ab", false},
      {"/\\.git(/|$)", "/x/.github/.git", true},
      {"/\\.git($|/)", "/x/.github", false},
      {"a\\$b", "/x/a$b", true},
      {"node_modules", "/x/node_modules/y", true},
      {"a.c$", "/x/abc", true},
      {"\\.$", "/x/ab", false},
      {"(^|/)y$", "/x/y", true},
      {"(^|/)y$", "/x/ay", false},
      {"[.]tmp$", "/x/atmp", false},
      {"ab*$", "/x/a", true},
      {"/a+$", "/x/aaa", true},
      {"ab?$", "/x/a", true},
      {"a{2}$", "/x/aa", true},
      {"q|a$", "/x/a", true},
      {"\\<b$", "/x/b", true},
      {"\\w$", "/x/a", true},
      {"^", "/x/a", true},
  };
  for (const auto& [pattern, path, ignored] : rows) {
    Config config = MakeQueue({{"/x", 1}})._configs[0];
    config._ignore = {pattern};
    EXPECT_EQ(config.IsMonitoring(path, 1), !ignored) << pattern << " on " << path;
  }
}

TEST(MatchingTest, QueueQueriesAskTheirConfigurationsInOrder) {
  // One bit of mask per configuration.
  const Watches watches = {
      {"/a", 0x001},  {"/a/b", 0x002},  {"/a", 0x004},  {"/ab", 0x008}, {"/c", 0x010},
      {"/a/", 0x020}, {"/a//b", 0x040}, {"//x", 0x080}, {"/", 0x100},
  };
  MonitorQueue queue = MakeQueue(watches);
  queue._configs[0]._ignore = {"p$"};
  // Ignored by the first configuration, wanted by the second: the third is never asked.
  EXPECT_TRUE(queue.IsMonitoring("/a/b/p", 7));
  EXPECT_TRUE(queue._configs[1]._prepared && !queue._configs[2]._prepared);
  EXPECT_FALSE(queue.IsMonitoring("/b", ~0u) || MakeQueue({}).IsMonitoring("/a", 1));
  // Directory, then the union mask and IsDirMonitoring of the queue (and of a
  // list that holds it after an empty queue).  For a directory ending in "/"
  // the union mask takes only the directory itself and paths that continue
  // with a second "/".
  const std::tuple<const char*, unsigned int, bool> rows[] = {
      {"/a", 0x067, true},  {"/a/b", 0x002, true}, {"/ab", 0x008, true},
      {"/a/", 0x060, true}, {"/", 0x180, true},    {"", 0x1ff, true},
      {"/c", 0x010, true},  {"/d", 0, false},      {"/a/b/c", 0, false},
  };
  for (const auto& [dir, mask, dir_monitoring] : rows) {
    EXPECT_EQ(queue.GetUnionMask(dir), mask) << dir;
    EXPECT_EQ(queue.IsDirMonitoring(dir), dir_monitoring) << dir;
    EXPECT_EQ(MonitorQueue::IsDirMonitoring({MakeQueue({}), queue}, dir), dir_monitoring) << dir;
  }
  EXPECT_FALSE(MakeQueue({}).GetUnionMask("/a") || MonitorQueue::IsDirMonitoring({}, "/"));
}

TEST(MatchingTest, PreparedQueriesMakeNoHeapAllocation) {
  // Longer than the small-string buffer: a copy of a path, or of a part of
  // it, would reach the heap.
  const std::string root = "/volume1/share/documents";
  MonitorQueue queue = MakeQueue({{root + "/archive", 1}, {root, 3}});
  queue._configs[0]._ignore = {"\\.tmp$"};
  queue._configs[1]._ignore = {"~$"};
  const std::string paths[] = {root + "/archive/2024/report.txt", root + "/drafts/report.txt~",
                               root + "/archivex", "/volume2/share/documents/x"};
  const std::string dirs[] = {"/volume1/share", root + "/archive/2024", "/volume1/sh"};
  const long unprepared = zorv_test::Allocations();
  for (const std::string& path : paths) queue.IsMonitoring(path, 1);  // prepares both
  ASSERT_TRUE(queue._configs[0]._prepared && queue._configs[1]._prepared);
  ASSERT_GT(zorv_test::Allocations(), unprepared);  // the library's allocations are counted
  int answers = 0;
  const long before = zorv_test::Allocations();
  for (const std::string& path : paths)
    answers += queue.IsMonitoring(path, 1) + queue.IsMonitoring(path, 4);
  for (const std::string& dir : dirs) answers += queue.IsDirMonitoring(dir);
  EXPECT_EQ(zorv_test::Allocations() - before, 0);
  EXPECT_EQ(answers, 3);  // report.txt, archivex and /volume1/share
}

using Shares = std::set<std::string>;

// The share prefix of each configuration path, and their union over queues.
TEST(ShareSetTest, PrefixesOfEveryConfigurationPath) {
  // A path and the length of its share prefix, which leads it (0: none).
  const std::pair<const char*, std::size_t> rows[] = {
      {"/vol/share/a/b", 10}, {"/vol/share", 10}, {"/vol/share/", 10},
      {"/vol/", 5},           {"/vol", 0},        {"/", 0},
      {"vol/share", 0},       {"//x", 3},         {"//x/y", 3},
      {"/a//b", 3},           {"//", 2},
  };
  for (const auto& [path, length] : rows) {
    Shares shares = {"/held"};  // what the set held stays
    MakeQueue({{path, 0}}).CollectShareSet(shares);
    EXPECT_EQ(shares, (length ? Shares{"/held", std::string(path, length)} : Shares{"/held"}))
        << path;
  }
  // GetShareSet joins every configuration of every queue.
  const MonitorQueue first = MakeQueue({{"/vol/share/a", 0}, {"/x", 0}, {"/vol/share/b", 0}});
  const MonitorQueue second =
      MakeQueue({{"/vol/share", 0}, {"/pub/docs/", 0}, {"rel/a", 0}, {"", 0}});
  EXPECT_EQ(MonitorQueue::GetShareSet({first, second}), (Shares{"/pub/docs", "/vol/share"}));
  EXPECT_TRUE(MonitorQueue::GetShareSet({}).empty() &&
              MonitorQueue::GetShareSet({MakeQueue({}), MakeQueue({})}).empty());
}

}  // namespace ZORV::ZORVNOTIFYD
