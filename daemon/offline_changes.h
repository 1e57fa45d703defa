// What changed in a tree while the daemon did not watch it: the walk that
// sets the watches hands each directory's listing to an OfflineChanges,
// which compares it with the saved view of the tree, takes it as the new
// view, and at the end tells what was created, changed, deleted and moved.
#ifndef ZORVNOTIFYD_DAEMON_OFFLINE_CHANGES_H_
#define ZORVNOTIFYD_DAEMON_OFFLINE_CHANGES_H_

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <unordered_map>
#include <vector>

#include "snapshot.h"
#include "watch_tree.h"

namespace zorvnotifyd {

// One comparison of a whole tree, from its root down.
class OfflineChanges {
 public:
  // Compares with what |tree| holds (a saved view, or nothing), which it
  // replaces, as the walk goes, by what the walk sees.
  explicit OfflineChanges(TreeSnapshot* tree);

  // Directory |path|, whose inode is |listing.ino|, holds |listing| now
  // (sorted by name).  Compares it with the saved listing of that path, or
  // with that of the same directory at another path (it moved), in one
  // pass over both; the entries of a directory never seen before are
  // created.  A change of an entry whose name |live| holds with an event of
  // the same kind (created or moved in; deleted or moved away; written)
  // is left out: that event tells it.  Returns the listing as now kept in
  // the tree.
  const SnapshotListing& Directory(const std::string& path, SnapshotListing listing,
                                   const LiveNames* live = nullptr);

  // For Finish: the events of the directory at |path| (its path when the
  // walk began), or nullptr.
  void set_live(std::function<const LiveNames*(const std::string& path)> live) {
    live_ = std::move(live);
  }

  // Tells |sink| every change found (Offline), directories the walk did
  // not meet again counting as deleted with everything they held; an
  // inode deleted at one path and created at another is a move.
  void Finish(EventSink& sink);

 private:
  struct Change {
    std::string path;
    uint32_t mask;
    uint64_t ino;
    uint64_t size;
    int64_t mtime_ns;
  };
  // Records change |mask| (IN_ISDIR added for a directory) of |entry| of
  // directory |dir|, unless |live| told it.
  void Add(const std::string& dir, const SnapshotEntry& entry, uint32_t mask,
           const LiveNames* live);

  TreeSnapshot* tree_;
  std::map<std::string, SnapshotListing> saved_;            // not met again yet
  std::unordered_map<uint64_t, std::string> saved_by_ino_;  // made on the first need
  bool indexed_ = false;
  std::vector<Change> changes_;
  std::function<const LiveNames*(const std::string&)> live_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_OFFLINE_CHANGES_H_
