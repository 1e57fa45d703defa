// Logging convention of the monitor queue sources.
//
// Every line goes to syslog with its format string written verbatim at the
// call site, the source name and the line as the first two arguments:
//   syslog(LOG_ERR, "%s:%d Lock failed", kSource, __LINE__);
// The library never calls openlog.
#ifndef ZORVNOTIFYD_SRC_MONITOR_QUEUE_LOG_H_
#define ZORVNOTIFYD_SRC_MONITOR_QUEUE_LOG_H_

#include <syslog.h>

namespace ZORV {
namespace ZORVNOTIFYD {

// The source name printed by every line of the records, store and updates.
inline constexpr const char kSource[] = "monitor_queue";

}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_SRC_MONITOR_QUEUE_LOG_H_
