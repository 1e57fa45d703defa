// Where the watcher's findings go: each queue that wants an event gets a
// record in its log (which the daemon's clients read), and, for debugging,
// a line on standard output.
#ifndef ZORVNOTIFYD_DAEMON_REPORT_H_
#define ZORVNOTIFYD_DAEMON_REPORT_H_

#include <cstdint>
#include <functional>
#include <string>
#include <tuple>
#include <vector>

#include "catalogue.h"
#include "monitor_queue_index.h"
#include "queue_log.h"
#include "watch_masks.h"
#include "watch_tree.h"

namespace zorvnotifyd {

// The mask reported for an entry found by a scan: everything that may have
// happened to it before its directory was watched.
constexpr uint32_t kFoundFileMask = IN_CREATE | IN_MODIFY | IN_CLOSE_WRITE | IN_MOVED_TO;
constexpr uint32_t kFoundDirMask = IN_CREATE | IN_MOVED_TO | IN_ISDIR;

// How the daemon writes on standard output.
enum class Stdout { kNone, kText, kJson };

// Hands each finding to the queues that want it, in catalogue order,
// asking a MonitorQueueIndex which they are.  With standard output on,
// also writes one line per queue (buffered: the caller flushes):
//   text:  queue NAME [TYPE/FILE]: IN_CREATE|IN_ISDIR PATH
//          queue NAME [TYPE/FILE]: RESCAN TREE ...
//   JSON:  {"queue":..,"type":..,"file":..,"path":..,"mask":..}
//          {"queue":..,"type":..,"file":..,"rescan":TREE}
// with control bytes escaped (\xNN in text; as JSON does).
class Reporter : public EventSink {
 public:
  Reporter(QueueLogs& logs, Stdout out) : logs_(logs), stdout_(out) {}

  // Reports to the queues of |catalogue| from now on; |created| gets the
  // logs of queues new to the daemon.  Their index is made by BuildIndex,
  // or by the first report that needs it.
  void Use(Catalogue catalogue, std::vector<QueueLog*>* created);
  // Makes the index over the queues in use unless it is made already: the
  // daemon calls it once its watches are in place, before it reads events.
  void BuildIndex();
  // The masks of the configurations in use, for the watchers.
  const WatchMasks& masks() const { return masks_; }
  // Calls |recorded| after each record added to a log.
  void OnRecord(std::function<void(QueueLog*)> recorded) { recorded_ = std::move(recorded); }
  // The number of queues in use.
  size_t size() const { return catalogue_.size(); }
  // Events handed on so far, and queue overflows.
  uint64_t events() const { return events_; }
  uint64_t overflows() const { return overflows_; }

  // A record for each queue that wants the event (IsMonitoring).
  void Event(const std::string& path, uint32_t mask) override;
  // A record for each queue that wants an event of kFoundFileMask (or
  // kFoundDirMask for a directory) on |path|; its mask holds the bits of
  // that mask that the queue's matching configurations ask for (and
  // IN_ISDIR for a directory).
  void Found(const std::string& path, bool is_dir) override;
  // After a kernel queue overflow: a rescan record for each tree of every
  // queue of the catalogue.
  void Lost() override;
  // A record with "offline":true for each queue that wants some kind of
  // |mask| on |path|, with the kinds it wants (and IN_ISDIR as given).
  void Offline(const std::string& path, uint32_t mask) override;
  // A rescan record for each queue with a configuration whose tree holds
  // |path| (naming |path|) or lies below it (naming that tree).
  void Rescan(const std::string& path) override;

 private:
  // Records the event for queue |i| (once per log and event).
  void Record(size_t i, const std::string& path, uint32_t mask, uint64_t order,
              bool offline = false);
  // A record for each queue that wants some kind of |kinds| on |path|, with
  // the kinds it wants and |extra| (IN_ISDIR).
  void RecordWanted(const std::string& path, uint32_t kinds, uint32_t extra, bool offline);

  QueueLogs& logs_;
  Stdout stdout_;
  std::function<void(QueueLog*)> recorded_;
  Catalogue catalogue_;
  std::vector<QueueLog*> logs_by_position_;
  ZORV::ZORVNOTIFYD::MonitorQueueIndex index_{{}};
  bool indexed_ = true;  // index_ is over catalogue_
  WatchMasks masks_;
  std::vector<size_t> matches_;         // reused by every event
  std::vector<uint32_t> found_wanted_;  // per queue, for Found
  // Every configured tree as (path, queue, position in the queue), sorted:
  // a rescan finds the queues it concerns by its path's prefixes and the
  // trees below it, not by a pass over every configuration.  Made by the
  // first rescan after each Use, which a start-up need not wait for.
  std::vector<std::tuple<std::string, size_t, size_t>> trees_;
  std::string line_;  // reused for standard output
  uint64_t events_ = 0;
  uint64_t overflows_ = 0;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_REPORT_H_
