// Reporting events to the queues that want them.
#ifndef ZORVNOTIFYD_EXAMPLES_DAEMON_REPORT_H_
#define ZORVNOTIFYD_EXAMPLES_DAEMON_REPORT_H_

#include <cstdint>
#include <string>

#include "catalogue.h"

namespace zorvnotifyd {

// Asks every queue of |catalogue| whether it wants an event of kinds |mask|
// on |path| and writes one line to standard output for each queue that
// does, flushed at once.  With |json| the line is a JSON object with
// exactly the keys "queue", "type", "file", "path" and "mask"; otherwise a
// readable line.
void ReportEvent(Catalogue& catalogue, const std::string& path, uint32_t mask, bool json);

// The names of the inotify bits of |mask| joined by "|", e.g.
// "IN_CREATE|IN_ISDIR"; unnamed bits as one hexadecimal number.
std::string MaskNames(uint32_t mask);

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_EXAMPLES_DAEMON_REPORT_H_
