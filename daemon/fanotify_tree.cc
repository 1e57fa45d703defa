// Serving trees with fanotify file-system marks.

#include "fanotify_tree.h"

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <string.h>
#include <sys/fanotify.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdio>
#include <utility>

#include "directory.h"
#include "offline_changes.h"
#include "text.h"

// Older C libraries' headers lack these; the kernel says EINVAL when it
// lacks them.
#ifndef FAN_RENAME
#define FAN_RENAME 0x10000000
#endif
#ifndef FAN_REPORT_TARGET_FID
#define FAN_REPORT_TARGET_FID 0x00001000
#endif
#ifndef FAN_EVENT_INFO_TYPE_OLD_DFID_NAME
#define FAN_EVENT_INFO_TYPE_OLD_DFID_NAME 10
#endif
#ifndef FAN_EVENT_INFO_TYPE_NEW_DFID_NAME
#define FAN_EVENT_INFO_TYPE_NEW_DFID_NAME 12
#endif

namespace zorvnotifyd {
namespace {

using zorvcommon::Quoted;

// The kinds both interfaces share, with the same bits.
constexpr uint32_t kKinds =
    IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO | IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB;
static_assert(FAN_CREATE == IN_CREATE && FAN_DELETE == IN_DELETE &&
                  FAN_MOVED_FROM == IN_MOVED_FROM && FAN_MOVED_TO == IN_MOVED_TO &&
                  FAN_MODIFY == IN_MODIFY && FAN_CLOSE_WRITE == IN_CLOSE_WRITE &&
                  FAN_ATTRIB == IN_ATTRIB && FAN_ONDIR == IN_ISDIR,
              "fanotify and inotify share their event bits");

// The order inotify reports the kinds of one entry in, for an event whose
// kinds the kernel merged.
constexpr uint32_t kOrder[] = {IN_CREATE,      IN_MOVED_TO,   IN_MODIFY, IN_ATTRIB,
                               IN_CLOSE_WRITE, IN_MOVED_FROM, IN_DELETE};

// The kinds that change what a directory's listing holds.
constexpr uint32_t kListingChanges = kKinds;

// Buffers ReadEvents reads before its caller polls again.
constexpr int kReadsPerRound = 16;

// Handles of directories found outside the trees, remembered so that
// their events cost one lookup; forgotten all at once past this many.
constexpr size_t kMaxOutside = 1 << 16;

// Directories compared per WalkPending call.
constexpr int kWalkShare = 100;

// The largest handle the kernel hands out (MAX_HANDLE_SZ).
constexpr unsigned kMaxHandle = 128;

// A file handle with room for any.
struct HandleBuffer {
  alignas(struct file_handle) unsigned char bytes[sizeof(struct file_handle) + kMaxHandle];
  struct file_handle* get() {
    return reinterpret_cast<struct file_handle*>(bytes);
  }
};

// True when |path| is |prefix| or lies below it.
bool Under(const std::string& path, const std::string& prefix) {
  if (prefix == "/") return !path.empty() && path[0] == '/';
  return path.compare(0, prefix.size(), prefix) == 0 &&
         (path.size() == prefix.size() || path[prefix.size()] == '/');
}

// |base| with |relative| (empty or starting with "/") appended.
std::string Join(const std::string& base, const std::string& relative) {
  if (base == "/") return relative.empty() ? base : relative;
  return base + relative;
}

// The path the kernel names the open |fd| by; empty when it has none that
// fits (or the object was deleted).
std::string FdPath(int fd) {
  char proc[40];
  snprintf(proc, sizeof(proc), "/proc/self/fd/%d", fd);
  char buffer[PATH_MAX];
  const ssize_t n = readlink(proc, buffer, sizeof(buffer));
  if (n <= 0 || size_t(n) >= sizeof(buffer) || buffer[0] != '/') return std::string();
  return std::string(buffer, size_t(n));
}

// The 8 bytes of the id of the file system of |fd|; empty when none.
std::string FsidOf(int fd) {
  struct statfs st;
  if (fstatfs(fd, &st) != 0) return std::string();
  std::string fsid(reinterpret_cast<const char*>(&st.f_fsid), sizeof(st.f_fsid));
  return fsid == std::string(sizeof(st.f_fsid), '\0') ? std::string() : fsid;
}

// Appends the handle part of a cache key for |handle| to |key|.
void AppendHandle(std::string* key, const struct file_handle* handle) {
  key->append(reinterpret_cast<const char*>(&handle->handle_type), sizeof(handle->handle_type));
  key->append(reinterpret_cast<const char*>(handle->f_handle), handle->handle_bytes);
}

// The cache key of the open directory |dir| on file system |fsid|; empty
// when it has no handle.
std::string KeyOf(int dir, const char* name, int flags, const std::string& fsid) {
  HandleBuffer buffer;
  buffer.get()->handle_bytes = kMaxHandle;
  int mount_id = 0;
  if (name_to_handle_at(dir, name, buffer.get(), &mount_id, flags) != 0) return std::string();
  std::string key = fsid;
  AppendHandle(&key, buffer.get());
  return key;
}

}  // namespace

bool FanotifySupports(int dir, std::string* why) {
  HandleBuffer buffer;
  buffer.get()->handle_bytes = kMaxHandle;
  int mount_id = 0;
  if (name_to_handle_at(dir, "", buffer.get(), &mount_id, AT_EMPTY_PATH) != 0) {
    *why = errno == EOPNOTSUPP ? "its file system gives no file handles"
                               : std::string("no file handle: ") + strerror(errno);
    return false;
  }
  if (FsidOf(dir).empty()) {
    *why = "its file system has no file-system id";
    return false;
  }
  return true;
}

bool FanotifyTree::Open(std::string* why) {
  if (opened_) {
    *why = open_error_;
    return fanotify_.get() >= 0;
  }
  opened_ = true;
  constexpr unsigned kFlags = FAN_CLASS_NOTIF | FAN_REPORT_DFID_NAME | FAN_NONBLOCK | FAN_CLOEXEC;
  // Since Linux 5.17 a move comes as one event, and an entry's own handle
  // with it; 5.9 to 5.16 give the two halves apart.
  fanotify_ = UniqueFd(fanotify_init(kFlags | FAN_REPORT_FID | FAN_REPORT_TARGET_FID,
                                     O_RDONLY | O_LARGEFILE | O_CLOEXEC));
  renames_ = targets_ = fanotify_.get() >= 0;
  if (fanotify_.get() < 0 && errno == EINVAL) {
    fanotify_ = UniqueFd(fanotify_init(kFlags, O_RDONLY | O_LARGEFILE | O_CLOEXEC));
  }
  if (fanotify_.get() >= 0) return true;
  open_error_ = errno == EPERM    ? "the daemon lacks CAP_SYS_ADMIN"
                : errno == ENOSYS ? "the kernel has no fanotify"
                : errno == EINVAL ? "the kernel is older than Linux 5.9"
                : errno == EMFILE ? "the fanotify group limit is reached"
                                  : std::string("fanotify_init: ") + strerror(errno);
  *why = open_error_;
  return false;
}

bool FanotifyTree::Mark(int dir, const std::string& fsid, std::string* why) {
  if (marked_.count(fsid) != 0) return true;
  if (fanotify_mark(fd(), FAN_MARK_ADD | FAN_MARK_FILESYSTEM, mask_, dir, nullptr) != 0) {
    *why = errno == EPERM        ? "the daemon lacks CAP_SYS_ADMIN"
           : errno == EOPNOTSUPP ? "its file system gives no file handles"
           : errno == EXDEV      ? "its file system's id differs from its volume's"
           : errno == ENOSPC     ? "the fanotify mark limit is reached"
                                 : std::string("fanotify_mark: ") + strerror(errno);
    return false;
  }
  return true;
}

bool FanotifyTree::Attach(Root& root, int dir, std::string* why) {
  struct stat st;
  if (fstat(dir, &st) != 0) {
    *why = strerror(errno);
    return false;
  }
  if (!FanotifySupports(dir, why)) return false;
  const std::string fsid = FsidOf(dir);
  const std::string real = FdPath(dir);
  const std::string key = KeyOf(dir, "", AT_EMPTY_PATH, fsid);
  if (real.empty() || key.empty()) {
    *why = "it has no path the kernel can name";
    return false;
  }
  if (!Mark(dir, fsid, why)) return false;
  marked_.emplace(fsid, root.path);
  if (root.present) Forget(root.real);
  root.real = real;
  root.fsid = fsid;
  root.dev = st.st_dev;
  root.ino = st.st_ino;
  root.present = true;
  // The directory holding it tells when it goes or comes back: "..", not
  // a path that could lead elsewhere by now.
  root.parent_key.clear();
  if (real != "/") {
    root.name = real.substr(real.rfind('/') + 1);
    const UniqueFd up(openat(dir, "..", O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (up.get() >= 0) {
      struct statfs fs;
      if (fstatfs(up.get(), &fs) == 0) {
        root.parent_key =
            KeyOf(up.get(), "", AT_EMPTY_PATH,
                  std::string(reinterpret_cast<const char*>(&fs.f_fsid), sizeof(fs.f_fsid)));
      }
    }
  }
  Cache(key, real);
  // Directories found outside while it was away may lie in it now.
  outside_.clear();
  if (missing_.erase(root.path) != 0) {
    syslog(LOG_NOTICE, "watching tree %s again", Quoted(root.path).c_str());
  }
  return true;
}

std::vector<std::string> FanotifyTree::Sync(const std::vector<std::string>& roots,
                                            const WatchMasks& masks,
                                            std::map<std::string, std::string>* refused) {
  Relist();  // while the cache still names the directories marked
  reloading_ = synced_;
  synced_ = true;
  // Every mark asks for the kinds some queue wants, and those that keep
  // the cache: file writes on a whole file system cost only when wanted.
  uint32_t wanted = 0;
  for (const std::string& root : roots) wanted |= masks.For(root);
  uint64_t mask = FAN_CREATE | FAN_DELETE | FAN_ONDIR |
                  (renames_ ? FAN_RENAME : FAN_MOVED_FROM | FAN_MOVED_TO) |
                  (wanted & (IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB));
  if (mask != mask_ && !marked_.empty()) {
    // Kinds added before kinds removed: no moment without a wanted one.
    for (const auto& [fsid, path] : marked_) {
      const UniqueFd dir = OpenConfiguredDir(path);
      if (dir.get() < 0 || FsidOf(dir.get()) != fsid) continue;
      fanotify_mark(fd(), FAN_MARK_ADD | FAN_MARK_FILESYSTEM, mask, dir.get(), nullptr);
      if (mask_ & ~mask) {
        fanotify_mark(fd(), FAN_MARK_REMOVE | FAN_MARK_FILESYSTEM, mask_ & ~mask, dir.get(),
                      nullptr);
      }
    }
  }
  mask_ = mask;
  std::vector<Root> kept;
  std::vector<std::string> served;
  for (const std::string& path : roots) {
    Root root;
    root.path = path;
    for (Root& old : roots_) {
      if (old.path == path) root = std::move(old);
    }
    if (root.present || missing_.count(path) != 0) {
      kept.push_back(std::move(root));
      served.push_back(path);
      continue;
    }
    const UniqueFd dir = OpenConfiguredDir(path);
    std::string why;
    if (dir.get() < 0) {
      why = errno == ENOTDIR ? "not a directory" : strerror(errno);
      NoteMissing(path, why);
    } else if (!Attach(root, dir.get(), &why)) {
      (*refused)[path] = why;
      continue;
    } else {
      to_walk_.push_back({path, reloading_ ? Walk::kReload : Walk::kStart});
    }
    kept.push_back(std::move(root));
    served.push_back(path);
  }
  roots_ = std::move(kept);
  for (auto it = missing_.begin(); it != missing_.end();) {
    bool configured = false;
    for (const Root& root : roots_) configured |= root.path == it->first;
    it = configured ? std::next(it) : missing_.erase(it);
  }
  // Directories no tree holds any more, and marks no tree needs.
  for (auto it = by_real_.begin(); it != by_real_.end();) {
    bool held = false;
    for (const Root& root : roots_) held |= root.present && Under(it->first, root.real);
    if (held) {
      ++it;
      continue;
    }
    by_key_.erase(it->second);
    it = by_real_.erase(it);
  }
  for (auto it = marked_.begin(); it != marked_.end();) {
    bool needed = false;
    for (const Root& root : roots_) needed |= root.present && root.fsid == it->first;
    if (needed) {
      ++it;
      continue;
    }
    const UniqueFd dir = OpenConfiguredDir(it->second);
    if (dir.get() >= 0 && FsidOf(dir.get()) == it->first) {
      fanotify_mark(fd(), FAN_MARK_REMOVE | FAN_MARK_FILESYSTEM, mask_, dir.get(), nullptr);
    }  // else its events are dropped by their file-system id
    it = marked_.erase(it);
  }
  return served;
}

void FanotifyTree::NoteMissing(const std::string& path, const std::string& why) {
  if (!missing_.emplace(path, why).second) return;
  syslog(LOG_NOTICE, "not watching tree %s: %s; looking for it again every %g s",
         Quoted(path).c_str(), why.c_str(), retry_seconds_);
}

void FanotifyTree::Tick() {
  for (Root& root : roots_) {
    struct stat st;
    const bool exists = stat(root.path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
    if (root.present) {
      if (exists && st.st_dev == root.dev && st.st_ino == root.ino) continue;
      Forget(root.real);
      root.present = false;
      if (!exists) {
        NoteMissing(root.path, "it was deleted or moved away");
        continue;
      }
      syslog(LOG_NOTICE, "tree %s is another directory now: watching it afresh",
             Quoted(root.path).c_str());
    }
    if (!exists) continue;
    const UniqueFd dir = OpenConfiguredDir(root.path);
    std::string why;
    if (dir.get() < 0 || !Attach(root, dir.get(), &why)) {
      if (dir.get() >= 0) NoteMissing(root.path, why);
      continue;
    }
    to_walk_.push_back({root.path, Walk::kAppeared});
  }
}

void FanotifyTree::Cache(const std::string& key, const std::string& real) {
  const auto old = by_real_.find(real);
  if (old != by_real_.end() && old->second != key) by_key_.erase(old->second);
  const auto known = by_key_.find(key);
  if (known != by_key_.end() && known->second != real) by_real_.erase(known->second);
  by_key_[key] = real;
  by_real_[real] = key;
}

void FanotifyTree::Forget(const std::string& real) {
  auto it = by_real_.lower_bound(real);
  while (it != by_real_.end() && it->first.compare(0, real.size(), real) == 0) {
    if (it->first.size() != real.size() && it->first[real.size()] != '/' && real != "/") {
      ++it;
      continue;
    }
    by_key_.erase(it->second);
    it = by_real_.erase(it);
  }
}

void FanotifyTree::Move(const std::string& from, const std::string& to) {
  std::vector<std::pair<std::string, std::string>> below;
  for (auto it = by_real_.lower_bound(from);
       it != by_real_.end() && it->first.compare(0, from.size(), from) == 0;) {
    if (it->first.size() != from.size() && it->first[from.size()] != '/') {
      ++it;
      continue;
    }
    below.emplace_back(to + it->first.substr(from.size()), it->second);
    by_key_.erase(it->second);
    it = by_real_.erase(it);
  }
  for (const auto& [real, key] : below) Cache(key, real);
}

void FanotifyTree::Clear() {
  unscanned_.clear();
  by_key_.clear();
  by_real_.clear();
  outside_.clear();
  mount_fds_.clear();
}

int FanotifyTree::MountFd(const Root& root) {
  auto it = mount_fds_.find(root.path);
  if (it == mount_fds_.end())
    it = mount_fds_.emplace(root.path, OpenConfiguredDir(root.path)).first;
  return it->second.get();
}

const std::string* FanotifyTree::Resolve(const Fid& fid) {
  key_.assign(fid.fsid, 8);
  AppendHandle(&key_, fid.handle);
  const auto known = by_key_.find(key_);
  if (known != by_key_.end()) return &known->second;
  if (outside_.count(key_) != 0) return nullptr;
  // A directory not met yet: the kernel names it through a mount of its
  // file system (never through a link).
  for (const Root& root : roots_) {
    if (!root.present || root.fsid.compare(0, 8, fid.fsid, 8) != 0) continue;
    const int mount = MountFd(root);
    if (mount < 0) continue;
    const UniqueFd dir(
        open_by_handle_at(mount, const_cast<struct file_handle*>(fid.handle), O_PATH | O_CLOEXEC));
    struct stat st;
    if (dir.get() < 0 || fstat(dir.get(), &st) != 0 || st.st_nlink == 0) break;  // gone
    const std::string real = FdPath(dir.get());
    for (const Root& tree : roots_) {
      if (tree.present && tree.fsid == root.fsid && Under(real, tree.real)) {
        Cache(key_, real);
        return &by_key_.find(key_)->second;
      }
    }
    break;
  }
  if (outside_.size() >= kMaxOutside) outside_.clear();
  outside_.insert(key_);
  return nullptr;
}

void FanotifyTree::Configured(const std::string& real, const char* name) {
  paths_.clear();
  for (const Root& root : roots_) {
    if (!root.present || !Under(real, root.real)) continue;
    std::string path = Join(
        root.path, root.real == "/" ? (real == "/" ? "" : real) : real.substr(root.real.size()));
    if (name != nullptr) path.append(path == "/" ? "" : "/").append(name);
    bool seen = false;
    for (const std::string& other : paths_) seen |= other == path;
    if (!seen) paths_.push_back(std::move(path));
  }
}

void FanotifyTree::Emit(uint32_t mask, EventSink& sink) {
  const uint32_t is_dir = mask & IN_ISDIR;
  for (uint32_t kind : kOrder) {
    if ((mask & kind) == 0) continue;
    for (const std::string& path : paths_) sink.Event(path, kind | is_dir);
  }
}

bool FanotifyTree::RootEvent(const std::string& key, const char* name, uint32_t mask) {
  bool found = false;
  for (Root& root : roots_) {
    if (root.parent_key.empty() || root.parent_key != key || root.name != name) continue;
    found = true;
    if ((mask & (IN_DELETE | IN_MOVED_FROM)) && root.present) {
      Forget(root.real);
      root.present = false;
      NoteMissing(root.path, mask & IN_DELETE ? "it was deleted" : "it was moved away");
    }
    if ((mask & (IN_CREATE | IN_MOVED_TO)) && !root.present) {
      const UniqueFd dir = OpenConfiguredDir(root.path);
      std::string why;
      if (dir.get() < 0 || !Attach(root, dir.get(), &why)) continue;  // Tick tries again
      // One made afresh is empty: what comes into it comes as events.
      if (mask & IN_MOVED_TO) {
        to_walk_.push_back({root.path, Walk::kAppeared});
      } else if (snapshot_ != nullptr) {
        snapshot_->MarkDirty(root.path);
      }
    }
  }
  return found;
}

void FanotifyTree::Scan(const std::string& path, int dir, EventSink& sink,
                        std::vector<std::pair<dev_t, ino_t>>& ancestors) {
  struct stat st;
  if (fstat(dir, &st) != 0) return;
  for (const auto& ancestor : ancestors) {
    if (ancestor == std::make_pair(st.st_dev, st.st_ino)) return;
  }
  ancestors.emplace_back(st.st_dev, st.st_ino);
  for (const DirEntry& entry : ListDir(dir)) {
    const std::string child = path + "/" + entry.name;
    sink.Found(child, entry.is_dir);
    if (!entry.is_dir) continue;
    const UniqueFd sub = OpenSubdir(dir, entry.name);
    if (sub.get() >= 0) Scan(child, sub.get(), sink, ancestors);
  }
  ancestors.pop_back();
}

bool FanotifyTree::Arrived(const std::vector<std::string>& paths, EventSink& sink) {
  bool scanned = false;
  for (const std::string& path : paths) {
    std::string root;
    for (const Root& r : roots_) {
      if (r.present && Under(path, r.path) && r.path.size() > root.size()) root = r.path;
    }
    if (root.empty()) continue;
    const UniqueFd moved = OpenBelow(root, path);
    if (moved.get() < 0) continue;
    std::vector<std::pair<dev_t, ino_t>> ancestors;
    Scan(path, moved.get(), sink, ancestors);
    scanned = true;
  }
  if (unscanned_.size() > kMaxOutside) unscanned_.clear();
  return scanned;
}

void FanotifyTree::Handle(uint32_t mask, const Fid* dir, const Fid* old_dir, const Fid* new_dir,
                          const Fid* child, EventSink& sink) {
  const uint32_t kinds = (mask & kKinds) | (mask & FAN_ONDIR ? IN_ISDIR : 0);
  const bool is_dir = (mask & FAN_ONDIR) != 0;
  if ((mask & FAN_RENAME) && old_dir != nullptr && new_dir != nullptr) {
    const std::string* from_dir = Resolve(*old_dir);
    const std::string old_key = key_;
    const std::string from = from_dir == nullptr ? std::string() : *from_dir;
    const std::string* to_dir = Resolve(*new_dir);
    const std::string to = to_dir == nullptr ? std::string() : *to_dir;
    const std::string new_key = key_;
    if (!from.empty()) {
      Configured(from, old_dir->name);
      Emit(IN_MOVED_FROM | (kinds & IN_ISDIR), sink);
      Configured(from, nullptr);
      for (const std::string& path : paths_) {
        if (snapshot_ != nullptr) snapshot_->MarkDirty(path);
      }
    }
    if (!to.empty()) {
      Configured(to, new_dir->name);
      Emit(IN_MOVED_TO | (kinds & IN_ISDIR), sink);
      const std::vector<std::string> arrived =
          is_dir && from.empty() ? paths_ : std::vector<std::string>();
      Configured(to, nullptr);
      for (const std::string& path : paths_) {
        if (snapshot_ != nullptr) snapshot_->MarkDirty(path);
      }
      // What came from outside is reported as a watch made now would find it.
      if (!Arrived(arrived, sink)) unscanned_.insert(Join(to, "/") + new_dir->name);
    }
    if (!is_dir) return;
    const std::string old_path = from.empty() ? std::string() : Join(from, "/") + old_dir->name;
    const std::string new_path = to.empty() ? std::string() : Join(to, "/") + new_dir->name;
    if (!from.empty() && !to.empty()) {
      Forget(new_path);  // an empty directory replaced
      Move(old_path, new_path);
      // Moved on before its arrival was scanned: scanned where it is now.
      if (unscanned_.erase(old_path) != 0) {
        Configured(to, new_dir->name);
        const std::vector<std::string> arrived = paths_;
        if (!Arrived(arrived, sink)) unscanned_.insert(new_path);
      }
    } else if (!from.empty()) {
      Forget(old_path);
    } else if (!to.empty()) {
      outside_.clear();  // it and what it holds were outside
      if (child != nullptr) {
        key_.assign(child->fsid, 8);
        AppendHandle(&key_, child->handle);
        Cache(key_, new_path);
      }
    }
    if (from.empty()) RootEvent(old_key, old_dir->name, IN_MOVED_FROM);
    if (to.empty()) RootEvent(new_key, new_dir->name, IN_MOVED_TO);
    return;
  }
  if (dir == nullptr) return;
  const bool named = dir->name != nullptr && strcmp(dir->name, ".") != 0;
  const std::string* real = Resolve(*dir);
  if (real == nullptr) {
    if (is_dir && named) RootEvent(key_, dir->name, kinds);
    return;
  }
  if (!named) {  // an event on a directory itself
    Configured(*real, nullptr);
    Emit(kinds & ~(IN_CREATE | IN_DELETE | IN_MOVED_FROM | IN_MOVED_TO), sink);
    return;
  }
  const std::string parent = *real;
  if (snapshot_ != nullptr && (kinds & kListingChanges)) {
    Configured(parent, nullptr);
    for (const std::string& path : paths_) snapshot_->MarkDirty(path);
  }
  Configured(parent, dir->name);
  Emit(kinds, sink);
  if (!is_dir) return;
  const std::string entry = Join(parent, "/") + dir->name;
  if ((kinds & IN_CREATE) && child != nullptr) {
    key_.assign(child->fsid, 8);
    AppendHandle(&key_, child->handle);
    Cache(key_, entry);
  }
  if (kinds & (IN_DELETE | IN_MOVED_FROM)) Forget(entry);
  if (kinds & IN_MOVED_TO) {
    // The two halves of a move come apart here: each arrival is scanned.
    outside_.clear();
    const std::vector<std::string> arrived = paths_;
    Arrived(arrived, sink);
  }
}

bool FanotifyTree::Read(EventSink& sink, bool* empty) {
  alignas(struct fanotify_event_metadata) char buffer[64 * 1024];
  bool failed = false;
  *empty = fd() < 0;  // never opened (no fanotify here): nothing to read
  for (int reads = 0; !*empty && reads < kReadsPerRound && !failed; ++reads) {
    ssize_t n;
    do {
      n = read(fd(), buffer, sizeof(buffer));
    } while (n < 0 && errno == EINTR);
    if (n < 0 && errno == EAGAIN) {
      *empty = true;
      break;
    }
    if (n <= 0) {
      syslog(LOG_ERR, "reading fanotify events failed: %s", n < 0 ? strerror(errno) : "no data");
      failed = true;
      break;
    }
    size_t left = size_t(n);
    for (const char* at = buffer; left >= sizeof(struct fanotify_event_metadata);) {
      // Events are 4-byte aligned; the metadata holds a 64-bit mask.
      struct fanotify_event_metadata copy;
      memcpy(&copy, at, sizeof(copy));
      const struct fanotify_event_metadata* meta = &copy;
      if (meta->event_len < meta->metadata_len || meta->event_len > left ||
          meta->metadata_len < sizeof(*meta) || meta->vers != FANOTIFY_METADATA_VERSION) {
        syslog(LOG_ERR, "reading fanotify events failed: a malformed event");
        failed = true;
        break;
      }
      if (meta->fd >= 0) close(meta->fd);
      if (meta->mask & FAN_Q_OVERFLOW) {
        syslog(LOG_WARNING,
               "fanotify event queue overflowed, events were lost: comparing the trees again");
        sink.Lost();
        Relist();
        // Moves may be among the lost events: no cached path is trusted.
        Clear();
        for (const Root& root : roots_) {
          if (root.present) to_walk_.push_back({root.path, Walk::kAgain});
        }
      } else {
        Fid fids[4];  // the directory, the old and new directories, the entry
        bool have[4] = {false, false, false, false};
        for (size_t off = meta->metadata_len;
             off + sizeof(struct fanotify_event_info_header) <= meta->event_len;) {
          const auto* header = reinterpret_cast<const struct fanotify_event_info_header*>(at + off);
          if (header->len < sizeof(*header) || off + header->len > meta->event_len) break;
          const int slot = header->info_type == FAN_EVENT_INFO_TYPE_DFID_NAME       ? 0
                           : header->info_type == FAN_EVENT_INFO_TYPE_DFID          ? 0
                           : header->info_type == FAN_EVENT_INFO_TYPE_OLD_DFID_NAME ? 1
                           : header->info_type == FAN_EVENT_INFO_TYPE_NEW_DFID_NAME ? 2
                           : header->info_type == FAN_EVENT_INFO_TYPE_FID           ? 3
                                                                                    : -1;
          const size_t fixed = sizeof(struct fanotify_event_info_fid) + sizeof(struct file_handle);
          if (slot >= 0 && header->len >= fixed) {
            const auto* info = reinterpret_cast<const struct fanotify_event_info_fid*>(header);
            const auto* handle = reinterpret_cast<const struct file_handle*>(info->handle);
            const size_t end = fixed + handle->handle_bytes;
            if (handle->handle_bytes <= kMaxHandle && end <= header->len) {
              Fid& fid = fids[slot];
              fid.fsid = reinterpret_cast<const char*>(&info->fsid);
              fid.handle = handle;
              // The name ends with a NUL within the record.
              const char* name = reinterpret_cast<const char*>(header) + end;
              const size_t room = header->len - end;
              fid.name = header->info_type != FAN_EVENT_INFO_TYPE_DFID && room > 0 &&
                                 memchr(name, '\0', room) != nullptr
                             ? name
                             : nullptr;
              have[slot] = true;
            }
          }
          off += header->len;
        }
        Handle(uint32_t(meta->mask), have[0] ? &fids[0] : nullptr, have[1] ? &fids[1] : nullptr,
               have[2] ? &fids[2] : nullptr, have[3] ? &fids[3] : nullptr, sink);
      }
      at += meta->event_len;
      left -= meta->event_len;
    }
  }
  mount_fds_.clear();  // the file systems stay free to unmount
  return !failed;
}

bool FanotifyTree::ReadEvents(EventSink& sink) {
  bool empty = false;
  return Read(sink, &empty);
}

bool FanotifyTree::Drain(EventSink& sink) {
  constexpr int kMaxRounds = 64;
  for (int round = 0; round < kMaxRounds; ++round) {
    bool empty = false;
    if (!Read(sink, &empty)) return false;
    if (empty) return true;
  }
  return false;
}

void FanotifyTree::Enter(UniqueFd dir, const std::string& path) {
  Walking& w = *walking_;
  struct stat st;
  if (fstat(dir.get(), &st) != 0) return;
  for (const auto& ancestor : w.ancestors) {
    if (ancestor == std::make_pair(st.st_dev, st.st_ino)) return;  // a bind mount inside itself
  }
  if (st.st_dev == w.dev) {
    const std::string key = KeyOf(dir.get(), "", AT_EMPTY_PATH, w.fsid);
    if (!key.empty()) Cache(key, Join(w.real, path.substr(w.root.size())));
  }
  SnapshotListing listing;
  listing.ino = st.st_ino;
  ListWithStatus(dir.get(), &listing);
  Frame frame;
  for (const SnapshotEntry& entry : w.changes->Directory(path, std::move(listing)).entries) {
    if (entry.is_dir) frame.subdirs.push_back(entry.name);
  }
  frame.dir = std::move(dir);
  frame.path = path;
  w.ancestors.emplace_back(st.st_dev, st.st_ino);
  w.stack.push_back(std::move(frame));
}

bool FanotifyTree::WalkPending() {
  if (walking_ == nullptr) {
    if (to_walk_.empty()) return false;
    const auto [path, walk] = to_walk_.front();
    to_walk_.pop_front();
    const Root* root = nullptr;
    for (const Root& r : roots_) {
      if (r.path == path && r.present) root = &r;
    }
    if (root == nullptr || snapshot_ == nullptr || sink_ == nullptr) return walking();
    UniqueFd dir = OpenConfiguredDir(path);
    struct stat st;
    if (dir.get() < 0 || fstat(dir.get(), &st) != 0 || st.st_dev != root->dev ||
        st.st_ino != root->ino) {
      return walking();  // replaced: Tick serves it afresh
    }
    walking_ = std::make_unique<Walking>();
    walking_->root = path;
    walking_->real = root->real;
    walking_->fsid = root->fsid;
    walking_->dev = root->dev;
    walking_->walk = walk;
    walking_->changes = std::make_unique<OfflineChanges>(snapshot_->Tree(path, &walking_->known));
    Enter(std::move(dir), path);
  }
  // A bounded share of the walk per call: events are read in between.
  Walking& w = *walking_;
  for (int dirs = 0; dirs < kWalkShare && !w.stack.empty();) {
    Frame& top = w.stack.back();
    if (top.next == top.subdirs.size()) {
      w.stack.pop_back();
      w.ancestors.pop_back();
      continue;
    }
    const std::string& name = top.subdirs[top.next++];
    UniqueFd sub = OpenSubdir(top.dir.get(), name);
    if (sub.get() < 0) continue;
    Enter(std::move(sub), top.path + "/" + name);
    ++dirs;
  }
  if (!w.stack.empty()) return true;
  const std::string path = w.root;
  if (w.known == Snapshot::Known::kSaved) {
    w.changes->Finish(*sink_);
  } else if (w.known == Snapshot::Known::kNone && w.walk == Walk::kAppeared) {
    // A tree that appears for the first time has no past: all it holds
    // is new, and found.
    for (const auto& [dir_path, listing] : snapshot_->Loaded(path)->dirs()) {
      for (const SnapshotEntry& entry : listing.entries) {
        sink_->Found(dir_path + "/" + entry.name, entry.is_dir);
      }
    }
  } else if (!(w.known == Snapshot::Known::kNone && w.walk == Walk::kReload)) {
    sink_->Rescan(path);
  }
  walking_.reset();
  return walking();
}

void FanotifyTree::Relist() {
  if (snapshot_ == nullptr) return;
  // A directory that left its parent's listing loses its listings below;
  // one that came is listed in the next round, and what it holds in turn.
  std::vector<std::string> work = snapshot_->TakeDirty();
  while (!work.empty()) {
    std::vector<std::string> next;
    for (const std::string& path : work) {
      SnapshotListing listing;
      bool listed = false;
      // The trees that hold |path|: their roots are |path| or one of its
      // ancestors, found by one lookup each, outermost first.
      ForEachLeadingPath(path, [&](std::string_view prefix) {
        const auto found = snapshot_->trees().find(prefix);
        if (found == snapshot_->trees().end()) return true;
        const std::string& root = found->first;
        TreeSnapshot* tree = found->second.get();
        if (!listed) {
          const UniqueFd dir = OpenBelow(root, path);
          struct stat st;
          // Gone since it was marked: its parent's listing tells.
          if (dir.get() < 0 || fstat(dir.get(), &st) != 0) return false;
          listing.ino = st.st_ino;
          if (!(listed = ListWithStatus(dir.get(), &listing))) return false;
        }
        auto& dirs = tree->dirs();
        const auto old = dirs.find(path);
        if (old != dirs.end()) {
          std::vector<std::string> left;
          auto b = listing.entries.begin();
          for (const SnapshotEntry& a : old->second.entries) {
            while (b != listing.entries.end() && b->name < a.name) ++b;
            const bool kept =
                b != listing.entries.end() && b->name == a.name && b->ino == a.ino && b->is_dir;
            if (a.is_dir && !kept) left.push_back(path + "/" + a.name);
          }
          for (const std::string& gone : left) tree->Forget(gone);
        }
        for (const SnapshotEntry& entry : listing.entries) {
          if (!entry.is_dir) continue;
          const std::string child = path + "/" + entry.name;
          const auto known = dirs.find(child);
          if (known == dirs.end() || known->second.ino != entry.ino) next.push_back(child);
        }
        tree->Put(path, listing);
        return true;
      });
    }
    work = std::move(next);
  }
}

}  // namespace zorvnotifyd
