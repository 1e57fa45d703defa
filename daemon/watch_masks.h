// The event kinds each watched directory must carry for the queues.
#ifndef ZORVNOTIFYD_DAEMON_WATCH_MASKS_H_
#define ZORVNOTIFYD_DAEMON_WATCH_MASKS_H_

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "catalogue.h"

namespace zorvnotifyd {

// The mask of each configured path, for the watchers: what
// MonitorQueueIndex::GetWatchMask answers for a catalogue, from a table
// that costs a small part of the index to make.  The watchers need the
// masks before the daemon is ready; the index is needed only once events
// are read.  Copies share the table.
class WatchMasks {
 public:
  // No configuration: every mask is 0.
  WatchMasks() = default;
  // The configurations of every queue of |catalogue|.
  explicit WatchMasks(const Catalogue& catalogue);

  // The OR of the masks of the configurations whose path is |dir| or a
  // leading part of it that ends where a "/" follows.
  uint32_t For(std::string_view dir) const;

 private:
  struct Table {
    std::vector<std::string> paths;  // the keys' text, each once
    std::unordered_map<std::string_view, uint32_t> masks;
  };
  std::shared_ptr<const Table> table_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_WATCH_MASKS_H_
