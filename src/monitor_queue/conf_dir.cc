// The configuration directory of each queue type.

#include "monitor_queue.h"
#include "monitor_queue/log.h"
#include "monitor_queue/privileged_section.h"
#include "platform/platform.h"

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

constexpr mode_t kConfDirMode = 0700;

const char* BaseOf(_tag_monitor_queue_type_ type) {
  switch (static_cast<int>(type)) {
    case MONITOR_QUEUE_TYPE_SHARE_DIR:
      return "/usr/zorv/share/";
    case MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR:
      return "/usr/local/etc/";
    default:
      return "/usr/zorv/etc/";
  }
}

}  // namespace

std::string MonitorQueue::GetConfDir(_tag_monitor_queue_type_ type) {
  std::string dir = BaseOf(type);
  dir += "zorvnotifyd";
  // No root check: creation is attempted with whatever ids the entry gave.
  PrivilegedSection section(kSource, __LINE__);
  if (ZORBCFileCheckDir(dir.c_str()) == 0 &&
      ZORVFSMkdirP(dir.c_str(), nullptr, 1, 0, 0, kConfDirMode) != 0) {
    syslog(LOG_ERR, "%s:%d Failed to create conf dir: %s", kSource, __LINE__, dir.c_str());
  }
  return dir;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
