// The daemon's watchers: each configured tree is served by inotify
// (WatchTree, a watch per directory) or by fanotify (FanotifyTree, a mark
// per file system), chosen tree by tree; both hand the same EventSink
// calls, so the queues cannot tell which served an event.
#ifndef ZORVNOTIFYD_DAEMON_WATCHERS_H_
#define ZORVNOTIFYD_DAEMON_WATCHERS_H_

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "fanotify_tree.h"
#include "snapshot.h"
#include "unique_fd.h"
#include "watch_masks.h"
#include "watch_tree.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

// What --backend asks for.
enum class Backend { kAuto, kInotify, kFanotify };

// Parses "auto", "inotify" or "fanotify"; false for anything else.
bool ParseBackend(const std::string& text, Backend* backend);

// Both watchers, and the choice between them.  The rule of kAuto: fanotify
// serves a tree that is a whole file system (the root of a mount whose
// root is the file system's) where the kernel, the file system (file
// handles, a file-system id) and the daemon's capabilities allow it, so
// that no event outside the trees costs anything; also a tree inside a
// tree it serves.  inotify serves the rest, and every tree inside a tree
// it serves.  kFanotify drops the whole-file-system rule: fanotify serves
// every tree it can; kInotify: none.
class Watchers {
 public:
  // Takes an inotify descriptor opened with IN_NONBLOCK; see WatchTree.
  Watchers(UniqueFd inotify, double retry_seconds, Backend backend);

  // The descriptors to poll (the fanotify one -1 while it is not open).
  int inotify_fd() const { return inotify_.fd(); }
  int fanotify_fd() const { return fanotify_.fd(); }
  // Directories watched by inotify plus those whose path fanotify knows.
  size_t size() const { return inotify_.size() + fanotify_.size(); }
  // The configured trees served by neither now.
  size_t missing() const { return inotify_.missing() + fanotify_.missing(); }
  // See WatchTree::over_limit.
  size_t over_limit() const { return inotify_.over_limit(); }

  // Each watcher keeps its own snapshot (trees are served by one at a
  // time); the comparisons' findings go to |sink|.
  void UseSnapshots(Snapshot* inotify, Snapshot* fanotify, EventSink* sink) {
    inotify_.UseSnapshot(inotify, sink);
    fanotify_.UseSnapshot(fanotify, sink);
  }

  // Chooses the backend of each root and syncs both watchers.  Each new
  // choice and why waits for LogChoices.
  void Sync(std::vector<std::string> roots, const WatchMasks& masks);
  // Logs the choices Sync made that differ from the earlier ones, a line
  // per tree for the first 20, then one line with the count of the rest.
  // The daemon calls it once it is ready rather than before.
  void LogChoices();
  // Both watchers' periodic checks.
  void Tick(EventSink& sink) {
    inotify_.Tick(sink);
    fanotify_.Tick();
  }
  // Reads each watcher's pending events; false when reading failed.
  bool ReadInotify(EventSink& sink) { return inotify_.ReadEvents(sink); }
  bool ReadFanotify(EventSink& sink) { return fanotify_.ReadEvents(sink); }
  // Compares one more fanotify tree with the snapshot (after ready); true
  // while more wait.
  // See WatchTree::CompareLater and WatchTree::Compare: the inotify trees'
  // comparison after ready (fanotify's is WalkPending's).
  void CompareLater() { inotify_.CompareLater(); }
  size_t Compare() { return inotify_.Compare(); }
  bool WalkPending() { return fanotify_.WalkPending(); }
  bool walking() const { return fanotify_.walking(); }
  // See WatchTree: Relist, Drain, SaveSnapshot, Clear, for both.
  void Relist() {
    inotify_.Relist();
    fanotify_.Relist();
  }
  bool Drain(EventSink& sink) {
    const bool inotify = inotify_.Drain(sink);
    return fanotify_.Drain(sink) && inotify;
  }
  void SaveSnapshot() {
    inotify_.SaveSnapshot();
    fanotify_.SaveSnapshot();
  }
  void Clear() {
    inotify_.Clear();
    fanotify_.Clear();
  }
  // Appends "trees":{ROOT:{"backend":..,"why":..},...} for the status reply.
  void AppendStatus(std::string* out) const;

 private:
  struct Choice {
    const char* backend;
    // Shared: thousands of trees mostly have one of a few reasons.
    std::shared_ptr<const std::string> why;
  };
  WatchTree inotify_;
  FanotifyTree fanotify_;
  Backend backend_;
  std::map<std::string, Choice, std::less<>> chosen_;  // by root
  // A catalogue of thousands of trees must not flood the log at each start:
  // LogChoices prints the first lines of new choices, then how many more.
  static constexpr size_t kMaxChoiceLines = 20;
  std::vector<std::string> unlogged_;  // the first lines of new choices
  size_t unlogged_more_ = 0;           // how many new choices more
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_WATCHERS_H_
