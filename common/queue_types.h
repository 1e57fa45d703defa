// The queue types as zorvnotifyctl and zorvnotifyd name them on their
// command lines and in their output.
#ifndef ZORVNOTIFYD_COMMON_QUEUE_TYPES_H_
#define ZORVNOTIFYD_COMMON_QUEUE_TYPES_H_

#include <string>

#include "monitor_queue.h"

namespace zorvcommon {

using QueueType = ZORV::ZORVNOTIFYD::_tag_monitor_queue_type_;

// The three queue types in catalogue order.
constexpr QueueType kAllQueueTypes[] = {
    ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_SHARE_DIR,
    ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR,
    ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_LOCAL_ETC_DIR,
};

// Parses "share", "etc" or "local-etc" (exactly, case included) into
// |type|.  False, with |type| unchanged, for any other text.
bool ParseQueueType(const std::string& text, QueueType* type);

// "share", "etc" or "local-etc"; "etc" for any other value, as the library
// maps every other value to the directory of the etc type.
const char* QueueTypeName(QueueType type);

}  // namespace zorvcommon

#endif  // ZORVNOTIFYD_COMMON_QUEUE_TYPES_H_
