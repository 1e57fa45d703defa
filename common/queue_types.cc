// Names of the queue types.

#include "queue_types.h"

namespace zorvcommon {

bool ParseQueueType(const std::string& text, QueueType* type) {
  for (QueueType candidate : kAllQueueTypes) {
    if (text == QueueTypeName(candidate)) {
      *type = candidate;
      return true;
    }
  }
  return false;
}

const char* QueueTypeName(QueueType type) {
  switch (type) {
    case ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_SHARE_DIR:
      return "share";
    case ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR:
      return "local-etc";
    default:
      return "etc";
  }
}

}  // namespace zorvcommon
