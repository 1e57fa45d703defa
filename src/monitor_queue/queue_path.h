// Where a client's queue file lives.
#ifndef ZORVNOTIFYD_SRC_MONITOR_QUEUE_QUEUE_PATH_H_
#define ZORVNOTIFYD_SRC_MONITOR_QUEUE_QUEUE_PATH_H_

#include <string>

#include "monitor_queue.h"

namespace ZORV {
namespace ZORVNOTIFYD {

// The full path of queue file |file| of |type|: the configuration directory
// (created when missing), "/" and |file| unchanged.
inline std::string QueueFilePath(const std::string& file, _tag_monitor_queue_type_ type) {
  return MonitorQueue::GetConfDir(type) + "/" + file;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_SRC_MONITOR_QUEUE_QUEUE_PATH_H_
