// The journal of one queue: its records appended to files of the state
// directory, so that they outlive the daemon.  Two segments of half the
// size each: when the newer fills, the older is emptied and written next, so
// the oldest records go first and between half and all of the size is
// kept.  Every record carries a CRC-32: a file cut short or damaged is
// caught where the damage starts, and what comes before it is kept.
//
// Numbering across a crash: a record is delivered only once the journal
// holds it or a synced "reserve" record covers its number (reserved ahead
// in blocks, synced with the group syncs), so a daemon that comes back
// after a power cut numbers on past anything a client may have seen.
#ifndef ZORVNOTIFYD_DAEMON_JOURNAL_H_
#define ZORVNOTIFYD_DAEMON_JOURNAL_H_

#include <cstdint>
#include <deque>
#include <string>
#include <utility>
#include <vector>

#include "unique_fd.h"

namespace zorvnotifyd {

using zorvcommon::UniqueFd;

// The id of the running boot: the kernel's boot_id, or, where /proc/sys is
// hidden (the unit's ProcSubset=pid), "t:" and the boot time in seconds.
std::string BootId();

// True when boot ids |a| and |b| name the same boot (boot times within two
// seconds: the clock's steps blur them a little).
bool SameBoot(const std::string& a, const std::string& b);

// One record read back from a journal.
struct JournalRecord {
  uint64_t seq;
  uint64_t order;
  std::string line;
};

// What a journal held when it was opened.
struct JournalStart {
  uint64_t last_seq = 0;     // the numbering goes on after it
  uint64_t last_record = 0;  // the last record read: those after it up to last_seq never were
  uint64_t last_order = 0;   // the highest order of a record read
  // Part of the journal is lost or unusable (damaged, cut short, replaced,
  // or written in an earlier boot that ended without a clean stop): the
  // queue must be told to rescan its trees.
  bool damaged = false;
  // Nothing of the journal could be read back although it existed: its
  // numbering is lost, and the journal id must change.
  bool lost = false;
};

class Journal {
 public:
  // The journal of the queue whose identity is |key|, in the directory
  // |dir| (not owned); |shown| names the queue in log lines; |size| bytes
  // kept at most; |boot| identifies the running boot.
  Journal(int dir, std::string key, std::string shown, uint64_t size, std::string boot);
  Journal(const Journal&) = delete;
  Journal& operator=(const Journal&) = delete;

  // Finds and reads the queue's files (a name derived from the key; the
  // key stored inside tells a collision, which moves to the next name),
  // keeping the valid prefix of each and replacing what cannot be used (a
  // link, another kind of file, another owner, garbage).  Never blocks on a
  // file that is not regular; reads are bounded by the size.
  JournalStart Open();

  // Appends a record to the buffer written by WriteOut.
  void Append(uint64_t seq, uint64_t order, const std::string& line);
  // True while the buffer holds something.
  bool pending() const { return !buffer_.empty(); }
  // Writes the buffer at once (one write); false when that failed or wrote
  // only part (the part is taken back): the buffer is dropped, the journal
  // is degraded, and the failure logged once until a write works again.
  bool WriteOut();
  // Writes what waits and syncs the file (fdatasync), first reserving
  // numbers ahead when the reserve runs low; false on failure.
  bool Sync();
  // True when a record numbered |seq| may not be delivered before Sync: its
  // number is beyond the synced reserve (never while degraded, when
  // delivery goes on without it).
  bool NeedsSyncFor(uint64_t seq) const { return healthy_ && seq > durable_reserve_; }
  // Marks a clean stop (the next start knows that nothing is missing),
  // written and synced.
  void Close(uint64_t last_seq);

  // Appends to |out| the records numbered |seq| and after, in order, up to
  // about |max_bytes| of lines; writes out the buffer first.  Nothing when
  // none is there.
  void Read(uint64_t seq, size_t max_bytes, std::deque<JournalRecord>* out);

  // The first record kept (0 when none) and the bytes of the files.
  uint64_t first_seq() const;
  uint64_t bytes() const { return segments_[0].size + segments_[1].size; }
  // False since a write failed, until one works again.
  bool healthy() const { return healthy_; }

 private:
  struct Segment {
    UniqueFd fd;
    uint64_t first = 0;  // the number of its header: its records come after
    uint64_t size = 0;   // bytes written
    std::vector<std::pair<uint64_t, uint64_t>> index;  // (seq, offset), every 64 KiB
    uint64_t indexed = 0;                              // offset of the last index entry
  };
  // Opens segment |i| of base name |name|, checking what it is; false when
  // it is absent; |key| gets the key of its header, |bad| whether it had to
  // be replaced.
  bool OpenSegment(const std::string& name, int i, std::string* key, bool* bad);
  // Reads segment |s| through, keeping the valid prefix.
  void Scan(Segment& s, JournalStart* start, bool* closed, std::string* boot, uint64_t* reserve);
  // Makes segment |i| afresh (empty, with its header), numbering from |first|.
  bool Create(int i, uint64_t first);
  // Appends a framed record of |kind| to the buffer.
  void Frame(char kind, uint64_t seq, uint64_t order, const char* data, size_t size);
  // Notes a failure of the state's writes (logged once until healthy).
  void Fail(const std::string& what);

  int dir_;
  std::string key_, shown_, boot_, name_;
  uint64_t segment_size_;
  Segment segments_[2];
  int active_ = 0;
  std::string buffer_;
  uint64_t last_seq_ = 0;
  uint64_t reserve_ = 0;          // the highest number reserved in the buffer or file
  uint64_t durable_reserve_ = 0;  // ... synced
  bool healthy_ = true;
  bool unsynced_ = false;  // written since the last sync
  bool rotate_ = false;    // the active segment is full: the next record starts the other
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_JOURNAL_H_
