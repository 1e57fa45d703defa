// Loading the catalogue type by type.

#include "catalogue_view.h"

namespace zorvnotifyctl {

using ZORV::ZORVNOTIFYD::MonitorQueue;

bool LoadCatalogue(std::vector<TypedQueue>* queues) {
  queues->clear();
  for (QueueType type : kAllQueueTypes) {
    std::vector<MonitorQueue> loaded;
    if (!MonitorQueue::LoadAllByType(loaded, type)) {
      queues->clear();
      return false;
    }
    for (const MonitorQueue& queue : loaded) queues->push_back(TypedQueue{type, queue});
  }
  return true;
}

}  // namespace zorvnotifyctl
