// The share set: the first two components of each absolute configuration
// path, byte for byte, gathered without duplicates.

#include <gtest/gtest.h>

#include "monitor_queue.h"

namespace ZORV::ZORVNOTIFYD {

using Shares = std::set<std::string>;

static MonitorQueue MakeQueue(const std::vector<std::string>& paths) {
  MonitorQueue queue{Json::Value()};
  for (const std::string& path : paths) queue._configs.emplace_back(Json::Value())._path = path;
  return queue;
}

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
    MakeQueue({path}).CollectShareSet(shares);
    EXPECT_EQ(shares, (length ? Shares{"/held", std::string(path, length)} : Shares{"/held"}))
        << path;
  }
  // GetShareSet joins every configuration of every queue.
  const MonitorQueue first = MakeQueue({"/vol/share/a", "/x", "/vol/share/b"});
  const MonitorQueue second = MakeQueue({"/vol/share", "/pub/docs/", "rel/a", ""});
  EXPECT_EQ(MonitorQueue::GetShareSet({first, second}), (Shares{"/pub/docs", "/vol/share"}));
  EXPECT_TRUE(MonitorQueue::GetShareSet({}).empty() &&
              MonitorQueue::GetShareSet({MakeQueue({}), MakeQueue({})}).empty());
}

}  // namespace ZORV::ZORVNOTIFYD
