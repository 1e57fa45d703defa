// The daemon's output: one line per queue and event, on standard output.
#ifndef ZORVNOTIFYD_DAEMON_REPORT_H_
#define ZORVNOTIFYD_DAEMON_REPORT_H_

#include <cstdint>
#include <string>
#include <vector>

#include "catalogue.h"
#include "monitor_queue_index.h"
#include "watch_tree.h"

namespace zorvnotifyd {

// The mask reported for an entry found by a scan: everything that may have
// happened to it before its directory was watched.
constexpr uint32_t kFoundFileMask = IN_CREATE | IN_MODIFY | IN_CLOSE_WRITE | IN_MOVED_TO;
constexpr uint32_t kFoundDirMask = IN_CREATE | IN_MOVED_TO | IN_ISDIR;

// Writes the watcher's findings to standard output for the queues of a
// catalogue, in the order of the catalogue, asking a MonitorQueueIndex
// which queues want each event.  Lines are buffered: the caller
// flushes standard output after each round of events.
//
// Text lines:  queue NAME [TYPE/FILE]: IN_CREATE|IN_ISDIR PATH
//              queue NAME [TYPE/FILE]: LOST events may have been lost ...
// with control bytes in NAME, FILE and PATH written as \xNN.  JSON lines
// (|json|): {"file":..,"mask":..,"path":..,"queue":..,"type":..} and, for
// lost events, {"file":..,"lost":true,"queue":..,"type":..}.
class Reporter : public EventSink {
 public:
  explicit Reporter(bool json) : json_(json) {}

  // Reports to the queues of |catalogue| from now on.
  void Use(Catalogue catalogue);
  // The index over the queues in use.
  const ZORV::ZORVNOTIFYD::MonitorQueueIndex& index() const { return index_; }
  // The number of queues in use.
  size_t size() const { return catalogue_.size(); }

  // One line for each queue that wants the event (IsMonitoring).
  void Event(const std::string& path, uint32_t mask) override;
  // One line for each queue that wants an event of kFoundFileMask (or
  // kFoundDirMask for a directory) on |path|; its mask holds the bits of
  // that mask that the queue's matching configurations ask for (and
  // IN_ISDIR for a directory).
  void Found(const std::string& path, bool is_dir) override;
  // One "lost" line for every queue of the catalogue.
  void Lost() override;

 private:
  void Write(const CatalogueQueue& entry, const std::string& path, uint32_t mask);

  Catalogue catalogue_;
  ZORV::ZORVNOTIFYD::MonitorQueueIndex index_{{}};
  bool json_;
  std::vector<size_t> matches_;         // reused by every event
  std::vector<uint32_t> found_wanted_;  // per queue, for Found
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_REPORT_H_
