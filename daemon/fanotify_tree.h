// The fanotify watcher of the daemon: one mark per file system that holds
// a configured tree, no watch per directory.  The kernel reports each
// change as the file handle of a directory and an entry's name; the
// watcher turns handles into paths through a cache and hands the same
// EventSink calls as WatchTree, with inotify's event bits.
#ifndef ZORVNOTIFYD_DAEMON_FANOTIFY_TREE_H_
#define ZORVNOTIFYD_DAEMON_FANOTIFY_TREE_H_

#include <fcntl.h>
#include <sys/types.h>

#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "offline_changes.h"
#include "snapshot.h"
#include "unique_fd.h"
#include "watch_masks.h"
#include "watch_tree.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

// Whether a fanotify mark could serve the open directory |dir|: its file
// system gives file handles and a non-zero file-system id.  False with
// |why| (a phrase for the log) when it does not.
bool FanotifySupports(int dir, std::string* why);

// The trees served by one fanotify group.  Paths are built from the roots
// as configured, as WatchTree builds them; symbolic links inside a tree
// are never followed.
class FanotifyTree {
 public:
  // Tick is called every |retry_seconds| (said in log lines).
  explicit FanotifyTree(double retry_seconds) : retry_seconds_(retry_seconds) {}
  FanotifyTree(const FanotifyTree&) = delete;
  FanotifyTree& operator=(const FanotifyTree&) = delete;

  // Opens the group (once; later calls answer as the first did).  False
  // with |why| when the kernel or the daemon's capabilities do not allow
  // file-system marks with directory handles and names.
  bool Open(std::string* why);
  // The descriptor to poll for events; -1 before Open.
  int fd() const { return fanotify_.get(); }
  // The directories whose paths are known (the cache).
  size_t size() const { return by_key_.size(); }
  // The configured trees not served now (missing, gone, not directories).
  size_t missing() const { return missing_.size(); }

  // Serves |roots| (absolute, normalised paths) from now on: marks each
  // file system holding one (once), and adds to the marks' event kinds
  // those |masks| ask for (file events only when some queue wants them).
  // Walks nothing: each tree new to it is compared with the snapshot by
  // WalkPending.  Returns the roots it serves (a missing one is looked for
  // by Tick); each one it cannot mark goes to |refused| with the reason,
  // for the caller to serve otherwise.
  std::vector<std::string> Sync(const std::vector<std::string>& roots, const WatchMasks& masks,
                                std::map<std::string, std::string>* refused);

  // Goes on with the walks that compare trees with the snapshot (a tree
  // new to it, one that came back, every tree after an overflow), a
  // bounded number of directories per call, filling the cache; at the end
  // of each tree hands the changes to the snapshot's sink as Offline
  // (Found for a tree that appeared, Rescan with no saved view).  True
  // while some walk is not done.
  bool WalkPending();
  // True while some walk is not done.
  bool walking() const { return walking_ != nullptr || !to_walk_.empty(); }

  // The periodic check: a root that is missing, or another directory now,
  // is served again and compared.
  void Tick();

  // Reads the pending events (a bounded number of buffers) and hands them
  // to |sink|: a move within the trees as IN_MOVED_FROM then IN_MOVED_TO, a
  // directory moved in from outside followed by Found for what it holds,
  // an overflow as Lost (every tree then compared again).  Events outside
  // the trees are dropped before any path is built.  False when reading
  // failed (logged).
  bool ReadEvents(EventSink& sink);
  // Reads until the queue is empty; false when it was not within a bound.
  bool Drain(EventSink& sink);

  // Forgets the cache (the marks stay until the group is closed).
  void Clear();

  // Keeps |snapshot| current from now on, comparing with it (see
  // WatchTree::UseSnapshot); |sink| gets what the comparisons find.
  void UseSnapshot(Snapshot* snapshot, EventSink* sink) {
    snapshot_ = snapshot;
    sink_ = sink;
  }
  // Lists again the directories events marked, and those new to a tree.
  void Relist();
  // Saves the snapshot as it stands in memory, unless a walk is not done:
  // the tree it compares holds listings whose changes are not reported
  // yet, and lacks those of the directories it has not reached.
  void SaveSnapshot() {
    if (snapshot_ != nullptr && walking_ == nullptr) snapshot_->Save();
  }

 private:
  struct Root {
    std::string path;        // as configured
    std::string real;        // as the kernel names it
    std::string fsid;        // the file system's id, 8 bytes
    std::string parent_key;  // the handle of the directory holding it
    std::string name;        // its name there
    dev_t dev = 0;
    ino_t ino = 0;
    bool present = false;
  };
  // One fid record of an event: the file system, the handle and a name.
  struct Fid {
    const char* fsid = nullptr;  // 8 bytes
    const struct file_handle* handle = nullptr;
    const char* name = nullptr;  // nullptr: none
  };

  // Identifies |root| anew from its open directory |dir| (its path as the
  // kernel names it, its file system, its parent's handle) and marks its
  // file system.  False with |why| on failure.
  bool Attach(Root& root, int dir, std::string* why);
  // Marks the file system of |dir| (fsid |fsid|) with mask_.
  bool Mark(int dir, const std::string& fsid, std::string* why);
  // How a tree waiting for WalkPending came: what a tree without a saved
  // view gives (kStart: Rescan; kReload: nothing, its queue starts now;
  // kAppeared: Found for all it holds; kAgain, after an overflow: Rescan).
  enum class Walk { kStart, kReload, kAppeared, kAgain };

  // Reads as ReadEvents does; |*empty| set when the queue was found empty.
  bool Read(EventSink& sink, bool* empty);
  // Handles one event: |dir| its directory and name, |old_dir| and
  // |new_dir| a move's, |child| the entry's own handle (each may be
  // nullptr).
  void Handle(uint32_t mask, const Fid* dir, const Fid* old_dir, const Fid* new_dir,
              const Fid* child, EventSink& sink);
  // The path (as the kernel names it) of the directory of |fid|, when it
  // lies in a tree; nullptr otherwise.  Resolves a handle not in the cache
  // with open_by_handle_at.  Sets key_ to the fid's key.
  const std::string* Resolve(const Fid& fid);
  // The configured paths of |real| (a path as the kernel names it), with
  // "/" and |name| appended when given, into paths_.
  void Configured(const std::string& real, const char* name);
  // Tells |sink| of each kind of |mask| on each of paths_, in the order
  // inotify reports them.
  void Emit(uint32_t mask, EventSink& sink);
  // A root's parent told of an entry named |name| (|mask|): the root went
  // or came.  False when |dir| is not a root's parent.
  bool RootEvent(const std::string& key, const char* name, uint32_t mask);
  // Caches |real| as the path of the directory with key |key|.
  void Cache(const std::string& key, const std::string& real);
  // Forgets |real| and every directory below it.
  void Forget(const std::string& real);
  // Moves the cached paths at and below |from| to |to|.
  void Move(const std::string& from, const std::string& to);
  // Reports what the open directory |dir| at configured path |path| holds
  // as Found, all the way down, without following links.
  void Scan(const std::string& path, int dir, EventSink& sink,
            std::vector<std::pair<dev_t, ino_t>>& ancestors);
  // Scans each of |paths| (a directory that arrived in the trees), where
  // it still is; false when it was at none of them (moved on, or gone).
  bool Arrived(const std::vector<std::string>& paths, EventSink& sink);
  // One directory of a walk in progress: the open directory, its path,
  // the subdirectories to go into and the next of them.
  struct Frame {
    UniqueFd dir;
    std::string path;
    std::vector<std::string> subdirs;
    size_t next = 0;
  };
  // A comparison walk in progress, depth first, one descriptor a level.
  struct Walking {
    std::string root, real, fsid;  // the tree's path, as the kernel names it, its file system
    dev_t dev = 0;
    Walk walk = Walk::kStart;
    Snapshot::Known known = Snapshot::Known::kNone;
    std::unique_ptr<OfflineChanges> changes;
    std::vector<Frame> stack;
    std::vector<std::pair<dev_t, ino_t>> ancestors;  // loop guard
  };
  // Compares the open directory |dir| at configured |path| (caching its
  // handle) and pushes it on the walk's stack.
  void Enter(UniqueFd dir, const std::string& path);
  // Logs, once while it lasts, that root |path| is not served and why.
  void NoteMissing(const std::string& path, const std::string& why);
  // A descriptor on the file system |fsid| for open_by_handle_at, kept
  // until the end of the read round (never longer: it would keep the
  // file system from being unmounted).
  int MountFd(const Root& root);

  UniqueFd fanotify_;
  bool opened_ = false;
  std::string open_error_;
  bool renames_ = false;                       // FAN_RENAME: a move in one event
  bool targets_ = false;                       // FAN_REPORT_TARGET_FID: the entry's own handle
  uint64_t mask_ = 0;                          // the kinds asked of every mark
  std::map<std::string, std::string> marked_;  // fsid -> a configured path on it
  std::vector<Root> roots_;                    // sorted by path
  std::map<std::string, std::string> missing_;
  std::unordered_map<std::string, std::string> by_key_;  // directory handle -> real path
  std::map<std::string, std::string> by_real_;           // real path -> handle
  std::unordered_set<std::string> outside_;              // handles of directories outside
  std::set<std::string> unscanned_;  // real paths of arrivals not found where they came
  std::deque<std::pair<std::string, Walk>> to_walk_;  // roots to compare
  std::unique_ptr<Walking> walking_;                  // the walk in progress
  std::map<std::string, UniqueFd> mount_fds_;         // by root path, this round
  std::string key_;                                   // Resolve's buffer
  std::vector<std::string> paths_;                    // Configured's result
  Snapshot* snapshot_ = nullptr;
  EventSink* sink_ = nullptr;
  bool reloading_ = false;  // within a Sync that is not the first
  bool synced_ = false;     // Sync ran before
  double retry_seconds_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_FANOTIFY_TREE_H_
