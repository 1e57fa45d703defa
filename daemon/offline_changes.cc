// Comparing a tree with its saved view.

#include "offline_changes.h"

#include <sys/inotify.h>

namespace zorvnotifyd {
namespace {

constexpr uint32_t kChanged = IN_CLOSE_WRITE | IN_MODIFY;

}  // namespace

OfflineChanges::OfflineChanges(TreeSnapshot* tree) : tree_(tree), saved_(std::move(tree->dirs())) {
  tree_->dirs().clear();
  tree_->RewriteAll();
}

void OfflineChanges::Add(const std::string& dir, const SnapshotEntry& entry, uint32_t mask,
                         const LiveNames* live) {
  if (live != nullptr) {
    const auto seen = live->find(entry.name);
    const uint32_t told = seen == live->end() ? 0 : seen->second;
    const uint32_t same = mask == IN_CREATE   ? IN_CREATE | IN_MOVED_TO
                          : mask == IN_DELETE ? IN_DELETE | IN_MOVED_FROM
                                              : kChanged;
    if (told & same) return;
  }
  changes_.push_back({dir + "/" + entry.name, mask | (entry.is_dir ? IN_ISDIR : 0u), entry.ino,
                      entry.size, entry.mtime_ns});
}

const SnapshotListing& OfflineChanges::Directory(const std::string& path, SnapshotListing listing,
                                                 const LiveNames* live) {
  // The saved listing of this directory: at the same path when it is the
  // same directory (or the tree's root, whatever its inode), else where
  // the same inode was (it moved), else none.
  auto saved = saved_.find(path);
  if (saved != saved_.end() && saved->second.ino != listing.ino && path != tree_->root()) {
    saved = saved_.end();
  }
  if (saved == saved_.end() && !saved_.empty()) {
    if (!indexed_) {
      for (const auto& [dir, old] : saved_) saved_by_ino_.emplace(old.ino, dir);
      indexed_ = true;
    }
    const auto moved = saved_by_ino_.find(listing.ino);
    if (moved != saved_by_ino_.end()) saved = saved_.find(moved->second);
  }
  static const SnapshotListing kNothing;
  const SnapshotListing& was = saved == saved_.end() ? kNothing : saved->second;
  // Both sorted by name: one pass.
  auto a = was.entries.begin();
  auto b = listing.entries.begin();
  while (a != was.entries.end() || b != listing.entries.end()) {
    const int order = a == was.entries.end()       ? 1
                      : b == listing.entries.end() ? -1
                                                   : a->name.compare(b->name);
    if (order < 0) {
      Add(path, *a++, IN_DELETE, live);
    } else if (order > 0) {
      Add(path, *b++, IN_CREATE, live);
    } else if (a->ino != b->ino || a->is_dir != b->is_dir) {
      Add(path, *a++, IN_DELETE, live);
      Add(path, *b++, IN_CREATE, live);
    } else {
      // A directory's own times change with its entries, which are
      // compared in turn.
      if (!b->is_dir &&
          (a->size != b->size || a->mtime_ns != b->mtime_ns || a->ctime_ns != b->ctime_ns)) {
        Add(path, *b, kChanged, live);
      }
      ++a;
      ++b;
    }
  }
  if (saved != saved_.end()) saved_.erase(saved);
  SnapshotListing& kept = tree_->dirs()[path];
  kept = std::move(listing);
  return kept;
}

void OfflineChanges::Finish(EventSink& sink) {
  // Directories not met again went with their parents: all they held is
  // gone (their parents' comparison told of the directories themselves).
  for (const auto& [dir, listing] : saved_) {
    const LiveNames* live = live_ ? live_(dir) : nullptr;
    for (const SnapshotEntry& entry : listing.entries) Add(dir, entry, IN_DELETE, live);
  }
  saved_.clear();
  // An inode deleted at one path and created at another moved.
  std::unordered_map<uint64_t, size_t> deleted;
  for (size_t i = 0; i < changes_.size(); ++i) {
    if (changes_[i].mask & IN_DELETE) deleted.emplace(changes_[i].ino, i);
  }
  std::vector<size_t> partner(changes_.size(), SIZE_MAX);
  for (size_t i = 0; i < changes_.size() && !deleted.empty(); ++i) {
    if ((changes_[i].mask & IN_CREATE) == 0) continue;
    const auto from = deleted.find(changes_[i].ino);
    if (from == deleted.end() ||
        (changes_[from->second].mask & IN_ISDIR) != (changes_[i].mask & IN_ISDIR)) {
      continue;
    }
    partner[i] = from->second;
    partner[from->second] = i;
    deleted.erase(from);
  }
  for (size_t i = 0; i < changes_.size(); ++i) {
    const Change& change = changes_[i];
    const size_t j = partner[i];
    if (j == SIZE_MAX) {
      sink.Offline(change.path, change.mask);
      continue;
    }
    if (j < i) continue;  // told with its partner
    const Change& from = change.mask & IN_DELETE ? change : changes_[j];
    const Change& to = change.mask & IN_DELETE ? changes_[j] : change;
    const uint32_t dir = to.mask & IN_ISDIR;
    sink.Offline(from.path, IN_MOVED_FROM | dir);
    sink.Offline(to.path, IN_MOVED_TO | dir);
    if (!dir && (from.size != to.size || from.mtime_ns != to.mtime_ns)) {
      sink.Offline(to.path, kChanged);
    }
  }
  changes_.clear();
}

}  // namespace zorvnotifyd
