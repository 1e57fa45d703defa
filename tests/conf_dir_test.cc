// The configuration directory of each queue type: its path, its creation
// when missing, and a creation that fails.

#include <filesystem>
#include <fstream>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "monitor_queue.h"
#include "support/sandbox.h"
#include "support/syslog_capture.h"

namespace ZORV::ZORVNOTIFYD {

namespace fs = std::filesystem;
const std::string kEtcDir = "/usr/zorv/etc/zorvnotifyd", kLocal = "/usr/local/etc/zorvnotifyd";

TEST(ConfDirTest, EachTypeHasItsDirectoryCreatedWhenMissing) {
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
  EXPECT_EQ(zorv_test::DumpLogs(), "");

  zorv_test::ResetStore();
  std::ofstream("/usr/zorv") << "";  // a file where a parent should be
  EXPECT_EQ(MonitorQueue::GetConfDir(MONITOR_QUEUE_TYPE_ETC_DIR), kEtcDir);
  EXPECT_THAT(
      zorv_test::DumpLogs(),
      testing::MatchesRegex("3 monitor_queue:[0-9]+ Failed to create conf dir: " + kEtcDir + "\n"));
  EXPECT_EQ(zorv_test::CapturedLogs().at(0).format, "%s:%d Failed to create conf dir: %s");
  EXPECT_TRUE(fs::is_regular_file("/usr/zorv"));  // left in place
}

}  // namespace ZORV::ZORVNOTIFYD
