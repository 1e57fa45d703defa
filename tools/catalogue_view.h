// The whole catalogue with the type of each queue.
#ifndef ZORVNOTIFYD_TOOLS_CATALOGUE_VIEW_H_
#define ZORVNOTIFYD_TOOLS_CATALOGUE_VIEW_H_

#include <string>
#include <vector>

#include "monitor_queue.h"
#include "queue_types.h"

namespace zorvnotifyctl {

using zorvcommon::kAllQueueTypes;
using zorvcommon::ParseQueueType;
using zorvcommon::QueueType;
using zorvcommon::QueueTypeName;

// One queue of the catalogue and the type of the directory it came from.
struct TypedQueue {
  QueueType type;
  ZORV::ZORVNOTIFYD::MonitorQueue queue;
};

// "queue file PATH is refused: WHY; ..." for a queue file at |path| that
// zorvcommon::UntrustedQueueFile refused with |why|.
std::string RefusedQueueFile(const std::string& path, const std::string& why);

// Replaces |queues| with every queue of every type: types in the order
// share, etc, local-etc; within a type the files the library's catalogue
// reads (regular, links followed, name not beginning with ".") in byte-wise
// name order, as the daemon reads them; within a file the queues in file
// order.  A file that fails to load contributes what the library appended
// before failing, as in the library's LoadAllByType.  Warns on standard
// error about a configuration directory that is missing (and could not be
// created), which then counts as empty, and about each file whose name
// looks like a backup copy, since the library loads it like any queue file.
// A file that root alone does not control (zorvcommon::UntrustedQueueFile)
// is refused whole and one that fails to load is named with why: each on
// standard error, and then |complete| is set to false (else true).
// False when a directory exists but cannot be read (said on standard
// error); then |queues| is empty.
bool LoadCatalogue(std::vector<TypedQueue>* queues, bool* complete);

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_CATALOGUE_VIEW_H_
