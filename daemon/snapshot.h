// What the daemon last saw of each watched tree: for each directory, the
// name, inode, type, size, modification and change times of each entry,
// kept in memory and saved under the state directory, so that a later
// start (or the tree coming back) can tell what changed while nobody
// watched.
#ifndef ZORVNOTIFYD_DAEMON_SNAPSHOT_H_
#define ZORVNOTIFYD_DAEMON_SNAPSHOT_H_

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <unordered_set>
#include <vector>

#include "unique_fd.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

// One entry of a directory as last seen.
struct SnapshotEntry {
  std::string name;
  uint64_t ino = 0;
  uint64_t size = 0;
  int64_t mtime_ns = 0;
  int64_t ctime_ns = 0;
  bool is_dir = false;  // a directory itself, not a link to one
};

// The entries of one directory, sorted by name (bytes), and the inode of
// the directory itself.
struct SnapshotListing {
  uint64_t ino = 0;
  std::vector<SnapshotEntry> entries;
};

// Lists the open directory |dir| with getdents64, and fstatat (never
// following a link) each entry: the entries sorted by name.  Entries that
// vanish between the two calls are left out.  False when |dir| cannot be
// read.
bool ListWithStatus(int dir, SnapshotListing* listing);

// The saved view of one tree, by directory path (absolute, as the walk
// builds it).  Kept current by replacing a directory's listing whenever it
// is listed again, and saved as an append-only file of checksummed records
// (see snapshot.cc), compacted once its superseded records outweigh the
// live ones: a save never rewrites the whole tree for a few changes.
class TreeSnapshot {
 public:
  explicit TreeSnapshot(std::string root) : root_(std::move(root)) {}
  const std::string& root() const { return root_; }
  // The directories' listings, by path.
  std::map<std::string, SnapshotListing>& dirs() { return dirs_; }

  // Replaces the listing of |path| (which lies at or below the root) and
  // queues its record for the next Save.
  void Put(const std::string& path, SnapshotListing listing);
  // Forgets |path| and every directory below it, and queues the record.
  void Forget(const std::string& path);
  // From now on the next Save writes the whole tree afresh.
  void RewriteAll() {
    rewrite_ = true;
    NoteQueued();
  }

  // Appends the queued records to the tree's file in |dir| and
  // fdatasync()s it.  False when the file must be written whole instead:
  // first save, after a rewrite was asked, once the file holds more than
  // twice the live records, or when appending failed (logged).
  bool AppendQueued(int dir);
  // The bytes the live records take on disk.
  uint64_t live_bytes() const { return live_bytes_; }

 private:
  friend class Snapshot;
  // Appends the record of |path| (its listing, or "forgotten" when it has
  // none) to |out|.
  void Encode(const std::string& path, std::string* out) const;
  // True while the next Save has something of this tree to write.
  bool has_queued() const { return rewrite_ || !queued_.empty(); }
  // Puts the tree on the list of its Snapshot's trees to save, once.
  void NoteQueued() {
    if (to_save_ != nullptr && !listed_) {
      listed_ = true;
      to_save_->push_back(this);
    }
  }
  // Writes every listing to a new temporary file in |dir|, not synced;
  // its descriptor, or an empty one (logged, the temporary removed).
  UniqueFd WriteTemporary(int dir);
  // Renames the temporary file, synced by the caller, over the tree's
  // file; false (logged) on failure.
  bool Install(int dir);
  // Logs that a save failed for |error|, once until a save succeeds again:
  // a full disk is retried at every sync and must not flood the log.
  void SaveFailed(int error);

  std::string root_;
  std::map<std::string, SnapshotListing> dirs_;
  std::vector<std::string> queued_;  // paths changed since the last Save
  bool rewrite_ = true;              // no file of this tree written yet
  uint64_t file_bytes_ = 0;          // the size of the tree's file
  uint64_t live_bytes_ = 0;          // its records still in force (an estimate)
  // The trees Save looks at (its Snapshot's, none when the tree is not
  // saved), and whether this one is on that list.
  std::vector<TreeSnapshot*>* to_save_ = nullptr;
  bool listed_ = false;
  bool save_failed_ = false;  // the last save failed, and was logged
};

// Every tree's saved view, in the directory "snapshot" of the state
// directory: one file per tree, named by a hash of the tree's path.
class Snapshot {
 public:
  // Keeps the files in the open directory |dir| (root's alone).  Without
  // one (empty) it keeps nothing on disk: every tree walked afresh is
  // answered with a rescan.
  explicit Snapshot(UniqueFd dir) : dir_(std::move(dir)) {}
  Snapshot(const Snapshot&) = delete;
  Snapshot& operator=(const Snapshot&) = delete;

  // What is known of tree |root|.
  enum class Known { kSaved, kNone, kBroken };
  // The tree |root|, loaded from its file when first asked for: |known|
  // says whether a saved view was there (kNone: never saved; kBroken: a
  // file that is not a regular file of root's, too large, cut short or
  // garbage, logged once, and replaced at the next Save).  The view is
  // empty unless kSaved.
  TreeSnapshot* Tree(const std::string& root, Known* known);
  // The tree |root| if loaded, else nullptr.
  TreeSnapshot* Loaded(const std::string& root);
  // Every loaded tree, by root.  A tree once loaded is never dropped.
  std::map<std::string, std::unique_ptr<TreeSnapshot>, std::less<>>& trees() { return trees_; }

  // Marks directory |path| as changed: one hash-set insertion, no system
  // call; SaveChanges lists it again.
  void MarkDirty(const std::string& path) { dirty_.insert(path); }
  // Takes the set of directories marked since the last call.
  std::vector<std::string> TakeDirty();
  // True while directories are marked or trees wait for Save.
  bool pending() const { return !dirty_.empty() || !to_save_.empty(); }

  // Saves every tree with queued changes: appends where it can, and
  // writes the other trees' files whole, synced together (one syncfs when
  // there are many, else one fdatasync each), renamed in place and the
  // directory synced once.
  void Save();

  // The most bytes a tree's file may hold: a larger one is not read.
  static constexpr uint64_t kMaxFileBytes = 256ull << 20;

 private:
  // Reads and checks the file of |tree| into it; kNone or kBroken when
  // there is no usable file.
  Known Load(TreeSnapshot* tree);
  // Saves those of |trees| with something queued, as Save says.
  void SaveTrees(const std::vector<TreeSnapshot*>& trees);

  UniqueFd dir_;
  std::map<std::string, std::unique_ptr<TreeSnapshot>, std::less<>> trees_;
  std::unordered_set<std::string> dirty_;  // directories to list again
  // The trees with something queued or to rewrite: a save pays for the
  // trees that changed, not for every tree loaded.
  std::vector<TreeSnapshot*> to_save_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_SNAPSHOT_H_
