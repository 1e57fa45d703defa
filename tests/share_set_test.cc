// The share set: the first two components of each absolute configuration
// path, byte for byte, gathered without duplicates.

#include <gtest/gtest.h>

#include <set>
#include <string>
#include <vector>

#include "monitor_queue.h"

namespace ZORV {
namespace ZORVNOTIFYD {
namespace {

MonitorQueue MakeQueue(const std::vector<std::string>& paths) {
  Json::Value value(Json::objectValue);
  value["config"] = Json::Value(Json::arrayValue);
  for (const std::string& path : paths) {
    Json::Value config(Json::objectValue);
    config["path"] = path;
    value["config"].append(config);
  }
  return MonitorQueue(value);
}

using Shares = std::set<std::string>;

TEST(ShareSetTest, PrefixOfOnePath) {
  const struct {
    const char* path;
    Shares want;
  } rows[] = {
      {"/vol/share/a/b", {"/vol/share"}},
      {"/vol/share", {"/vol/share"}},
      {"/vol/share/", {"/vol/share"}},
      {"/vol/", {"/vol/"}},
      {"/vol", {}},
      {"/", {}},
      {"vol/share", {}},
      {"", {}},
      {"//x", {"//x"}},
      {"//x/y", {"//x"}},
      {"/a//b", {"/a/"}},
      {"//", {"//"}},
  };
  for (const auto& row : rows) {
    Shares shares;
    MakeQueue({row.path}).CollectShareSet(shares);
    EXPECT_EQ(shares, row.want) << row.path;
  }
}

TEST(ShareSetTest, MergesQueuesAndKeepsWhatTheSetHeld) {
  const MonitorQueue first = MakeQueue({"/vol/share/a", "/x", "/vol/share/b"});
  const MonitorQueue second = MakeQueue({"/vol/share", "/pub/docs/", "rel/a"});
  EXPECT_EQ(MonitorQueue::GetShareSet({first, second}), (Shares{"/pub/docs", "/vol/share"}));

  Shares shares = {"/zzz", "/pub/docs"};
  second.CollectShareSet(shares);
  EXPECT_EQ(shares, (Shares{"/pub/docs", "/vol/share", "/zzz"}));

  EXPECT_TRUE(MonitorQueue::GetShareSet({}).empty());
  EXPECT_TRUE(MonitorQueue::GetShareSet({MakeQueue({}), MakeQueue({})}).empty());
}

}  // namespace
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
