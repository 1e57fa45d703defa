// MonitorQueueIndex: "which queues want this event" for a whole catalogue,
// at a cost that does not grow with the number of queues.
//
// Calling MonitorQueue::IsMonitoring on every queue costs one comparison
// per configuration of the catalogue for every event.  The index sorts the
// configurations by path once, so that an event on a path looks only at the
// configurations whose path is that path or one of its ancestors, and
// compiles each distinct ignore pattern once for the whole catalogue.  Its
// answers are exactly those of the plain calls on the queues it was built
// from, byte for byte.
#ifndef ZORVNOTIFYD_MONITOR_QUEUE_INDEX_H_
#define ZORVNOTIFYD_MONITOR_QUEUE_INDEX_H_

#include <stddef.h>

#include <memory>
#include <string>
#include <vector>

#include "monitor_queue.h"
#include "zorvnotifyd_export.h"

namespace ZORV {
namespace ZORVNOTIFYD {

// The built form of an index; defined by the library.
struct MonitorQueueIndexData;

// An immutable index over a list of queues.  Copies are cheap and share the
// built form (copyable and movable).  Every member is const and the built
// form never changes, so one index may be asked from several threads at
// once without a lock.
class ZORVNOTIFYD_EXPORT MonitorQueueIndex {
 public:
  // Builds the index from |queues| (the catalogue as LoadAll returns it),
  // in time linear in the number of configurations (and the patterns they
  // name).  It keeps what it needs: |queues| may change or go away
  // afterwards.  Each distinct ignore pattern text is compiled once here,
  // as MonitorQueueConfig::PrepareRegex would (REG_EXTENDED); a pattern
  // that does not compile is dropped, as there.  Throws std::bad_alloc when
  // memory runs out.
  explicit MonitorQueueIndex(const std::vector<MonitorQueue>& queues);

  // Clears |out|, then fills it with the positions, in ascending order and
  // each once, of the queues for which queues[i].IsMonitoring(path, mask)
  // is true.  Looks only at the configurations whose path is |path| or one
  // of its ancestors by IsMonitoring's boundary rule; those with the same
  // path, mask and ignore patterns answer as one.  Runs each ignore pattern
  // at most once on |path| (when those configurations name at most 512
  // distinct patterns).  Allocates nothing once |out| has grown to its size.
  void Match(const std::string& path, unsigned int mask, std::vector<size_t>& out) const;

  // The OR of queues[i].GetUnionMask(dir) over every queue: the masks of
  // the configurations at or below |dir| (GetUnionMask's rule on a |dir|
  // that ends in "/" included).
  unsigned int GetUnionMask(const std::string& dir) const;

  // MonitorQueue::IsDirMonitoring(queues, dir): some configuration lies at
  // or below |dir|.
  bool IsDirMonitoring(const std::string& dir) const;

  // The OR of the masks of the configurations whose path is |dir| or an
  // ancestor of it by IsMonitoring's boundary rule: the event kinds a
  // watch on |dir| must carry.  Costs one lookup per component of |dir|.
  unsigned int GetWatchMask(const std::string& dir) const;

  // The number of queues it was built from.
  size_t size() const;

 private:
  std::shared_ptr<const MonitorQueueIndexData> data_;
};

}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_MONITOR_QUEUE_INDEX_H_
