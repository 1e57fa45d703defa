// The inotify watches of the daemon: every directory of every configured
// tree, each watched for the union of the event kinds wanted there, kept in
// step with the trees as directories come and go.
#ifndef ZORVNOTIFYD_EXAMPLES_DAEMON_WATCH_TREE_H_
#define ZORVNOTIFYD_EXAMPLES_DAEMON_WATCH_TREE_H_

#include <sys/inotify.h>

#include <cstdint>
#include <functional>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "unique_fd.h"

namespace zorvnotifyd {

// Opens an inotify instance, non-blocking and close-on-exec.  On failure
// logs why (naming the kernel limit when it is the instance limit) and
// returns an empty descriptor.
UniqueFd OpenInotify();

// One configured tree: its top directory and the event kinds (inotify IN_*
// bits) wanted at and below it.
struct WatchRoot {
  std::string path;
  uint32_t mask;
};

// Receives one event: the full path it concerns and its inotify mask.
using EventSink = std::function<void(const std::string& path, uint32_t mask)>;

// The watches of one inotify instance over a set of trees.  Paths are
// handled as byte strings, exactly as the roots spell them: a child's path
// is its directory's path, "/" and its name.
class WatchTree {
 public:
  // Takes an inotify descriptor opened with IN_NONBLOCK.
  explicit WatchTree(UniqueFd inotify);
  // Removes every watch, then closes the descriptor.
  ~WatchTree();
  WatchTree(const WatchTree&) = delete;
  WatchTree& operator=(const WatchTree&) = delete;

  // The descriptor to poll for events.
  int fd() const { return inotify_.get(); }
  // The number of directories watched.
  size_t size() const { return watches_.size(); }
  // True when the last Sync left a root unwatched (missing, not a directory).
  bool missing_roots() const { return !skipped_.empty(); }

  // Makes the watches match |roots|: every directory at or below a root
  // whose mask is not 0 is watched with the union of the masks of the roots
  // it lies in; other watches are removed.  A watch whose mask does not
  // change is left alone, so no event on it is lost.  Roots that are not
  // directories are skipped, and logged once while they stay so.  False
  // when the kernel's watch limit stopped it (logged); the watches made so
  // far stay.
  bool Sync(const std::vector<WatchRoot>& roots);

  // Reads every pending event and hands each one on a watched path to
  // |sink|, in the kernel's order.  A directory created in or moved into a
  // tree is watched before its own event is handed on; then everything
  // found in it is handed on as IN_CREATE (with IN_ISDIR for directories),
  // so entries made before its watch existed are not missed, and none is
  // reported twice.  A directory deleted or moved away loses its watches.
  // On a queue overflow it logs and rescans the trees.  Reads a bounded
  // number of buffers; events left are read on the next call.  False when
  // reading failed (logged).
  bool ReadEvents(const EventSink& sink);

  // Removes every watch; the descriptor stays open.
  void Clear();

 private:
  struct Watch {
    std::string path;
    uint32_t mask;                  // the wanted kinds, without the tree-keeping bits
    std::set<std::string> scanned;  // names already handed on by a scan
  };

  // Handles one event other than an overflow (see ReadEvents).
  void Handle(const struct inotify_event& event, const EventSink& sink);
  // The union of the masks of the roots that |dir| is or lies below.
  uint32_t MaskFor(const std::string& dir) const;
  // Watches |dir| with |mask|, replacing an older watch of the same path.
  // Returns the watch descriptor, or -1 (logged when the limit was hit).
  int Add(const std::string& dir, uint32_t mask);
  // Watches |dir| and every directory below it, appending every entry found
  // below |dir| to |found| as a synthetic creation event.
  void AddAndScan(const std::string& dir, std::vector<std::pair<std::string, uint32_t>>* found);
  // Removes the watches of |dir| and of every directory below it.
  void Drop(const std::string& dir);
  // Forgets watch |wd|, first removing it from the kernel when |release|.
  void Remove(int wd, bool release);

  UniqueFd inotify_;
  std::vector<WatchRoot> roots_;
  std::map<int, Watch> watches_;        // by watch descriptor
  std::map<std::string, int> by_path_;  // watch descriptor by path
  std::set<std::string> skipped_;       // roots the last Sync could not watch
  bool limit_hit_ = false;
  bool scanned_any_ = false;  // some watch holds names handed on by a scan
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_EXAMPLES_DAEMON_WATCH_TREE_H_
