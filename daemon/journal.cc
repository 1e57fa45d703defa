// Writing, syncing and reading back one queue's journal.
//
// A file: the 8 bytes "ZVJRNL1\n", then records, each a 32-bit payload
// size, the payload's CRC-32 and the payload: one byte of kind, a 64-bit
// number, a 64-bit order and the data (host byte order: the files never
// leave the machine).  Kinds: 'H' header (number: the first record's;
// data: the queue's key), 'B' a start (data: the boot's id), 'R' numbers
// reserved up to the number, 'C' a clean stop, 'L' a record (data: its
// line).

#include "journal.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <syslog.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <string_view>

#include "checksum.h"
#include "text.h"

namespace zorvnotifyd {
namespace {

constexpr char kMagic[] = "ZVJRNL1\n";
constexpr size_t kMagicSize = 8;
constexpr size_t kFrame = 8;                 // size and checksum
constexpr size_t kFixed = 17;                // kind, number, order
constexpr size_t kMaxPayload = 1024 * 1024;  // far beyond the longest line
constexpr uint64_t kIndexEvery = 64 * 1024;  // bytes between index entries
// Numbers reserved ahead of the records; a new reserve is written with the
// group sync once half is used, so a sync outside the group is needed only
// when one queue makes this many records within one sync interval.
constexpr uint64_t kReserveAhead = 65536;
constexpr int kNames = 8;  // names tried before every one is another queue's

// FNV-1a over |key| and the probe number: the base name of a journal.
std::string Name(const std::string& key, int probe) {
  uint64_t hash = 0xcbf29ce484222325ull;
  auto mix = [&hash](unsigned char byte) {
    hash ^= byte;
    hash *= 0x100000001b3ull;
  };
  for (unsigned char byte : key) mix(byte);
  mix(static_cast<unsigned char>(probe));
  char name[24];
  snprintf(name, sizeof(name), "%016llx", static_cast<unsigned long long>(hash));
  return name;
}

// Reads the records of a file from an offset up to a bound, checking each.
class Reader {
 public:
  Reader(int fd, uint64_t offset, uint64_t end) : fd_(fd), offset_(offset), end_(end) {}
  // The next record; false at the end, or at a record that is cut short or
  // does not check out (bad() then tells).
  bool Next(char* kind, uint64_t* seq, uint64_t* order, std::string_view* data) {
    if (offset_ >= end_) return false;
    if (!Have(kFrame)) return Bad();
    uint32_t size, crc;
    memcpy(&size, Here(), 4);
    memcpy(&crc, Here() + 4, 4);
    if (size < kFixed || size > kMaxPayload || !Have(kFrame + size)) return Bad();
    const char* payload = Here() + kFrame;
    if (Crc32(0, payload, size) != crc) return Bad();
    *kind = payload[0];
    memcpy(seq, payload + 1, 8);
    memcpy(order, payload + 9, 8);
    *data = std::string_view(payload + kFixed, size - kFixed);
    offset_ += kFrame + size;
    return true;
  }
  // The offset of the next record: the end of the valid prefix.
  uint64_t offset() const { return offset_; }
  bool bad() const { return bad_; }

 private:
  bool Bad() {
    bad_ = true;
    return false;
  }
  const char* Here() const { return buffer_.data() + (offset_ - start_); }
  // True once |n| bytes from offset_ are in the buffer (within end_).
  bool Have(uint64_t n) {
    if (offset_ + n > end_) return false;
    if (offset_ >= start_ && offset_ + n <= start_ + buffer_.size()) return true;
    const size_t want =
        size_t(std::max<uint64_t>(n, std::min<uint64_t>(kIndexEvery, end_ - offset_)));
    buffer_.resize(want);
    size_t got = 0;
    while (got < want) {
      const ssize_t r = pread(fd_, &buffer_[got], want - got, off_t(offset_ + got));
      if (r < 0 && errno == EINTR) continue;
      if (r <= 0) break;
      got += size_t(r);
    }
    buffer_.resize(got);
    start_ = offset_;
    return got >= n;
  }

  int fd_;
  uint64_t offset_, end_;
  std::string buffer_;
  uint64_t start_ = 0;
  bool bad_ = false;
};

}  // namespace

std::string BootId() {
  char text[64] = {};
  UniqueFd fd(open("/proc/sys/kernel/random/boot_id", O_RDONLY | O_NOFOLLOW | O_CLOEXEC));
  const ssize_t n = fd.get() >= 0 ? read(fd.get(), text, sizeof(text) - 1) : -1;
  if (n > 30) return std::string(text, size_t(n) - (text[n - 1] == '\n' ? 1 : 0));
  struct timespec real, boot;
  clock_gettime(CLOCK_REALTIME, &real);
  clock_gettime(CLOCK_BOOTTIME, &boot);
  return "t:" + std::to_string(int64_t(real.tv_sec) - int64_t(boot.tv_sec));
}

bool SameBoot(const std::string& a, const std::string& b) {
  if (a.compare(0, 2, "t:") != 0 || b.compare(0, 2, "t:") != 0) return a == b;
  const long long x = std::strtoll(a.c_str() + 2, nullptr, 10);
  const long long y = std::strtoll(b.c_str() + 2, nullptr, 10);
  return x - y <= 2 && y - x <= 2;
}

Journal::Journal(int dir, std::string key, std::string shown, uint64_t size, std::string boot)
    : dir_(dir),
      key_(std::move(key)),
      shown_(std::move(shown)),
      boot_(std::move(boot)),
      segment_size_(std::max<uint64_t>(size / 2, 4096)) {}

bool Journal::OpenSegment(const std::string& name, int i, std::string* key, bool* bad) {
  const std::string file = name + "." + std::to_string(i);
  Segment& s = segments_[i];
  // O_NONBLOCK: a FIFO planted there never blocks the open.
  UniqueFd fd(openat(dir_, file.c_str(), O_RDWR | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (fd.get() < 0 && errno == ENOENT) return false;
  std::string why;
  struct stat st;
  if (fd.get() < 0) {
    why = errno == ELOOP ? "it is a symbolic link" : strerror(errno);
  } else if (fstat(fd.get(), &st) != 0) {
    why = strerror(errno);
  } else if (!S_ISREG(st.st_mode)) {
    why = "it is not a regular file";
  } else if (st.st_uid != 0) {
    why = "it belongs to uid " + std::to_string(st.st_uid);
  }
  char kind = 0;
  uint64_t first = 0, order = 0;
  std::string_view data;
  char magic[kMagicSize];
  if (why.empty()) {
    Reader header(fd.get(), kMagicSize, uint64_t(st.st_size));
    if (pread(fd.get(), magic, kMagicSize, 0) != ssize_t(kMagicSize) ||
        memcmp(magic, kMagic, kMagicSize) != 0 || !header.Next(&kind, &first, &order, &data) ||
        kind != 'H') {
      why = "it is not a journal, or its start is damaged";
    } else {
      *key = std::string(data);
      s.fd = std::move(fd);
      s.first = first;
      s.size = uint64_t(st.st_size);
      s.index.clear();
      s.indexed = 0;
      return true;
    }
  }
  syslog(LOG_ERR, "the journal file %s of %s cannot be used: %s; replacing it",
         zorvcommon::Quoted(file).c_str(), shown_.c_str(), why.c_str());
  fd.Reset();
  if (unlinkat(dir_, file.c_str(), 0) != 0 && errno == EISDIR) {
    unlinkat(dir_, file.c_str(), AT_REMOVEDIR);
  }
  *bad = true;
  return false;
}

void Journal::Scan(Segment& s, JournalStart* start, bool* closed, std::string* boot,
                   uint64_t* reserve) {
  // At most a full segment and one record: a file grown beyond is damaged.
  const uint64_t end = std::min<uint64_t>(s.size, segment_size_ + kFrame + kMaxPayload);
  Reader reader(s.fd.get(), kMagicSize, end);
  char kind;
  uint64_t seq, order;
  std::string_view data;
  reader.Next(&kind, &seq, &order, &data);  // the header, checked on opening
  for (uint64_t at = reader.offset(); reader.Next(&kind, &seq, &order, &data);
       at = reader.offset()) {
    *closed = kind == 'C';
    if (kind == 'L') {
      start->last_seq = std::max(start->last_seq, seq);
      start->last_order = std::max(start->last_order, order);
      if (at - s.indexed >= kIndexEvery || s.index.empty()) {
        s.index.emplace_back(seq, at);
        s.indexed = at;
      }
    } else if (kind == 'R') {
      *reserve = std::max(*reserve, seq);
    } else if (kind == 'B') {
      *boot = std::string(data);
    }
  }
  if (reader.offset() < s.size) {
    syslog(LOG_ERR,
           "the journal of %s is damaged or cut short at byte %llu of %llu: keeping the records "
           "before it",
           shown_.c_str(), static_cast<unsigned long long>(reader.offset()),
           static_cast<unsigned long long>(s.size));
    if (ftruncate(s.fd.get(), off_t(reader.offset())) != 0) {
      Fail(std::string("cannot cut off the damaged end: ") + strerror(errno));
    }
    s.size = reader.offset();
    start->damaged = true;
    *closed = false;
  }
}

JournalStart Journal::Open() {
  JournalStart start;
  bool bad = false;
  for (int probe = 0; probe < kNames && name_.empty(); ++probe) {
    const std::string name = Name(key_, probe);
    std::string keys[2];
    bool found[2];
    for (int i = 0; i < 2; ++i) found[i] = OpenSegment(name, i, &keys[i], &bad);
    if ((found[0] && keys[0] != key_) || (found[1] && keys[1] != key_)) {
      for (Segment& s : segments_) s = Segment();
      continue;  // another queue's: its key is inside
    }
    name_ = name;
  }
  if (name_.empty()) {
    Fail("every name it may have is another queue's");
    start.damaged = start.lost = true;
    return start;
  }
  start.damaged = bad;
  // The newer segment (the greater first number in its header) is the one
  // written; the other is read first.
  const bool both = segments_[0].fd.get() >= 0 && segments_[1].fd.get() >= 0;
  active_ = both ? (segments_[1].first > segments_[0].first ? 1 : 0)
                 : (segments_[1].fd.get() >= 0 ? 1 : 0);
  bool closed = false;
  std::string boot;
  uint64_t reserve = 0;
  for (int i : {1 - active_, active_}) {
    if (segments_[i].fd.get() >= 0) Scan(segments_[i], &start, &closed, &boot, &reserve);
  }
  const bool any = segments_[active_].fd.get() >= 0;
  start.lost = bad && !any;
  // Records written in this boot are all in the files (the page cache
  // outlives the daemon); after a reboot without a clean stop, those not
  // yet synced may be gone.
  if (any && !closed && !SameBoot(boot, boot_)) start.damaged = true;
  // Past every number a client may have been given.
  start.last_record = start.last_seq;
  if (start.damaged) start.last_seq = std::max(start.last_seq, reserve);
  last_seq_ = start.last_seq;
  reserve_ = std::max(reserve, last_seq_);
  durable_reserve_ = 0;  // not known to be synced: the first delivery syncs
  if (!any && !Create(0, last_seq_ + 1)) return start;
  Frame('B', 0, 0, boot_.data(), boot_.size());
  return start;
}

bool Journal::Create(int i, uint64_t first) {
  const std::string file = name_ + "." + std::to_string(i);
  Segment& s = segments_[i];
  s = Segment();
  UniqueFd fd(
      openat(dir_, file.c_str(), O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0600));
  struct stat st;
  if (fd.get() < 0 || fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode) || st.st_uid != 0 ||
      ftruncate(fd.get(), 0) != 0) {
    Fail("cannot make " + zorvcommon::Quoted(file) + ": " + strerror(errno));
    return false;
  }
  std::string head(kMagic, kMagicSize);
  buffer_.swap(head);
  Frame('H', first, 0, key_.data(), key_.size());
  Frame('B', 0, 0, boot_.data(), boot_.size());
  buffer_.swap(head);
  if (pwrite(fd.get(), head.data(), head.size(), 0) != ssize_t(head.size())) {
    Fail("cannot write " + zorvcommon::Quoted(file) + ": " + strerror(errno));
    return false;
  }
  s.fd = std::move(fd);
  s.first = first;
  s.size = head.size();
  unsynced_ = true;
  return true;
}

void Journal::Frame(char kind, uint64_t seq, uint64_t order, const char* data, size_t size) {
  const size_t at = buffer_.size();
  const uint32_t payload = uint32_t(kFixed + size);
  buffer_.resize(at + kFrame + kFixed);
  char* p = &buffer_[at + kFrame];
  p[0] = kind;
  memcpy(p + 1, &seq, 8);
  memcpy(p + 9, &order, 8);
  buffer_.append(data, size);
  const uint32_t crc = Crc32(0, buffer_.data() + at + kFrame, payload);
  memcpy(&buffer_[at], &payload, 4);
  memcpy(&buffer_[at + 4], &crc, 4);
}

void Journal::Append(uint64_t seq, uint64_t order, const std::string& line) {
  if (rotate_ && healthy_) {
    // The newer segment is full: the older is emptied and written next
    // (not while writes fail: the full one takes the records meanwhile).
    rotate_ = false;
    WriteOut();
    if (Create(1 - active_, seq)) active_ = 1 - active_;
  }
  if (seq > reserve_) {
    reserve_ = seq - 1 + kReserveAhead;
    Frame('R', reserve_, 0, nullptr, 0);
  }
  Segment& s = segments_[active_];
  const uint64_t offset = s.size + buffer_.size();
  if (offset - s.indexed >= kIndexEvery || s.index.empty()) {
    s.index.emplace_back(seq, offset);
    s.indexed = offset;
  }
  Frame('L', seq, order, line.data(), line.size());
  last_seq_ = seq;
  if (offset + line.size() >= segment_size_) rotate_ = true;
}

bool Journal::WriteOut() {
  if (buffer_.empty()) return true;
  Segment& s = segments_[active_];
  // A segment that could not be made (a full disk at the turn) is made
  // again, so that the journal recovers once there is room.
  if (s.fd.get() < 0 && !name_.empty()) Create(active_, last_seq_);
  ssize_t n = -1;
  int error = EBADF;
  if (s.fd.get() >= 0) {
    do {
      n = pwrite(s.fd.get(), buffer_.data(), buffer_.size(), off_t(s.size));
    } while (n < 0 && errno == EINTR);
    error = n < 0 ? errno : ENOSPC;
  }
  if (n == ssize_t(buffer_.size())) {
    s.size += uint64_t(n);
    buffer_.clear();
    unsynced_ = true;
    if (!healthy_) {
      healthy_ = true;
      syslog(LOG_NOTICE, "the journal of %s is written again", shown_.c_str());
    }
    return true;
  }
  // A part written is taken back: the next record must follow a whole one.
  if (n > 0 && ftruncate(s.fd.get(), off_t(s.size)) != 0) s.size += uint64_t(n);
  while (!s.index.empty() && s.index.back().second >= s.size) s.index.pop_back();
  s.indexed = s.index.empty() ? 0 : s.index.back().second;
  buffer_.clear();
  reserve_ = durable_reserve_;
  Fail(std::string("cannot write its records: ") + strerror(error));
  return false;
}

bool Journal::Sync() {
  // A journal with nothing written since its last sync costs nothing.
  if (!unsynced_ && buffer_.empty()) return true;
  if (healthy_ && reserve_ < last_seq_ + kReserveAhead / 2) {
    reserve_ = last_seq_ + kReserveAhead;
    Frame('R', reserve_, 0, nullptr, 0);
  }
  if (!WriteOut()) return false;
  for (Segment& s : segments_) {
    if (s.fd.get() >= 0 && fdatasync(s.fd.get()) != 0) {
      Fail(std::string("cannot sync its records: ") + strerror(errno));
      return false;
    }
  }
  durable_reserve_ = reserve_;
  unsynced_ = false;
  return true;
}

void Journal::Close(uint64_t last_seq) {
  Frame('C', last_seq, 0, nullptr, 0);
  Sync();
}

void Journal::Fail(const std::string& what) {
  if (healthy_) {
    syslog(LOG_ERR,
           "the journal of %s is degraded: %s; live delivery goes on, and the queue is told to "
           "rescan its trees once the journal is written again",
           shown_.c_str(), what.c_str());
  }
  healthy_ = false;
}

uint64_t Journal::first_seq() const {
  for (int i : {1 - active_, active_}) {
    const Segment& s = segments_[i];
    if (s.fd.get() >= 0 && !s.index.empty()) return s.index.front().first;
  }
  return 0;
}

void Journal::Read(uint64_t seq, size_t max_bytes, std::deque<JournalRecord>* out) {
  WriteOut();
  size_t bytes = 0;
  for (int i : {1 - active_, active_}) {
    const Segment& s = segments_[i];
    if (s.fd.get() < 0 || s.index.empty()) continue;
    // The last index entry at or before |seq|.
    auto it = std::upper_bound(s.index.begin(), s.index.end(), seq,
                               [](uint64_t wanted, const std::pair<uint64_t, uint64_t>& entry) {
                                 return wanted < entry.first;
                               });
    const uint64_t from = it == s.index.begin() ? kMagicSize : std::prev(it)->second;
    Reader reader(s.fd.get(), from, s.size);
    char kind;
    uint64_t record_seq, order;
    std::string_view data;
    while (bytes < max_bytes && reader.Next(&kind, &record_seq, &order, &data)) {
      if (kind != 'L' || record_seq < seq) continue;
      out->push_back({record_seq, order, std::string(data)});
      bytes += data.size();
      seq = record_seq + 1;
    }
    if (bytes >= max_bytes) return;
  }
}

}  // namespace zorvnotifyd
