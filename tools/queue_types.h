// The queue types as the tool names them on its command line and in its
// output.
#ifndef ZORVNOTIFYD_TOOLS_QUEUE_TYPES_H_
#define ZORVNOTIFYD_TOOLS_QUEUE_TYPES_H_

#include <string>

#include "monitor_queue.h"

namespace zorvnotifyctl {

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

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_QUEUE_TYPES_H_
