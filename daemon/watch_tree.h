// The inotify watches of the daemon: every directory of every configured
// tree, each watched for the union of the event kinds wanted there, kept in
// step with the trees as directories come, go, move, and as whole trees
// disappear and come back.
#ifndef ZORVNOTIFYD_DAEMON_WATCH_TREE_H_
#define ZORVNOTIFYD_DAEMON_WATCH_TREE_H_

#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "snapshot.h"
#include "unique_fd.h"
#include "watch_masks.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

class OfflineChanges;
struct ListedDir;

// Opens an inotify instance, non-blocking and close-on-exec.  On failure
// logs why (naming the kernel limit when it is the instance limit) and
// returns an empty descriptor.
UniqueFd OpenInotify();

// Where the watcher's findings go.
class EventSink {
 public:
  virtual ~EventSink() = default;
  // An event the kernel reported: its full path and inotify mask.
  virtual void Event(const std::string& path, uint32_t mask) = 0;
  // An entry found by scanning a directory that was not watched before
  // (new, moved in, or a tree that appeared): it may have been created,
  // written and closed before the watch existed.
  virtual void Found(const std::string& path, bool is_dir) = 0;
  // Events were lost: the kernel's event queue overflowed.
  virtual void Lost() = 0;
  // A change made while the daemon was not watching, found by comparing
  // what it last saw of |path| with what is there now: |mask| holds one
  // kind of IN_CREATE, IN_CLOSE_WRITE|IN_MODIFY, IN_DELETE, IN_MOVED_FROM or
  // IN_MOVED_TO, with IN_ISDIR for a directory.
  virtual void Offline(const std::string& path, uint32_t mask) = 0;
  // What happened at or below |path| cannot be known: whoever follows it
  // must look at that tree again.
  virtual void Rescan(const std::string& path) = 0;
};

// The kinds of the events the kernel reported, since a directory was
// watched, for each name in it: a comparison made after the watch leaves
// out what these already told.
using LiveNames = std::unordered_map<std::string, uint32_t>;

// The watches of one inotify instance over a set of trees.  Paths are byte
// strings built from the roots as configured: a child's path is its
// directory's path, "/" and its name.  One directory reached through
// several paths (a symbolic link or bind mount to a watched directory) is
// one inotify watch reported under each of its paths.  Symbolic links
// inside a tree are never followed; a root that is a link is.
class WatchTree {
 public:
  // Takes an inotify descriptor opened with IN_NONBLOCK.  Tick is called
  // every |retry_seconds| (said in log lines).
  WatchTree(UniqueFd inotify, double retry_seconds);
  // Removes every watch, then closes the descriptor.
  ~WatchTree();
  WatchTree(const WatchTree&) = delete;
  WatchTree& operator=(const WatchTree&) = delete;

  // The descriptor to poll for events.
  int fd() const { return inotify_.get(); }
  // The number of directories (inodes) watched.
  size_t size() const { return watches_.size(); }
  // The configured trees not watched now (missing, gone, not directories).
  size_t missing() const { return missing_.size(); }
  // The directories the watch limit left unwatched.
  size_t over_limit() const {
    size_t count = 0;
    for (const auto& [root, unwatched] : limited_) count += unwatched;
    return count;
  }

  // Makes the watches match |roots|, the configured trees (absolute,
  // normalised paths; see common/watch_path.h): every directory at or below
  // a root is watched with masks.For(directory), limited to
  // inotify's event kinds; other watches are removed.  A
  // watch whose mask does not change keeps its events.  Roots that do not
  // exist or are not directories are logged once and looked for by Tick.
  // Over the kernel's watch limit it watches what it can, logs per tree
  // how many directories it could not watch, and Tick tries again.
  void Sync(std::vector<std::string> roots, const WatchMasks& masks);

  // The periodic check: watches again every root that is missing or whose
  // directory was replaced (deleted and made again, moved back, a file
  // system mounted on it), reporting its entries to |sink| as Found; and
  // after a watch-limit failure, tries the whole Sync again.
  void Tick(EventSink& sink);

  // Reads the pending events (a bounded number of buffers; the rest wait
  // for the next call) and hands them to |sink| in the kernel's order:
  //  - a directory created in or moved into a tree from outside is watched
  //    and scanned after its own event, everything in it handed on as
  //    Found, so nothing made before its watch existed is missed;
  //  - a directory moved within the watched trees keeps its watches under
  //    the new path: the two move events are handed on, nothing else;
  //  - a directory deleted or moved away loses its watches; a root that
  //    goes away is logged and looked for again by Tick;
  //  - on a queue overflow, Lost, and every tree is watched afresh.
  // False when reading failed (logged).
  bool ReadEvents(EventSink& sink);

  // Removes every watch; the descriptor stays open.
  void Clear();

  // From now on keeps |snapshot| current and compares with it: each walk
  // of a tree that was not watched (at start, a tree that comes back, one
  // added to the catalogue, every tree after an overflow) hands |sink| the
  // changes made since the tree was last seen as Offline, or Rescan(root)
  // when nothing of it was saved; a tree walked with a snapshot reports
  // no Found entries.  Directories over the watch limit are told to |sink|
  // as Rescan when they are found unwatched and again once watched.
  void UseSnapshot(Snapshot* snapshot, EventSink* sink) {
    snapshot_ = snapshot;
    sink_ = sink;
  }
  // The next Sync only sets the watches of the trees it would compare
  // with the snapshot, leaving the comparisons to Compare: a start is
  // ready once its watches are in place.
  void CompareLater() { compare_later_ = true; }
  // Compares each tree the last Sync left to compare with the snapshot
  // (see UseSnapshot), tree by tree, telling the sink what changed.
  // Events the kernel reports meanwhile are read (a bounded number) and
  // left for ReadEvents: an entry changed after its directory was watched
  // but before it was compared is told by its event alone, never also as
  // an offline change of the same kind.  A directory created since its
  // parent was watched is left to that event, which scans it.  Returns
  // the number of trees compared.
  size_t Compare();
  // Saves the snapshot as it stands in memory.
  void SaveSnapshot();
  // Lists again every directory whose entries events changed since the
  // last call (and every directory new to a tree) and puts the listings in
  // the snapshot, without saving it.  Events only mark directories: the
  // listing and the status calls are paid here, once per directory and
  // save, never per event.
  void Relist();
  // Reads and hands to |sink| every event the kernel has queued, as
  // ReadEvents does, until the queue is found empty; false when it was not
  // within a bound (a flood of events) or reading failed.
  bool Drain(EventSink& sink);

 private:
  struct Watch {
    std::set<std::string> paths;  // every path it is watched under
    uint32_t mask = 0;            // the wanted kinds asked of the kernel
    dev_t dev = 0;
    ino_t ino = 0;
    const char* gone = nullptr;  // why it is about to go away, once the kernel said so
  };
  // One inotify event, copied out of the read buffer.
  struct RawEvent {
    int wd;
    uint32_t mask;
    uint32_t cookie;
    std::string name;
  };
  // The events read but not yet handled, oldest first: a vector taken
  // from the front and emptied once all are taken, keeping the storage of
  // one buffer's worth of events, so that reading events allocates
  // nothing for the queue once it has grown (more, read ahead while
  // comparing, is given back).
  class EventQueue {
   public:
    bool empty() const { return next_ == events_.size(); }
    size_t size() const { return events_.size() - next_; }
    void push_back(RawEvent event) { events_.push_back(std::move(event)); }
    const RawEvent& back() const { return events_.back(); }
    std::vector<RawEvent>::const_iterator begin() const { return events_.begin() + next_; }
    std::vector<RawEvent>::const_iterator end() const { return events_.end(); }
    // Moves the oldest event into |event|; the queue must not be empty.
    void PopFront(RawEvent* event) {
      *event = std::move(events_[next_++]);
      if (empty()) clear();
    }
    void clear() {
      // The most events one 64 KiB read returns: 16 bytes each at least.
      constexpr size_t kKept = 4096;
      if (events_.capacity() > kKept) {
        events_ = std::vector<RawEvent>();
      } else {
        events_.clear();
      }
      next_ = 0;
    }

   private:
    std::vector<RawEvent> events_;
    size_t next_ = 0;  // the oldest not taken
  };
  // What one walk of a tree does (see Walk).
  struct WalkContext {
    std::unordered_set<int>* synced = nullptr;  // Sync: watches given their exact mask this round
    // A first Sync: every directory by_inode_ knows was watched this round,
    // so |synced| is not kept.
    bool fresh = false;
    // Sync: every path watched this round, when by_path_ held some before
    std::unordered_set<std::string>* visited = nullptr;
    EventSink* found = nullptr;                      // report entries as Found
    size_t dirs = 0;                                 // directories met
    size_t unwatched = 0;                            // of which the watch limit refused
    std::vector<std::string> tops;                   // the highest unwatched directories
    size_t in_unwatched = 0;                         // unwatched directories being walked
    OfflineChanges* compare = nullptr;               // compare with the snapshot
    std::vector<std::pair<dev_t, ino_t>> ancestors;  // loop guard
    bool out_of_descriptors = false;                 // a subdirectory could not be opened, logged
  };

  // Reads one buffer of events into pending_.  False when nothing was read
  // (|*failed| set when reading failed rather than found nothing).
  bool Fill(bool* failed);
  // Handles the event at the front of pending_ (not an overflow).
  void Handle(const RawEvent& event, EventSink& sink);
  // True when |event|, on the watched directory |path| itself, reaches the
  // watch of its parent too, which reports it.
  bool ToldByParent(const std::string& path, const RawEvent& event) const;
  // The event kinds a watch on |dir| must carry for the queues.
  uint32_t MaskFor(const std::string& dir) const;
  // The innermost root that |dir| is or lies below; empty when none.
  std::string RootOf(const std::string& dir) const;
  // Watches the open directory |dir| as |path| and walks below it,
  // without following links.
  void Walk(int dir, const std::string& path, WalkContext& context);
  // Watches the open directory |dir|, whose status is |st|, as |path|.
  // The watch descriptor, or -1 (ENOSPC counted in |context|, other
  // failures logged).
  int Add(int dir, const struct stat& st, const std::string& path, WalkContext& context);
  // Watches and walks the directory at |path| (inside a watched tree),
  // reporting what it holds as Found.
  void AddAndScan(const std::string& path, EventSink& sink);
  // Watches the tree |root| and walks it; with context.found, reports its
  // entries as Found; with |compare| and a snapshot, compares it with the
  // snapshot instead.  False (with |why|) when the root cannot be opened.
  bool WatchRootTree(const std::string& root, WalkContext& context, std::string* why, bool compare);
  // Compares the listed directory |dir| at |path| and those below it, for
  // Compare, in the walk's order (names sorted, parents first); the
  // listings move into the snapshot.
  void CompareListed(ListedDir& dir, const std::string& path, OfflineChanges& changes);
  // Reads the events queued now into pending_ (up to a bound), noting the
  // kinds of each name in live_.
  void ReadAhead();
  // Tells sink_ to rescan each of |tops| not told already.
  void NoteUnwatched(const std::vector<std::string>& tops);
  // The directory that ListWatched last opened as a parent, kept by its
  // caller for one pass: the directories of one save mostly share their
  // parents, and each is then one openat instead of a walk from its root.
  struct ParentDir {
    std::string path;
    UniqueFd fd;
  };
  // Lists the watched directory |path| into |listing|, opening it through
  // |parent| when that is its parent (and keeping its parent there
  // otherwise); false when it is not watched or is no longer the directory
  // watched there.
  bool ListWatched(const std::string& path, SnapshotListing* listing, ParentDir* parent);
  // Opens the directory |path| below |root| as OpenBelow does, through
  // |parent| (see ListWatched).
  static UniqueFd OpenThroughParent(const std::string& root, const std::string& path,
                                    ParentDir* parent);
  // Moves the watches at and below each path of |from| to each path of
  // |to| (a rename within the trees; several paths when the directories
  // have several), then sets the kernel masks that the new place changes.
  // False when nothing was watched there.
  bool Move(const std::vector<std::string>& from, const std::vector<std::string>& to);
  // Forgets |path| and every path below it; |why| says why when a root is
  // among them ("deleted", "moved away", ...).
  void Drop(const std::string& path, const char* why);
  // Forgets one path of a watch; the watch itself goes (removed from the
  // kernel when |release|) once it has no path left.
  void Unmap(const std::string& path, bool release, const char* why);
  // Logs, once while it lasts, that root |path| is not watched and why.
  void NoteRootMissing(const std::string& path, const std::string& why);
  // Sync again with the same roots and masks.
  void Resync();

  // Puts the working directory back to home_ as the public call that made
  // it returns, if Add moved it: a walk then pays one fchdir per directory.
  class HomeAtReturn {
   public:
    explicit HomeAtReturn(WatchTree& tree) : tree_(tree) {}
    ~HomeAtReturn();

   private:
    WatchTree& tree_;
  };

  UniqueFd inotify_;
  UniqueFd home_;                             // the working directory between public calls
  bool away_ = false;                         // Add moved the working directory away from home_
  std::set<std::string, std::less<>> roots_;  // the configured trees
  WatchMasks masks_;
  std::unordered_map<int, Watch> watches_;  // by watch descriptor
  std::map<std::string, int> by_path_;      // watch descriptor by path
  // Hashes a directory's device and inode.
  struct InodeHash {
    size_t operator()(const std::pair<dev_t, ino_t>& id) const {
      return std::hash<uint64_t>()(uint64_t(id.second) * 0x9E3779B97F4A7C15u ^ uint64_t(id.first));
    }
  };
  std::unordered_map<std::pair<dev_t, ino_t>, int, InodeHash> by_inode_;  // watch by directory
  std::map<std::string, std::string> missing_;                            // unwatched roots and why
  std::map<std::string, size_t> limited_;  // roots the watch limit kept partly unwatched
  EventQueue pending_;                     // events read but not yet handled
  bool drained_ = false;                   // the last read left the kernel's queue empty
  std::set<uint32_t> moves_;  // cookies of directory moves within the trees, already done
  std::string entry_path_;    // Handle's buffer for the path of an event's entry
  Snapshot* snapshot_ = nullptr;
  EventSink* sink_ = nullptr;                // where comparisons and rescans go
  std::set<std::string> unwatched_tops_;     // told to rescan, over the watch limit
  bool synced_ = false;                      // Sync ran before
  bool compare_later_ = false;               // the next Sync leaves comparisons to Compare
  std::vector<std::string> to_compare_;      // roots Compare compares
  bool reading_ahead_ = false;               // Fill notes names in live_
  std::unordered_map<int, LiveNames> live_;  // by watch: what events told, while comparing
  bool reloading_ = false;                   // within a Sync that is not the first
  double retry_seconds_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_WATCH_TREE_H_
