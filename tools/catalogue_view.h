// The whole catalogue with the type of each queue.
#ifndef ZORVNOTIFYD_TOOLS_CATALOGUE_VIEW_H_
#define ZORVNOTIFYD_TOOLS_CATALOGUE_VIEW_H_

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

// Replaces |queues| with every queue of every type, in catalogue order
// (share, etc, local-etc; within a type as the library lists it).  The
// library's LoadAll does not tell types apart, so this loads type by type.
// False when a type could not be read (the library has logged why); then
// |queues| is empty.
bool LoadCatalogue(std::vector<TypedQueue>* queues);

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_CATALOGUE_VIEW_H_
