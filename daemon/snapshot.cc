// The saved view of the watched trees.
//
// A tree's file, "snapshot/" and 16 hexadecimal digits (a hash of the
// tree's path), is the 8 bytes "ZVSNAP1\n" followed by records, each
//   u32 length of the payload, u32 CRC-32 of the payload, the payload
// (numbers little-endian).  The first payload names the tree:
//   'R', the tree's path
// and each other one replaces what an earlier one said of a directory:
//   'L', u32 path length, path relative to the tree ("" for the tree
//        itself, else "/a/b"), u64 inode of the directory, u32 count, and
//        per entry: u8 1 for a directory else 0, u16 name length, name,
//        u64 inode, u64 size, i64 modification and i64 change time (ns)
//   'F', u32 path length, path: the directory and all below it are gone.
// An entry thus takes 35 bytes and its name.  Changes are appended as they
// are saved, and the file is written afresh (a temporary file synced and
// renamed over it) once it holds more than twice its live records: each
// byte appended is rewritten at most about twice, and a save of a few
// changed directories never costs the whole tree.  A record that does not
// check out makes the whole file unusable: what followed it is unknown.

#include "snapshot.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>

#include "checksum.h"
#include "text.h"

namespace zorvnotifyd {
namespace {

using zorvcommon::Quoted;

constexpr char kMagic[8] = {'Z', 'V', 'S', 'N', 'A', 'P', '1', '\n'};
constexpr size_t kRecordHead = 8;  // length and checksum
// Garbage a file may hold beyond twice its live records before it is
// written afresh: small trees are not rewritten for every few changes.
constexpr uint64_t kCompactSlack = 1 << 20;
// Trees written whole in one save from which one syncfs of the state's
// file system is cheaper than a fdatasync per file.
constexpr size_t kSyncTogether = 16;

template <typename T>
void Append(std::string* out, T value) {
  for (size_t i = 0; i < sizeof(T); ++i) out->push_back(char(uint64_t(value) >> (8 * i)));
}

// Reads numbers and byte strings from a payload, failing (for good) on
// any read past its end.
class Reader {
 public:
  Reader(const char* data, size_t size) : p_(data), end_(data + size) {}
  bool ok() const { return ok_; }
  bool done() const { return p_ == end_; }
  template <typename T>
  T Get() {
    uint64_t value = 0;
    if (size_t(end_ - p_) < sizeof(T)) {
      ok_ = false;
      return T(0);
    }
    for (size_t i = 0; i < sizeof(T); ++i) value |= uint64_t(uint8_t(p_[i])) << (8 * i);
    p_ += sizeof(T);
    return T(value);
  }
  std::string Bytes(size_t size) {
    if (size_t(end_ - p_) < size) {
      ok_ = false;
      return std::string();
    }
    std::string text(p_, size);
    p_ += size;
    return text;
  }

 private:
  const char* p_;
  const char* end_;
  bool ok_ = true;
};

// The file name of tree |root|: FNV-1a of its path, in hexadecimal.
std::string FileName(const std::string& root) {
  uint64_t hash = 0xcbf29ce484222325ull;
  for (char c : root) hash = (hash ^ uint8_t(c)) * 0x100000001b3ull;
  char name[17];
  snprintf(name, sizeof(name), "%016llx", (unsigned long long)hash);
  return name;
}

// Wraps |payload| (which begins at |start| of |out|) as a record: its
// length and checksum go in the 8 bytes before it.
void Seal(std::string* out, size_t start) {
  const uint32_t size = uint32_t(out->size() - start);
  const uint32_t crc = Crc32(0, out->data() + start, size);
  for (int i = 0; i < 4; ++i) {
    (*out)[start - 8 + i] = char(size >> (8 * i));
    (*out)[start - 4 + i] = char(crc >> (8 * i));
  }
}

// Writes all of |data| to |fd|; false (errno set) on failure.
bool WriteAll(int fd, const std::string& data) {
  for (size_t done = 0; done < data.size();) {
    const ssize_t n = write(fd, data.data() + done, data.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += size_t(n);
  }
  return true;
}

bool IsDirectory(const std::string& path, const std::string& dir) {
  return dir.compare(0, path.size(), path) == 0 &&
         (dir.size() == path.size() || dir[path.size()] == '/');
}

}  // namespace

bool ListWithStatus(int dir, SnapshotListing* listing) {
  alignas(struct dirent64) char buffer[16 * 1024];
  bool read_any = false;
  for (;;) {
    const ssize_t n = getdents64(dir, buffer, sizeof(buffer));
    if (n < 0) return read_any;
    if (n == 0) break;
    read_any = true;
    for (ssize_t at = 0; at < n;) {
      const auto* entry = reinterpret_cast<const struct dirent64*>(buffer + at);
      at += entry->d_reclen;
      const char* name = entry->d_name;
      if (name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'))) continue;
      struct stat st;
      if (fstatat(dir, name, &st, AT_SYMLINK_NOFOLLOW) != 0) continue;  // gone since
      SnapshotEntry& e = listing->entries.emplace_back();
      e.name = name;
      e.ino = st.st_ino;
      e.size = uint64_t(st.st_size);
      e.mtime_ns = int64_t(st.st_mtim.tv_sec) * 1000000000 + st.st_mtim.tv_nsec;
      e.ctime_ns = int64_t(st.st_ctim.tv_sec) * 1000000000 + st.st_ctim.tv_nsec;
      e.is_dir = S_ISDIR(st.st_mode);
    }
  }
  std::sort(listing->entries.begin(), listing->entries.end(),
            [](const SnapshotEntry& a, const SnapshotEntry& b) { return a.name < b.name; });
  return true;
}

void TreeSnapshot::Put(const std::string& path, SnapshotListing listing) {
  dirs_[path] = std::move(listing);
  queued_.push_back(path);
  NoteQueued();
}

void TreeSnapshot::Forget(const std::string& path) {
  for (auto it = dirs_.lower_bound(path); it != dirs_.end() && IsDirectory(path, it->first);) {
    it = dirs_.erase(it);
  }
  queued_.push_back(path);
  NoteQueued();
}

void TreeSnapshot::Encode(const std::string& path, std::string* out) const {
  out->append(kRecordHead, '\0');
  const size_t start = out->size();
  const auto it = dirs_.find(path);
  const std::string relative = path.substr(root_.size());
  out->push_back(it == dirs_.end() ? 'F' : 'L');
  Append<uint32_t>(out, uint32_t(relative.size()));
  out->append(relative);
  if (it != dirs_.end()) {
    Append<uint64_t>(out, it->second.ino);
    Append<uint32_t>(out, uint32_t(it->second.entries.size()));
    for (const SnapshotEntry& e : it->second.entries) {
      out->push_back(e.is_dir ? 1 : 0);
      Append<uint16_t>(out, uint16_t(e.name.size()));
      out->append(e.name);
      Append<uint64_t>(out, e.ino);
      Append<uint64_t>(out, e.size);
      Append<int64_t>(out, e.mtime_ns);
      Append<int64_t>(out, e.ctime_ns);
    }
  }
  Seal(out, start);
}

UniqueFd TreeSnapshot::WriteTemporary(int dir) {
  const std::string temporary = "." + FileName(root_) + ".tmp";
  std::string data(kMagic, sizeof(kMagic));
  data.append(kRecordHead, '\0');
  const size_t start = data.size();
  data.push_back('R');
  data.append(root_);
  Seal(&data, start);
  for (const auto& [path, listing] : dirs_) Encode(path, &data);
  // A name planted where the temporary file goes is removed, never
  // followed: the file is made anew.
  unlinkat(dir, temporary.c_str(), 0);
  UniqueFd out(
      openat(dir, temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (out.get() < 0 || !WriteAll(out.get(), data)) {
    SaveFailed(errno);
    unlinkat(dir, temporary.c_str(), 0);
    return UniqueFd();
  }
  file_bytes_ = live_bytes_ = data.size();
  return out;
}

bool TreeSnapshot::Install(int dir) {
  const std::string name = FileName(root_);
  const std::string temporary = "." + name + ".tmp";
  if (renameat(dir, temporary.c_str(), dir, name.c_str()) != 0) {
    SaveFailed(errno);
    unlinkat(dir, temporary.c_str(), 0);
    return false;
  }
  rewrite_ = false;
  if (save_failed_) {
    save_failed_ = false;
    syslog(LOG_NOTICE, "the snapshot of tree %s is saved again", Quoted(root_).c_str());
  }
  return true;
}

void TreeSnapshot::SaveFailed(int error) {
  if (save_failed_) return;
  save_failed_ = true;
  syslog(LOG_ERR, "cannot save the snapshot of tree %s: %s", Quoted(root_).c_str(),
         strerror(error));
}

bool TreeSnapshot::AppendQueued(int dir) {
  if (!rewrite_ && file_bytes_ > 2 * live_bytes_ + kCompactSlack) {
    // The estimate may be stale: count the live records exactly.
    std::string record;
    live_bytes_ = sizeof(kMagic) + kRecordHead + 1 + root_.size();
    for (const auto& [path, listing] : dirs_) {
      record.clear();
      Encode(path, &record);
      live_bytes_ += record.size();
    }
    rewrite_ = file_bytes_ > 2 * live_bytes_ + kCompactSlack;
  }
  if (rewrite_) return false;
  if (queued_.empty()) return true;
  std::sort(queued_.begin(), queued_.end());
  queued_.erase(std::unique(queued_.begin(), queued_.end()), queued_.end());
  std::string data;
  for (const std::string& path : queued_) Encode(path, &data);
  queued_.clear();
  const std::string name = FileName(root_);
  const UniqueFd out(openat(dir, name.c_str(), O_WRONLY | O_APPEND | O_NOFOLLOW | O_CLOEXEC));
  struct stat st;
  if (out.get() < 0 || fstat(out.get(), &st) != 0 || !S_ISREG(st.st_mode) ||
      uint64_t(st.st_size) != file_bytes_ || !WriteAll(out.get(), data) ||
      fdatasync(out.get()) != 0) {
    // Whatever happened to the file (a write cut short, or it was changed
    // behind the daemon's back), it is written whole.
    syslog(LOG_WARNING, "cannot append to the snapshot of tree %s (%s): writing it afresh",
           Quoted(root_).c_str(), out.get() < 0 ? strerror(errno) : "changed or short write");
    rewrite_ = true;
    return false;
  }
  file_bytes_ += data.size();
  return true;
}

TreeSnapshot* Snapshot::Loaded(const std::string& root) {
  const auto it = trees_.find(root);
  return it == trees_.end() ? nullptr : it->second.get();
}

TreeSnapshot* Snapshot::Tree(const std::string& root, Known* known) {
  if (TreeSnapshot* tree = Loaded(root)) {
    *known = Known::kSaved;  // what the daemon saw of it since it last loaded it
    return tree;
  }
  auto tree = std::make_unique<TreeSnapshot>(root);
  *known = Load(tree.get());
  if (*known != Known::kSaved) tree->dirs_.clear();
  if (dir_.get() >= 0) {
    tree->to_save_ = &to_save_;
    if (tree->has_queued()) tree->NoteQueued();
  }
  return (trees_[root] = std::move(tree)).get();
}

Snapshot::Known Snapshot::Load(TreeSnapshot* tree) {
  if (dir_.get() < 0) return Known::kNone;
  const std::string name = FileName(tree->root());
  const UniqueFd in(
      openat(dir_.get(), name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (in.get() < 0 && errno == ENOENT) return Known::kNone;
  const char* why = nullptr;
  struct stat st;
  std::string data;
  if (in.get() < 0) {
    why = errno == ELOOP ? "a symbolic link" : strerror(errno);
  } else if (fstat(in.get(), &st) != 0 || !S_ISREG(st.st_mode)) {
    why = "not a regular file";
  } else if (st.st_uid != geteuid() || (st.st_mode & 022) != 0) {
    why = "not root's alone";
  } else if (uint64_t(st.st_size) > kMaxFileBytes) {
    why = "too large";
  } else {
    // Read no more than the size seen, and one byte to notice growth.
    data.resize(size_t(st.st_size) + 1);
    size_t got = 0;
    for (ssize_t n; got < data.size(); got += size_t(n)) {
      n = read(in.get(), &data[got], data.size() - got);
      if (n < 0 && errno == EINTR)
        n = 0;
      else if (n <= 0)
        break;
    }
    if (got != size_t(st.st_size)) why = "changed while read";
    data.resize(std::min(got, size_t(st.st_size)));
  }
  uint64_t records = 0;
  for (size_t at = sizeof(kMagic); why == nullptr && at < data.size(); ++records) {
    if (records == 0 && data.compare(0, sizeof(kMagic), kMagic, sizeof(kMagic)) != 0) {
      why = "not a snapshot";
      break;
    }
    Reader head(data.data() + at, std::min(data.size() - at, kRecordHead));
    const uint32_t size = head.Get<uint32_t>();
    const uint32_t crc = head.Get<uint32_t>();
    if (!head.ok() || data.size() - at - kRecordHead < size) {
      why = "cut short";
      break;
    }
    const char* payload = data.data() + at + kRecordHead;
    if (Crc32(0, payload, size) != crc) {
      why = "a record does not match its checksum";
      break;
    }
    at += kRecordHead + size;
    Reader r(payload, size);
    const char kind = r.Get<char>();
    if (records == 0) {
      // Another tree whose path has the same hash: not this tree's file.
      if (kind != 'R' || r.Bytes(size - 1) != tree->root()) return Known::kNone;
      continue;
    }
    const std::string path = tree->root() + r.Bytes(r.Get<uint32_t>());
    if (kind == 'F' && r.ok() && r.done()) {
      tree->Forget(path);
      continue;
    }
    SnapshotListing listing;
    listing.ino = r.Get<uint64_t>();
    const uint32_t count = r.Get<uint32_t>();
    // Each entry takes at least 35 bytes: a count that cannot fit is garbage.
    if (kind != 'L' || !r.ok() || count > size / 35) {
      why = "garbage";
      break;
    }
    listing.entries.resize(count);
    for (SnapshotEntry& e : listing.entries) {
      e.is_dir = r.Get<uint8_t>() != 0;
      e.name = r.Bytes(r.Get<uint16_t>());
      e.ino = r.Get<uint64_t>();
      e.size = r.Get<uint64_t>();
      e.mtime_ns = r.Get<int64_t>();
      e.ctime_ns = r.Get<int64_t>();
    }
    if (!r.ok() || !r.done()) {
      why = "garbage";
      break;
    }
    tree->dirs_[path] = std::move(listing);
  }
  if (why == nullptr && records == 0) why = "cut short";
  if (why != nullptr) {
    syslog(LOG_ERR, "the snapshot of tree %s is unusable (%s): starting it afresh",
           Quoted(tree->root()).c_str(), why);
    return Known::kBroken;
  }
  tree->queued_.clear();
  tree->rewrite_ = false;
  tree->file_bytes_ = tree->live_bytes_ = data.size();
  return Known::kSaved;
}

std::vector<std::string> Snapshot::TakeDirty() {
  std::vector<std::string> dirty(dirty_.begin(), dirty_.end());
  dirty_.clear();
  return dirty;
}

void Snapshot::Save() {
  if (dir_.get() < 0 || to_save_.empty()) return;
  // In the order of their roots, as the trees are kept.
  std::vector<TreeSnapshot*> trees;
  trees.swap(to_save_);
  std::sort(trees.begin(), trees.end(),
            [](const TreeSnapshot* a, const TreeSnapshot* b) { return a->root_ < b->root_; });
  for (TreeSnapshot* tree : trees) tree->listed_ = false;
  SaveTrees(trees);
  // A tree whose save failed is tried again at the next.
  for (TreeSnapshot* tree : trees) {
    if (tree->has_queued()) tree->NoteQueued();
  }
}

void Snapshot::SaveTrees(const std::vector<TreeSnapshot*>& trees) {
  std::vector<std::pair<TreeSnapshot*, UniqueFd>> whole;
  for (TreeSnapshot* tree : trees) {
    if (!tree->has_queued()) continue;
    if (tree->AppendQueued(dir_.get())) continue;
    tree->queued_.clear();
    UniqueFd file = tree->WriteTemporary(dir_.get());
    if (file.get() >= 0) whole.emplace_back(tree, std::move(file));
  }
  if (whole.empty()) return;
  // Each file is durable before it replaces the old one, so a crash
  // leaves either whole.  Many new files are synced at once: one commit
  // of the file system instead of one per file.
  bool synced = whole.size() >= kSyncTogether && syncfs(dir_.get()) == 0;
  for (auto it = whole.begin(); it != whole.end();) {
    if (synced || fdatasync(it->second.get()) == 0) {
      ++it;
      continue;
    }
    it->first->SaveFailed(errno);
    unlinkat(dir_.get(), ("." + FileName(it->first->root()) + ".tmp").c_str(), 0);
    it = whole.erase(it);
  }
  bool installed = false;
  for (auto& [tree, file] : whole) {
    file.Reset();
    installed |= tree->Install(dir_.get());
  }
  if (installed && fsync(dir_.get()) != 0) {
    // The renames may not be durable yet: the next save writes them again.
    syslog(LOG_ERR, "cannot sync the snapshot directory: %s", strerror(errno));
    for (auto& [tree, file] : whole) tree->RewriteAll();
  }
}

}  // namespace zorvnotifyd
