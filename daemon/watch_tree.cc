// Keeping the inotify watches of the configured trees.

#include "watch_tree.h"

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <poll.h>
#include <string.h>
#include <sys/inotify.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <iterator>
#include <utility>

#include "directory.h"
#include "offline_changes.h"
#include "text.h"
#include "tree_lister.h"

namespace zorvnotifyd {
namespace {

using zorvcommon::Quoted;

// Watched on every directory whatever the queues want: they tell the tree
// that directories came, went or moved, and why a watch ends.
constexpr uint32_t kTreeKeeping =
    IN_CREATE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE | IN_MOVE_SELF | IN_DELETE_SELF;

// The kinds that change what a directory's listing holds (names, inodes,
// sizes, times): an event of these marks its directory for the snapshot.
constexpr uint32_t kListingChanges =
    IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB;

// Buffers ReadEvents reads before its caller polls again.
constexpr int kReadsPerRound = 16;

// |path| and every path below it in |paths|, in order.
template <typename Map>
std::vector<std::pair<std::string, int>> Subtree(const Map& paths, const std::string& path) {
  std::vector<std::pair<std::string, int>> found;
  for (auto it = paths.lower_bound(path);
       it != paths.end() && it->first.compare(0, path.size(), path) == 0; ++it) {
    if (it->first.size() == path.size() || it->first[path.size()] == '/') found.push_back(*it);
  }
  return found;
}

std::string ParentOf(const std::string& path) { return path.substr(0, path.rfind('/')); }

}  // namespace

UniqueFd OpenInotify() {
  UniqueFd fd(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  if (fd.get() < 0 && errno == EMFILE) {
    syslog(LOG_ERR, "inotify instance limit reached (raise fs.inotify.max_user_instances)");
  } else if (fd.get() < 0) {
    syslog(LOG_ERR, "cannot open an inotify instance: %s", strerror(errno));
  }
  return fd;
}

WatchTree::WatchTree(UniqueFd inotify, double retry_seconds)
    : inotify_(std::move(inotify)),
      home_(open(".", O_PATH | O_DIRECTORY | O_CLOEXEC)),
      retry_seconds_(retry_seconds) {
  if (home_.get() < 0) home_ = UniqueFd(open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
}

WatchTree::~WatchTree() { Clear(); }

WatchTree::HomeAtReturn::~HomeAtReturn() {
  if (!tree_.away_) return;
  tree_.away_ = false;
  // Else a directory of a tree would stay busy (it could not be unmounted).
  if (fchdir(tree_.home_.get()) != 0) {
    syslog(LOG_ERR, "cannot return to the working directory: %s", strerror(errno));
  }
}

void WatchTree::Resync() {
  std::vector<std::string> roots(roots_.begin(), roots_.end());
  const WatchMasks masks = masks_;
  Sync(std::move(roots), masks);
}

void WatchTree::Sync(std::vector<std::string> roots, const WatchMasks& masks) {
  const HomeAtReturn home(*this);
  Relist();  // while the directories marked are still watched
  reloading_ = synced_;
  synced_ = true;
  roots_ = std::set<std::string, std::less<>>(std::make_move_iterator(roots.begin()),
                                              std::make_move_iterator(roots.end()));
  masks_ = masks;
  // Looked up once per directory walked, so hashed rather than ordered.
  // A first Sync (nothing watched before) visits just what by_path_ will
  // hold: it serves as the set of paths visited, with no copy of each.
  const bool first = by_path_.empty();
  std::unordered_set<int> synced(watches_.size());
  std::unordered_set<std::string> visited(by_path_.size());
  // In a first Sync, the roots met so far that hold the next one (they
  // sort before it): only a root inside another can have been walked.
  std::vector<const std::string*> enclosing;
  std::set<std::string> tops;
  std::map<std::string, std::string> was_missing = std::move(missing_);
  std::map<std::string, size_t> was_limited = std::move(limited_);
  missing_.clear();
  limited_.clear();
  for (const std::string& root : roots_) {
    // A root that was missing stays so until Tick finds it and reports
    // what it holds; one inside a tree walked already is watched.
    if (const auto known = was_missing.find(root); known != was_missing.end()) {
      missing_.insert(*known);
      continue;
    }
    if (first) {
      const auto below = [&root](const std::string& top) {
        return root.size() > top.size() && root.compare(0, top.size(), top) == 0 &&
               root[top.size()] == '/';
      };
      while (!enclosing.empty() && !below(*enclosing.back())) enclosing.pop_back();
      const bool inside = !enclosing.empty();
      enclosing.push_back(&root);
      if (inside && by_path_.count(root) != 0) continue;
    } else if (visited.count(root) != 0) {
      continue;
    }
    WalkContext context;
    context.synced = &synced;
    context.fresh = first;
    context.visited = first ? nullptr : &visited;
    std::string why;
    if (!WatchRootTree(root, context, &why, first || by_path_.count(root) == 0)) {
      NoteRootMissing(root, why);
      continue;
    }
    tops.insert(context.tops.begin(), context.tops.end());
    const auto before = was_limited.find(root);
    if (context.unwatched == 0) {
      if (before != was_limited.end()) {
        syslog(LOG_NOTICE, "all %zu directories of tree %s are watched now", context.dirs,
               Quoted(root).c_str());
      }
      continue;
    }
    limited_[root] = context.unwatched;
    if (before == was_limited.end() || before->second != context.unwatched) {
      syslog(LOG_ERR,
             "cannot watch %zu of %zu directories of tree %s: inotify watch limit reached "
             "(raise fs.inotify.max_user_watches); trying again every %g s",
             context.unwatched, context.dirs, Quoted(root).c_str(), retry_seconds_);
    }
  }
  // Paths not met in this round are no longer wanted, or no longer there;
  // a first round met every path it holds.
  std::vector<std::string> stale;
  if (!first) {
    for (const auto& [path, wd] : by_path_) {
      if (visited.count(path) == 0) stale.push_back(path);
    }
  }
  for (const std::string& path : stale) Unmap(path, true, nullptr);
  // Directories over the watch limit are rescanned when found so, and
  // again once watched: what happened meanwhile is unknown.
  if (sink_ != nullptr) {
    for (const std::string& top : unwatched_tops_) {
      if (tops.count(top) == 0) sink_->Rescan(top);
    }
  }
  std::set<std::string> told = std::move(unwatched_tops_);
  unwatched_tops_.clear();
  for (const std::string& top : tops) {
    if (told.count(top) != 0) unwatched_tops_.insert(top);
  }
  NoteUnwatched(std::vector<std::string>(tops.begin(), tops.end()));
  reloading_ = false;
  compare_later_ = false;
}

void WatchTree::NoteUnwatched(const std::vector<std::string>& tops) {
  for (const std::string& top : tops) {
    if (unwatched_tops_.insert(top).second && sink_ != nullptr) sink_->Rescan(top);
  }
}

void WatchTree::Tick(EventSink& sink) {
  const HomeAtReturn home(*this);
  for (const std::string& root : roots_) {
    struct stat st;
    const bool exists = stat(root.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
    const auto known = by_path_.find(root);
    if (known != by_path_.end()) {
      const Watch& watch = watches_.at(known->second);
      if (!exists || (watch.dev == st.st_dev && watch.ino == st.st_ino)) continue;
      // Another directory now answers to the path (a file system mounted
      // on it, or it was replaced while events were lost).
      syslog(LOG_NOTICE, "tree %s is another directory now: watching it afresh",
             Quoted(root).c_str());
      Drop(root, nullptr);
    }
    if (!exists) continue;  // logged as missing already, when it went
    WalkContext context;
    context.found = &sink;
    std::string why;
    if (!WatchRootTree(root, context, &why, true)) continue;
    if (context.unwatched != 0) limited_[root] += context.unwatched;
    NoteUnwatched(context.tops);
  }
  if (!limited_.empty()) Resync();
}

bool WatchTree::Fill(bool* failed) {
  alignas(struct inotify_event) char buffer[64 * 1024];
  ssize_t n;
  do {
    n = read(fd(), buffer, sizeof(buffer));
  } while (n < 0 && errno == EINTR);
  if (n < 0 && errno == EAGAIN) return false;
  if (n <= 0) {
    syslog(LOG_ERR, "reading inotify events failed: %s", strerror(errno));
    *failed = true;
    return false;
  }
  // Room left for the largest event: the kernel's queue was empty.
  drained_ = size_t(n) + sizeof(struct inotify_event) + NAME_MAX + 1 <= sizeof(buffer);
  for (const char* p = buffer; p < buffer + n;) {
    const auto* event = reinterpret_cast<const struct inotify_event*>(p);
    p += sizeof(struct inotify_event) + event->len;
    pending_.push_back(
        {event->wd, event->mask, event->cookie, event->len > 0 ? event->name : std::string()});
    if (reading_ahead_ && !pending_.back().name.empty()) {
      live_[event->wd][pending_.back().name] |= event->mask;
    }
  }
  return true;
}

bool WatchTree::ReadEvents(EventSink& sink) {
  const HomeAtReturn home(*this);
  bool failed = false;
  // At most kReadsPerRound buffers before the caller polls again, so that a
  // steady flood of events cannot keep it from stop signals and reloads.
  drained_ = false;
  for (int reads = 0; reads < kReadsPerRound; ++reads) {
    // A read after one that emptied the queue would only say EAGAIN: the
    // caller's poll tells when more come.
    if (pending_.empty() && (drained_ || !Fill(&failed))) break;
    RawEvent event;
    while (!pending_.empty()) {
      pending_.PopFront(&event);
      if ((event.mask & IN_Q_OVERFLOW) == 0) {
        Handle(event, sink);
        continue;
      }
      syslog(LOG_WARNING, "inotify event queue overflowed, events were lost: rescanning the trees");
      sink.Lost();
      Relist();
      // Deletions and moves may be among the lost events, so no watch is
      // trusted: all are dropped and the trees watched afresh.
      Clear();
      Resync();
    }
  }
  return !failed;
}

size_t WatchTree::Compare() {
  const std::vector<std::string> roots = std::move(to_compare_);
  to_compare_.clear();
  if (snapshot_ == nullptr || sink_ == nullptr) return 0;
  size_t compared = 0;
  reading_ahead_ = true;
  TreeLister lister;
  for (const std::string& root : roots) {
    // A tree gone or replaced since its walk is watched afresh by Tick,
    // which compares it then.
    const auto watched = by_path_.find(root);
    UniqueFd dir = OpenConfiguredDir(root);
    struct stat st;
    if (watched == by_path_.end() || dir.get() < 0 || fstat(dir.get(), &st) != 0 ||
        watches_.at(watched->second).dev != st.st_dev ||
        watches_.at(watched->second).ino != st.st_ino) {
      continue;
    }
    // Every event of a directory from before its listing is read before
    // the listing is compared; reading as the listing goes keeps the
    // kernel's queue from filling.  The saved view is loaded meanwhile
    // (nothing else touches the snapshot while the tree is listed).
    Snapshot::Known known;
    TreeSnapshot* saved = nullptr;
    ListedDir* top = lister.List(
        std::move(dir), [this] { ReadAhead(); },
        [this, &root, &known, &saved] { saved = snapshot_->Tree(root, &known); });
    ReadAhead();
    OfflineChanges changes(saved);
    // A directory not met again is known by the path it was watched at:
    // its events are not handled yet.
    changes.set_live([this](const std::string& path) -> const LiveNames* {
      const auto at = by_path_.find(path);
      const auto names = at == by_path_.end() ? live_.end() : live_.find(at->second);
      return names == live_.end() ? nullptr : &names->second;
    });
    if (top->listed) CompareListed(*top, root, changes);
    ++compared;
    if (known == Snapshot::Known::kSaved) {
      changes.Finish(*sink_);
    } else {
      sink_->Rescan(root);  // nothing saved of it: what happened before is unknown
    }
  }
  reading_ahead_ = false;
  live_.clear();
  // The events read ahead are told now, after the changes: the kernel's
  // queue may be empty, and polling it would not wake for them.
  if (!pending_.empty()) ReadEvents(*sink_);
  return compared;
}

void WatchTree::ReadAhead() {
  // As many as the kernel's own queue holds by default: under a flood the
  // rest stays in the kernel, and at worst a change is told twice.
  constexpr size_t kMaxAhead = 16384;
  bool failed = false;
  while (pending_.size() < kMaxAhead && Fill(&failed)) {
  }
}

void WatchTree::CompareListed(ListedDir& dir, const std::string& path, OfflineChanges& changes) {
  const auto watch = by_inode_.find({dir.dev, ino_t(dir.listing.ino)});
  const auto names = watch == by_inode_.end() ? live_.end() : live_.find(watch->second);
  const LiveNames* live = names == live_.end() ? nullptr : &names->second;
  // The listing moves into the snapshot; the subdirectories' nodes follow
  // its entries' order.
  const SnapshotListing& seen = changes.Directory(path, std::move(dir.listing), live);
  auto sub = dir.subdirs.begin();
  for (const SnapshotEntry& entry : seen.entries) {
    if (!entry.is_dir) continue;
    ListedDir& below = **sub++;
    // Made since its parent was watched: its event scans it.
    const auto told = live == nullptr ? LiveNames::const_iterator() : live->find(entry.name);
    if (live != nullptr && told != live->end() && (told->second & (IN_CREATE | IN_MOVED_TO)) &&
        by_inode_.count({dir.dev, ino_t(entry.ino)}) == 0) {
      continue;
    }
    if (below.listed) CompareListed(below, path + "/" + entry.name, changes);
  }
}

void WatchTree::Clear() {
  for (const auto& [wd, watch] : watches_) inotify_rm_watch(fd(), wd);
  watches_.clear();
  by_path_.clear();
  by_inode_.clear();
  pending_.clear();
  moves_.clear();
}

void WatchTree::Handle(const RawEvent& event, EventSink& sink) {
  const auto it = watches_.find(event.wd);
  if (it == watches_.end()) return;  // the last events of a watch removed earlier
  Watch& watch = it->second;
  if (event.mask & IN_IGNORED) {
    // The kernel ended the watch: the directory is gone or was unmounted.
    const char* why = watch.gone != nullptr ? watch.gone : "removed";
    for (const std::string& path :
         std::vector<std::string>(watch.paths.begin(), watch.paths.end())) {
      Drop(path, why);
    }
    return;
  }
  if (event.mask & IN_UNMOUNT) {
    watch.gone = "unmounted";
    return;
  }
  if (event.mask & IN_DELETE_SELF) watch.gone = "deleted";
  // Reporting changes no watch, so the paths are read in place and the
  // path of the entry is built in a buffer kept between events: a file's
  // event costs no allocation here.
  const bool relist = snapshot_ != nullptr && !event.name.empty() && (event.mask & kListingChanges);
  for (const std::string& path : watch.paths) {
    if (relist) snapshot_->MarkDirty(path);
    if (ToldByParent(path, event)) continue;
    if (event.name.empty()) {
      sink.Event(path, event.mask);
      continue;
    }
    entry_path_.assign(path).append(1, '/').append(event.name);
    sink.Event(entry_path_, event.mask);
  }
  const bool is_dir = (event.mask & IN_ISDIR) != 0;
  if (!is_dir && (event.mask & IN_MOVE_SELF) == 0) return;
  // What follows may change the paths: work on copies.
  const std::vector<std::string> paths(watch.paths.begin(), watch.paths.end());
  std::vector<std::string> targets;
  for (const std::string& path : paths) {
    targets.push_back(event.name.empty() ? path : path + "/" + event.name);
  }
  if (is_dir && (event.mask & IN_MOVED_FROM)) {
    // The other half of a move within the trees follows at once in the
    // queue; when it is not there, the directory left the trees.
    auto match = [&] {
      for (const RawEvent& next : pending_) {
        if ((next.mask & IN_MOVED_TO) && next.cookie == event.cookie) return &next;
      }
      return static_cast<const RawEvent*>(nullptr);
    };
    // The kernel queues the two halves within one rename: a half that is
    // not there yet comes within a moment.
    bool failed = false;
    const RawEvent* to = match();
    for (int tries = 0; to == nullptr && tries < 2 && !failed; ++tries) {
      struct pollfd ready = {fd(), POLLIN, 0};
      if (tries == 1) poll(&ready, 1, 1);
      if (Fill(&failed)) to = match();
    }
    const auto parent = to == nullptr ? watches_.end() : watches_.find(to->wd);
    if (parent == watches_.end()) {
      for (const std::string& target : targets) Drop(target, "moved away");
      return;
    }
    std::vector<std::string> destinations;
    for (const std::string& path : parent->second.paths)
      destinations.push_back(path + "/" + to->name);
    // A directory that was not watched (gone again before its watch was
    // made) is scanned where it arrives.
    if (Move(targets, destinations)) moves_.insert(event.cookie);
  } else if (is_dir && (event.mask & IN_DELETE)) {
    for (const std::string& target : targets) Drop(target, "deleted");
  } else if (is_dir && (event.mask & (IN_CREATE | IN_MOVED_TO))) {
    if ((event.mask & IN_MOVED_TO) && moves_.erase(event.cookie) != 0) return;  // moved within
    for (const std::string& target : targets) AddAndScan(target, sink);
  } else if (event.mask & IN_MOVE_SELF) {
    // A directory whose parent is watched moves with its parent's events;
    // one whose parent is not is a root that moved away.
    for (const std::string& path : paths) {
      if (by_path_.count(ParentOf(path)) == 0) Drop(path, "moved away");
    }
  }
}

bool WatchTree::ToldByParent(const std::string& path, const RawEvent& event) const {
  // The kernel tells a watched parent of what happens to its entries, and
  // a watched directory of what happens to itself: an event on a watched
  // directory comes twice when its parent's watch asks for that kind too.
  // The parent's copy is the one kept; the directory's own events on
  // itself alone (deleted, moved) are not in the parent's.
  const uint32_t kinds = event.mask & IN_ALL_EVENTS & ~(IN_DELETE_SELF | IN_MOVE_SELF);
  if (!event.name.empty() || kinds == 0) return false;
  const auto parent = by_path_.find(ParentOf(path));
  return parent != by_path_.end() && (watches_.at(parent->second).mask & kinds) == kinds;
}

uint32_t WatchTree::MaskFor(const std::string& dir) const {
  return masks_.For(dir) & IN_ALL_EVENTS;
}

std::string WatchTree::RootOf(const std::string& dir) const {
  size_t found = 0;
  ForEachLeadingPath(dir, [this, &found](std::string_view prefix) {
    if (roots_.find(prefix) != roots_.end()) found = prefix.size();
    return true;
  });
  return dir.substr(0, found);
}

bool WatchTree::WatchRootTree(const std::string& root, WalkContext& context, std::string* why,
                              bool compare) {
  UniqueFd dir = OpenConfiguredDir(root);
  if (dir.get() < 0) {
    *why = errno == ENOTDIR ? "not a directory" : strerror(errno);
    return false;
  }
  if (!compare || snapshot_ == nullptr || sink_ == nullptr) {
    Walk(dir.get(), root, context);
    return true;
  }
  if (compare_later_ && context.found == nullptr) {
    Walk(dir.get(), root, context);
    to_compare_.push_back(root);
    return true;
  }
  Snapshot::Known known;
  OfflineChanges changes(snapshot_->Tree(root, &known));
  EventSink* found = std::exchange(context.found, nullptr);
  context.compare = &changes;
  Walk(dir.get(), root, context);
  context.compare = nullptr;
  context.found = found;
  // Without a saved view, a flood of creations would tell no more than
  // one rescan of the tree, and could not tell what was deleted.
  if (known == Snapshot::Known::kSaved) {
    changes.Finish(*sink_);
    return true;
  }
  if (known == Snapshot::Known::kNone && context.found != nullptr) {
    // A tree that appears for the first time has no past: all it holds
    // is new, and found.
    for (const auto& [path, listing] : snapshot_->Loaded(root)->dirs()) {
      for (const SnapshotEntry& entry : listing.entries) {
        context.found->Found(path + "/" + entry.name, entry.is_dir);
      }
    }
    return true;
  }
  // A tree of a queue registered while the daemon runs starts from now,
  // as its queue does.
  if (known == Snapshot::Known::kNone && reloading_) return true;
  sink_->Rescan(root);
  return true;
}

void WatchTree::Walk(int dir, const std::string& path, WalkContext& context) {
  struct stat st;
  if (fstat(dir, &st) != 0) return;
  const std::pair<dev_t, ino_t> id(st.st_dev, st.st_ino);
  for (const auto& ancestor : context.ancestors) {
    if (ancestor == id) return;  // a bind mount of a directory inside itself
  }
  ++context.dirs;
  const size_t refused = context.unwatched;
  if (Add(dir, st, path, context) < 0 && context.unwatched == refused) return;
  const bool unwatched = context.unwatched != refused;
  if (unwatched && context.in_unwatched++ == 0) context.tops.push_back(path);
  context.ancestors.push_back(id);
  // Each level of a walk holds a descriptor: a tree deeper than the
  // descriptors left would otherwise lose its lower levels unsaid.
  auto descend = [&](const std::string& name, const std::string& child) {
    UniqueFd sub = OpenSubdir(dir, name);
    if (sub.get() >= 0) {
      Walk(sub.get(), child, context);
    } else if ((errno == EMFILE || errno == ENFILE) && !context.out_of_descriptors) {
      const int error = errno;
      context.out_of_descriptors = true;
      syslog(LOG_ERR,
             "cannot open %s to watch it and the directories below it: %s (a walk holds a "
             "descriptor per level; raise the descriptor limit or lower --max-clients)",
             Quoted(child).c_str(), strerror(error));
    }
  };
  if (context.compare != nullptr) {
    SnapshotListing listing;
    listing.ino = st.st_ino;
    ListWithStatus(dir, &listing);
    // Kept in the snapshot, whose nodes stay where they are while the
    // walk below adds others.
    const SnapshotListing& seen = context.compare->Directory(path, std::move(listing));
    for (const SnapshotEntry& entry : seen.entries) {
      if (entry.is_dir) descend(entry.name, path + "/" + entry.name);
    }
  } else {
    std::vector<DirEntry> entries = ListDir(dir);
    // In name order, as a comparison walks: the same directories are
    // watched first whichever walk meets them under the watch limit.
    if (context.found == nullptr) {
      std::sort(entries.begin(), entries.end(),
                [](const DirEntry& a, const DirEntry& b) { return a.name < b.name; });
    }
    for (const DirEntry& entry : entries) {
      const std::string child = path + "/" + entry.name;
      if (context.found != nullptr) context.found->Found(child, entry.is_dir);
      if (entry.is_dir) descend(entry.name, child);
    }
  }
  context.ancestors.pop_back();
  if (unwatched) --context.in_unwatched;
}

int WatchTree::Add(int dir, const struct stat& st, const std::string& path, WalkContext& context) {
  const uint32_t wanted = MaskFor(path);
  const std::pair<dev_t, ino_t> id(st.st_dev, st.st_ino);
  // In a Sync the first path of a directory sets its mask exactly, so kinds
  // no longer wanted go; every other path, and every later add, adds to it.
  const auto known = by_inode_.find(id);
  const bool exact =
      context.synced != nullptr &&
      (known == by_inode_.end() || (!context.fresh && context.synced->count(known->second) == 0));
  // The open directory itself, never a path that a link could redirect:
  // "." while it is the working directory.  (Naming it as /proc/self/fd/N
  // does the same, at the cost of a walk through /proc that was most of the
  // daemon's start-up time.)  The public calls go back home as they return.
  away_ = true;
  if (fchdir(dir) != 0) {
    syslog(LOG_WARNING, "cannot watch %s: %s", Quoted(path).c_str(), strerror(errno));
    return -1;
  }
  const int wd =
      inotify_add_watch(fd(), ".", wanted | kTreeKeeping | IN_ONLYDIR | (exact ? 0 : IN_MASK_ADD));
  if (wd < 0) {
    if (errno == ENOSPC) {
      ++context.unwatched;
    } else if (errno != ENOENT) {
      syslog(LOG_WARNING, "cannot watch %s: %s", Quoted(path).c_str(), strerror(errno));
    }
    return -1;
  }
  Watch& watch = watches_[wd];
  if (watch.dev != st.st_dev || watch.ino != st.st_ino) {
    // A descriptor the kernel handed out again: what it named is gone.
    for (const std::string& old :
         std::vector<std::string>(watch.paths.begin(), watch.paths.end())) {
      by_path_.erase(old);
    }
    by_inode_.erase({watch.dev, watch.ino});
    watch = Watch();
    watch.dev = st.st_dev;
    watch.ino = st.st_ino;
  }
  watch.mask = exact ? wanted : watch.mask | wanted;
  by_inode_[id] = wd;
  if (context.synced != nullptr && !context.fresh) context.synced->insert(wd);
  if (context.visited != nullptr) context.visited->insert(path);
  // A walk meets paths mostly in their order: each is tried at the end
  // first, which costs one comparison where a descent costs a dozen.
  const size_t paths = by_path_.size();
  const auto known_path = by_path_.try_emplace(by_path_.end(), path, wd);
  if (by_path_.size() == paths && known_path->second != wd) {
    Unmap(path, true, nullptr);  // replaced
    by_path_[path] = wd;
  }
  watch.paths.insert(path);
  if (!missing_.empty() && missing_.erase(path) != 0) {
    syslog(LOG_NOTICE, "watching tree %s again", Quoted(path).c_str());
  }
  return wd;
}

void WatchTree::AddAndScan(const std::string& path, EventSink& sink) {
  const std::string root = RootOf(path);
  if (root.empty()) return;
  UniqueFd dir = OpenBelow(root, path);
  if (dir.get() < 0) return;  // gone again, or a link put in its place
  WalkContext context;
  context.found = &sink;
  Walk(dir.get(), path, context);
  if (context.unwatched == 0) return;
  NoteUnwatched(context.tops);
  if (limited_.empty()) {
    syslog(LOG_ERR,
           "cannot watch %zu new directories at %s: inotify watch limit reached (raise "
           "fs.inotify.max_user_watches); trying again every %g s",
           context.unwatched, Quoted(path).c_str(), retry_seconds_);
  }
  limited_[root] += context.unwatched;
}

bool WatchTree::Move(const std::vector<std::string>& from, const std::vector<std::string>& to) {
  // What lies below the moved directory, relative to it, and its watch.
  std::set<std::pair<std::string, int>> below;
  std::set<int> moved;
  for (const std::string& path : from) {
    for (const auto& [old, wd] : Subtree(by_path_, path)) {
      below.insert({old.substr(path.size()), wd});
      moved.insert(wd);
      by_path_.erase(old);
      watches_.at(wd).paths.erase(old);
    }
  }
  for (const std::string& path : to) {
    for (const auto& [relative, wd] : below) {
      const std::string now = path + relative;
      const auto old = by_path_.find(now);
      if (old != by_path_.end() && old->second != wd) Unmap(now, true, nullptr);
      by_path_[now] = wd;
      watches_.at(wd).paths.insert(now);
    }
  }
  // The new place may want other kinds of events.
  for (int wd : moved) {
    Watch& watch = watches_.at(wd);
    if (watch.paths.empty()) {
      inotify_rm_watch(fd(), wd);
      by_inode_.erase({watch.dev, watch.ino});
      watches_.erase(wd);
      continue;
    }
    uint32_t wanted = 0;
    for (const std::string& path : watch.paths) wanted |= MaskFor(path);
    if (wanted == watch.mask) continue;
    const std::string& path = *watch.paths.begin();
    UniqueFd dir = OpenBelow(RootOf(path), path);
    struct stat st;
    if (dir.get() < 0 || fstat(dir.get(), &st) != 0 || st.st_dev != watch.dev ||
        st.st_ino != watch.ino) {
      continue;  // moved again since; its own events follow
    }
    WalkContext context;
    std::unordered_set<int> synced;
    context.synced = &synced;  // an exact mask
    Add(dir.get(), st, path, context);
  }
  return !moved.empty();
}

void WatchTree::Drop(const std::string& path, const char* why) {
  for (const auto& [gone, wd] : Subtree(by_path_, path)) Unmap(gone, true, why);
}

void WatchTree::Unmap(const std::string& path, bool release, const char* why) {
  const auto it = by_path_.find(path);
  if (it == by_path_.end()) return;
  const int wd = it->second;
  by_path_.erase(it);
  const auto watch = watches_.find(wd);
  if (watch != watches_.end()) {
    watch->second.paths.erase(path);
    if (watch->second.paths.empty()) {
      if (release) inotify_rm_watch(fd(), wd);
      by_inode_.erase({watch->second.dev, watch->second.ino});
      watches_.erase(watch);
    }
  }
  if (why != nullptr && roots_.count(path) != 0)
    NoteRootMissing(path, std::string("it was ") + why);
}

void WatchTree::NoteRootMissing(const std::string& path, const std::string& why) {
  if (!missing_.emplace(path, why).second) return;
  syslog(LOG_NOTICE, "not watching tree %s: %s; looking for it again every %g s",
         Quoted(path).c_str(), why.c_str(), retry_seconds_);
}

}  // namespace zorvnotifyd

namespace zorvnotifyd {

UniqueFd WatchTree::OpenThroughParent(const std::string& root, const std::string& path,
                                      ParentDir* parent) {
  const size_t slash = path.rfind('/');
  // A root is opened as configured (a link to it is followed), and its
  // parent is outside the tree.
  if (root.empty() || path.size() <= root.size() || slash < root.size()) {
    return OpenBelow(root, path);
  }
  if (parent->fd.get() < 0 || parent->path.size() != slash ||
      path.compare(0, slash, parent->path) != 0) {
    parent->path.assign(path, 0, slash);
    parent->fd = OpenBelow(root, parent->path);
  }
  if (parent->fd.get() < 0) return UniqueFd();
  return OpenSubdir(parent->fd.get(), path.substr(slash + 1));
}

bool WatchTree::ListWatched(const std::string& path, SnapshotListing* listing, ParentDir* parent) {
  const auto known = by_path_.find(path);
  if (known == by_path_.end()) return false;
  const Watch& watch = watches_.at(known->second);
  const UniqueFd dir = OpenThroughParent(RootOf(path), path, parent);
  struct stat st;
  if (dir.get() < 0 || fstat(dir.get(), &st) != 0 || st.st_dev != watch.dev ||
      st.st_ino != watch.ino) {
    return false;  // gone or replaced: its parent's listing tells
  }
  listing->ino = uint64_t(st.st_ino);
  return ListWithStatus(dir.get(), listing);
}

void WatchTree::SaveSnapshot() {
  if (snapshot_ != nullptr) snapshot_->Save();
}

bool WatchTree::Drain(EventSink& sink) {
  // Enough rounds for any burst the kernel's queue holds; a flood that
  // outlasts them leaves the saving of the snapshot to a later sync.
  constexpr int kMaxRounds = 64;
  for (int round = 0; round < kMaxRounds; ++round) {
    bool failed = false;
    if (pending_.empty() && !Fill(&failed)) return !failed;
    if (!ReadEvents(sink)) return false;
  }
  return false;
}

void WatchTree::Relist() {
  if (snapshot_ == nullptr) return;
  // A directory that left its parent's listing, and one that came, by
  // inode: one that moved takes the listings below it along; one that
  // left the trees loses them; one new to a tree is listed in turn.
  struct Place {
    TreeSnapshot* tree;
    std::string path;
  };
  std::vector<std::string> work = snapshot_->TakeDirty();
  ParentDir parent;  // the parent of the directory last listed
  while (!work.empty()) {
    std::unordered_map<uint64_t, Place> left;
    std::vector<std::pair<uint64_t, Place>> came;
    for (const std::string& path : work) {
      SnapshotListing listing;
      bool listed = false;
      // The trees holding |path| are those rooted at it or at an ancestor:
      // looked up one by one, not found by walking every tree.
      ForEachLeadingPath(path, [&](std::string_view root) {
        const auto found = snapshot_->trees().find(root);
        if (found == snapshot_->trees().end()) return true;
        const std::unique_ptr<TreeSnapshot>& tree = found->second;
        if (!listed && !(listed = ListWatched(path, &listing, &parent))) return false;
        auto& dirs = tree->dirs();
        const auto old = dirs.find(path);
        if (old != dirs.end()) {
          // Both sorted by name: directories that left, in one pass.
          auto b = listing.entries.begin();
          for (const SnapshotEntry& a : old->second.entries) {
            while (b != listing.entries.end() && b->name < a.name) ++b;
            const bool kept =
                b != listing.entries.end() && b->name == a.name && b->ino == a.ino && b->is_dir;
            if (a.is_dir && !kept) left[a.ino] = {tree.get(), path + "/" + a.name};
          }
        }
        for (const SnapshotEntry& entry : listing.entries) {
          if (!entry.is_dir) continue;
          const std::string child = path + "/" + entry.name;
          const auto known = dirs.find(child);
          if (known == dirs.end() || known->second.ino != entry.ino) {
            came.push_back({entry.ino, {tree.get(), child}});
          }
        }
        tree->Put(path, listing);
        return true;
      });
    }
    work.clear();
    // Forget what left first: a directory replaced under the same name
    // must not lose the listing made for its successor.
    std::vector<std::pair<Place, std::vector<std::pair<std::string, SnapshotListing>>>> moved;
    for (auto& [ino, from] : left) {
      std::vector<std::pair<std::string, SnapshotListing>> below;
      bool moves = false;
      for (const auto& [came_ino, to] : came) moves |= came_ino == ino && to.tree == from.tree;
      if (moves) {
        auto& dirs = from.tree->dirs();
        for (auto it = dirs.lower_bound(from.path);
             it != dirs.end() && it->first.compare(0, from.path.size(), from.path) == 0; ++it) {
          if (it->first.size() == from.path.size() || it->first[from.path.size()] == '/') {
            below.emplace_back(it->first.substr(from.path.size()), std::move(it->second));
          }
        }
      }
      from.tree->Forget(from.path);
      if (moves) moved.push_back({from, std::move(below)});
    }
    for (const auto& [ino, to] : came) {
      const auto from = left.find(ino);
      if (from == left.end() || from->second.tree != to.tree) {
        work.push_back(to.path);  // new to the tree: listed in the next round
        continue;
      }
      for (auto& [place, below] : moved) {
        if (place.path != from->second.path) continue;
        for (auto& [relative, listing] : below)
          to.tree->Put(to.path + relative, std::move(listing));
        below.clear();
      }
    }
  }
}

}  // namespace zorvnotifyd
