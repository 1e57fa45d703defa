// The event kinds each watched directory must carry for the queues.
#ifndef ZORVNOTIFYD_DAEMON_WATCH_MASKS_H_
#define ZORVNOTIFYD_DAEMON_WATCH_MASKS_H_

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
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
  // Open addressing over FNV-1a hashes, which For computes along the
  // directory's path once for all its leading parts.
  struct Table {
    std::vector<std::string> paths;  // each configured path once
    std::vector<uint64_t> hashes;    // of paths[i]
    std::vector<uint32_t> masks;     // of paths[i]
    std::vector<uint32_t> slots;     // 1 + an index into paths, or 0; a power of 2 long
    // The index of |path| (whose hash is |hash|), or -1.
    long Find(uint64_t hash, std::string_view path) const;
  };
  std::shared_ptr<const Table> table_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_WATCH_MASKS_H_
