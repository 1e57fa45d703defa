// Keeping the inotify watches of the configured trees.

#include "watch_tree.h"

#include <dirent.h>
#include <errno.h>
#include <string.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <syslog.h>

#include <algorithm>
#include <memory>

namespace zorvnotifyd {
namespace {

// Watched on every directory whatever the queues want: they tell the tree
// that entries came or went, and the scan bookkeeping needs the deletions.
constexpr uint32_t kTreeKeeping =
    IN_CREATE | IN_MOVED_TO | IN_MOVED_FROM | IN_DELETE | IN_MOVE_SELF;

struct DirEntry {
  std::string name;
  bool is_dir;  // a directory itself, not a link to one
};

// The entries of |dir| but "." and "..", sorted by name.  Empty when |dir|
// cannot be read.
std::vector<DirEntry> ListDir(const std::string& dir) {
  std::vector<DirEntry> entries;
  std::unique_ptr<DIR, int (*)(DIR*)> handle(opendir(dir.c_str()), closedir);
  if (!handle) return entries;
  while (const struct dirent* entry = readdir(handle.get())) {
    const std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    bool is_dir = entry->d_type == DT_DIR;
    if (entry->d_type == DT_UNKNOWN) {
      struct stat st;
      is_dir = lstat((dir + "/" + name).c_str(), &st) == 0 && S_ISDIR(st.st_mode);
    }
    entries.push_back({name, is_dir});
  }
  std::sort(entries.begin(), entries.end(),
            [](const DirEntry& a, const DirEntry& b) { return a.name < b.name; });
  return entries;
}

// Adds |dir| and every directory below it (links not followed) to |dirs|.
void CollectDirs(const std::string& dir, std::set<std::string>* dirs) {
  if (!dirs->insert(dir).second) return;
  for (const DirEntry& entry : ListDir(dir)) {
    if (entry.is_dir) CollectDirs(dir + "/" + entry.name, dirs);
  }
}

// Buffers ReadEvents reads before its caller polls again.
constexpr int kReadsPerRound = 16;

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

WatchTree::WatchTree(UniqueFd inotify) : inotify_(std::move(inotify)) {}

WatchTree::~WatchTree() { Clear(); }

bool WatchTree::Sync(const std::vector<WatchRoot>& roots) {
  roots_ = roots;
  limit_hit_ = false;
  std::set<std::string> dirs, skipped;
  for (const WatchRoot& root : roots_) {
    // A queue's mask may hold any bits; only inotify's event kinds are
    // asked of the kernel (IN_ONESHOT, IN_MASK_CREATE and the like would
    // break the watch for every queue on the tree).
    if ((root.mask & IN_ALL_EVENTS) == 0 || dirs.count(root.path) != 0 ||
        skipped.count(root.path) != 0) {
      continue;
    }
    struct stat st;
    const char* why = nullptr;
    if (root.path.empty() || root.path[0] != '/') {
      why = "not an absolute path";
    } else if (stat(root.path.c_str(), &st) != 0) {
      why = strerror(errno);
    } else if (!S_ISDIR(st.st_mode)) {
      why = "not a directory";
    }
    if (why == nullptr) {
      CollectDirs(root.path, &dirs);
    } else if (skipped.insert(root.path).second && skipped_.count(root.path) == 0) {
      syslog(LOG_NOTICE, "not watching \"%s\": %s", root.path.c_str(), why);
    }
  }
  skipped_ = skipped;  // each skipped root is logged once while it stays skipped
  std::vector<int> unwanted;
  for (const auto& [wd, watch] : watches_) {
    if (dirs.count(watch.path) == 0) unwanted.push_back(wd);
  }
  for (int wd : unwanted) Remove(wd, true);
  for (const std::string& dir : dirs) {
    const uint32_t mask = MaskFor(dir);
    const auto known = by_path_.find(dir);
    if (known != by_path_.end() && watches_.at(known->second).mask == mask) continue;
    if (Add(dir, mask) < 0 && limit_hit_) return false;
  }
  return true;
}

bool WatchTree::ReadEvents(const EventSink& sink) {
  alignas(struct inotify_event) char buffer[64 * 1024];
  bool overflow = false;
  // At most kReadsPerRound buffers before the caller polls again, so that a
  // steady flood of events cannot keep it from stop signals and reloads.
  for (int reads = 0; reads < kReadsPerRound; ++reads) {
    const ssize_t n = read(fd(), buffer, sizeof(buffer));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && errno == EAGAIN) {
      // Every event caused while a new directory was scanned was queued
      // before the scan ended, so it has been read by now: the names the
      // scan handed on must not swallow later events.
      if (scanned_any_) {
        for (auto& [wd, watch] : watches_) watch.scanned.clear();
        scanned_any_ = false;
      }
      break;
    }
    if (n <= 0) {
      syslog(LOG_ERR, "reading inotify events failed: %s", strerror(errno));
      return false;
    }
    for (const char* p = buffer; p < buffer + n;) {
      const auto* event = reinterpret_cast<const struct inotify_event*>(p);
      p += sizeof(struct inotify_event) + event->len;
      if (event->mask & IN_Q_OVERFLOW) {
        overflow = true;
      } else {
        Handle(*event, sink);
      }
    }
  }
  if (overflow) {
    syslog(LOG_WARNING, "inotify event queue overflowed, events were lost: rescanning the trees");
    // Deletions may be among the lost events, so no watch is trusted: all
    // are dropped and the trees watched afresh.
    const std::vector<WatchRoot> roots = roots_;
    Clear();
    Sync(roots);
  }
  return true;
}

void WatchTree::Clear() {
  for (const auto& [wd, watch] : watches_) inotify_rm_watch(fd(), wd);
  watches_.clear();
  by_path_.clear();
}

void WatchTree::Handle(const struct inotify_event& event, const EventSink& sink) {
  const auto it = watches_.find(event.wd);
  if (it == watches_.end()) return;  // the last events of a watch removed earlier
  if (event.mask & IN_IGNORED) {
    Remove(event.wd, false);
    return;
  }
  const std::string name = event.len > 0 ? event.name : "";
  const std::string path = name.empty() ? it->second.path : it->second.path + "/" + name;
  const bool arrived = (event.mask & (IN_CREATE | IN_MOVED_TO)) != 0;
  const bool left = (event.mask & (IN_DELETE | IN_MOVED_FROM)) != 0;
  if (!name.empty() && arrived && it->second.scanned.erase(name) != 0) return;  // scanned
  if (!name.empty() && left) it->second.scanned.erase(name);
  if ((event.mask & IN_ISDIR) && arrived) {
    std::vector<std::pair<std::string, uint32_t>> found;
    AddAndScan(path, &found);
    sink(path, event.mask);
    for (const auto& [found_path, found_mask] : found) sink(found_path, found_mask);
    return;
  }
  sink(path, event.mask);
  if (((event.mask & IN_ISDIR) && left) || (event.mask & IN_MOVE_SELF)) Drop(path);
}

uint32_t WatchTree::MaskFor(const std::string& dir) const {
  uint32_t mask = 0;
  for (const WatchRoot& root : roots_) {
    const size_t n = root.path.size();
    if (dir.compare(0, n, root.path) == 0 && (dir.size() == n || dir[n] == '/')) {
      mask |= root.mask & IN_ALL_EVENTS;
    }
  }
  return mask;
}

int WatchTree::Add(const std::string& dir, uint32_t mask) {
  const int wd = inotify_add_watch(fd(), dir.c_str(), mask | kTreeKeeping | IN_ONLYDIR);
  if (wd < 0) {
    if (errno == ENOSPC && !limit_hit_) {
      syslog(LOG_ERR,
             "cannot watch %s: inotify watch limit reached (raise fs.inotify.max_user_watches)",
             dir.c_str());
    } else if (errno != ENOSPC && errno != ENOENT && errno != ENOTDIR) {
      syslog(LOG_WARNING, "cannot watch %s: %s", dir.c_str(), strerror(errno));
    }
    limit_hit_ = limit_hit_ || errno == ENOSPC;
    return -1;
  }
  const auto old = by_path_.find(dir);
  if (old != by_path_.end() && old->second != wd) Remove(old->second, true);  // another inode now
  Watch& watch = watches_[wd];
  if (!watch.path.empty() && watch.path != dir) by_path_.erase(watch.path);  // one inode, two paths
  watch.path = dir;
  watch.mask = mask;
  by_path_[dir] = wd;
  return wd;
}

void WatchTree::AddAndScan(const std::string& dir,
                           std::vector<std::pair<std::string, uint32_t>>* found) {
  const uint32_t mask = MaskFor(dir);
  const int wd = mask == 0 ? -1 : Add(dir, mask);
  if (wd < 0) return;
  for (const DirEntry& entry : ListDir(dir)) {
    const auto watch = watches_.find(wd);
    if (watch == watches_.end()) return;
    watch->second.scanned.insert(entry.name);
    scanned_any_ = true;
    const std::string child = dir + "/" + entry.name;
    found->emplace_back(child, entry.is_dir ? IN_CREATE | IN_ISDIR : IN_CREATE);
    if (entry.is_dir) AddAndScan(child, found);
  }
}

void WatchTree::Drop(const std::string& dir) {
  std::vector<int> gone;
  for (auto it = by_path_.lower_bound(dir);
       it != by_path_.end() && it->first.compare(0, dir.size(), dir) == 0; ++it) {
    if (it->first.size() == dir.size() || it->first[dir.size()] == '/') gone.push_back(it->second);
  }
  for (int wd : gone) Remove(wd, true);
}

void WatchTree::Remove(int wd, bool release) {
  const auto it = watches_.find(wd);
  if (it == watches_.end()) return;
  if (release) inotify_rm_watch(fd(), wd);
  const auto path = by_path_.find(it->second.path);
  if (path != by_path_.end() && path->second == wd) by_path_.erase(path);
  watches_.erase(it);
}

}  // namespace zorvnotifyd
