// What the daemon keeps of each queue's events for its clients: the most
// recent records in memory, every record in the queue's journal (as far as
// its size allows), numbered, so that a client that reconnects, even to a
// daemon started again, gets what it missed, and a slow client is told how
// much it lost.
#ifndef ZORVNOTIFYD_DAEMON_QUEUE_LOG_H_
#define ZORVNOTIFYD_DAEMON_QUEUE_LOG_H_

#include <cstdint>
#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "catalogue.h"
#include "journal.h"

namespace zorvnotifyd {

// One record: a JSON line, newline included, and its place among the
// records of every queue (so that a client of several queues gets them in
// the order they happened).
struct LogRecord {
  uint64_t seq;
  uint64_t order;
  std::string line;
};

// The records of one queue, numbered from 1 by a sequence number of its
// own; the last |keep| are kept in memory, and with a journal every record
// is appended to it as it is made.
class QueueLog {
 public:
  // A log whose first record will be numbered |last_seq| + 1.
  QueueLog(QueueType type, std::string file, std::string name, size_t keep, uint64_t last_seq);
  QueueLog(const QueueLog&) = delete;
  QueueLog& operator=(const QueueLog&) = delete;

  const std::string& name() const { return name_; }
  QueueType type() const { return type_; }
  const std::string& file() const { return file_; }
  // {"queue":..,"type":..,"file":.., : the start of every line about it.
  const std::string& head() const { return head_; }

  // The sequence number of the last record; 0 before the first.
  uint64_t last_seq() const { return next_seq_ - 1; }
  // The sequence number of the oldest record kept (last_seq() + 1 when
  // none is kept).
  uint64_t first_seq() const { return next_seq_ - records_.size(); }
  // The record numbered |seq|, first_seq() <= seq <= last_seq().
  const LogRecord& at(uint64_t seq) const {
    return records_[(oldest_ + (seq - first_seq())) % records_.size()];
  }

  // Appends to |out| the records from |seq| on that the journal holds, up
  // to about |max_bytes|; nothing without a journal.
  void ReadJournal(uint64_t seq, size_t max_bytes, std::deque<JournalRecord>* out) const {
    if (journal_) journal_->Read(seq, max_bytes, out);
  }
  // The next record is numbered |last_seq| + 1; only before the first.
  void NumberAfter(uint64_t last_seq) { next_seq_ = last_seq + 1; }
  // Numbers from |from| to before |to| were never given to a record (the
  // numbering went on past a damaged journal): a client is not told of
  // them as missed.
  void Skip(uint64_t from, uint64_t to) {
    skipped_from_ = from;
    skipped_to_ = to;
  }
  // |seq| if it was given to a record, otherwise the next number that was.
  uint64_t Given(uint64_t seq) const {
    return seq >= skipped_from_ && seq < skipped_to_ ? skipped_to_ : seq;
  }
  // The journal (null when there is none).
  Journal* journal() const { return journal_.get(); }
  // Keeps the queue's records in |journal| from now on; |written| is the
  // list of logs with records to write, which this log joins when it has
  // some.
  void UseJournal(std::unique_ptr<Journal> journal, std::vector<QueueLog*>* written) {
    journal_ = std::move(journal);
    written_ = written;
  }
  // Its journal's records were written: off the list of logs to write.
  void Written() { listed_ = false; }

  // Appends an event: {..,"seq":N,"path":..,"mask":M}, with
  // ,"offline":true before the brace for a change made while the daemon was
  // not watching.
  void AddEvent(const std::string& path, uint32_t mask, uint64_t order, bool offline = false);
  // Appends a rescan record: {..,"seq":N,"rescan":PATH}: what happened at
  // or below PATH is not known.
  void AddRescan(const std::string& path, uint64_t order);
  // Appends a notice: {..,"seq":N,"KEY":true} ("removed",
  // "registered").
  void AddNotice(const char* key, uint64_t order);
  // Appends a rescan record for each of |trees|.
  void AddRescans(uint64_t order);

  // The trees of the queue's configurations (of every queue of its name in
  // its file), which a rescan record names when what happened in them is
  // not known.
  std::vector<std::string> trees;
  // Whether the queue is in the catalogue now, and how many clients follow
  // it; a log in neither case is forgotten.
  bool present = false;
  int followers = 0;
  // The order of the last finding recorded (set by the reporter).
  uint64_t last_order = 0;
  // Its journal may hold writes not synced yet: on the list of journals
  // the next group sync syncs (kept by QueueLogs).
  bool to_sync = false;

 private:
  LogRecord& Next(uint64_t order);
  // The last record made is complete: into the journal's buffer.
  void Keep(const LogRecord& record);

  QueueType type_;
  std::string file_, name_, head_;
  size_t keep_;
  // A ring of the last |keep_| records, the oldest at |oldest_|: once
  // full, each new record takes the oldest one's place and its string's
  // storage, so that recording allocates nothing.
  std::vector<LogRecord> records_;
  size_t oldest_ = 0;
  uint64_t next_seq_ = 1;
  std::unique_ptr<Journal> journal_;
  std::vector<QueueLog*>* written_ = nullptr;
  bool listed_ = false;  // in *written_
  uint64_t skipped_from_ = 0, skipped_to_ = 0;
};

// The logs of every queue of the catalogue, and of removed queues that
// clients still follow.
class QueueLogs {
 public:
  explicit QueueLogs(size_t keep) : keep_(keep) {}
  ~QueueLogs() { Close(); }

  // Keeps each queue's records in a journal in |dir| (not owned), of
  // |size| bytes at most, from the next Follow on; |boot| identifies the
  // running boot.  |renew| makes a new journal id when a queue's numbering
  // is lost.
  void UseJournals(int dir, uint64_t size, std::string boot, std::function<std::string()> renew);
  // The id of the journals: 32 hexadecimal digits.
  const std::string& journal_id() const { return journal_id_; }
  void set_journal_id(std::string id) { journal_id_ = std::move(id); }
  // Calls |recorded| after each record the logs add themselves (rescan
  // records of a journal written again).
  void OnRecord(std::function<void(QueueLog*)> recorded) { recorded_ = std::move(recorded); }

  // Writes every journal's new records (one write each).
  void WriteOut();
  // True when records were written since the last Sync: the group sync is
  // due within its interval.
  bool unsynced() const { return unsynced_; }
  // Before records go to a client: writes them out, and syncs a journal
  // whose reserve of numbers does not cover them yet (see Journal).
  void BeforeSend();
  // The group sync: every journal written since it was last synced is
  // synced (the others have nothing to sync).
  void Sync();
  // A rescan record for the trees of each queue whose journal is written
  // again after a failure (what was not journaled is covered); true when
  // any was added.
  bool Settle();
  // Marks every journal as cleanly stopped (once; the destructor calls it).
  void Close();
  // True while some journal cannot be written.
  bool degraded() const;
  // Appends to |out| the members "journals":[{"queue","type","file",
  // "first","last","bytes"},..] of the status reply.
  void AppendStatus(std::string* out) const;

  // Follows a new catalogue: |by_position| gets the log of each queue of
  // |catalogue| (created when new; one log for queues of the same name in
  // one file).  A followed queue that left the catalogue gets a "removed"
  // notice, one that came back a "registered" notice; logs no longer
  // present nor followed are forgotten.  |created| gets the new logs.
  // The new queues' journals are opened, and the notices and forgetting
  // done, by Opened, which the caller must call before it reads or syncs
  // any log (each call below that changes the logs calls it first, and
  // every record does through NextOrder): opening a thousand journals
  // need not delay the watches or the daemon's readiness.
  void Follow(const Catalogue& catalogue, std::vector<QueueLog*>* by_position,
              std::vector<QueueLog*>* created);
  // Finishes the last Follow: opens the new queues' journals and numbers
  // their logs after what they hold.  Cheap when it has nothing to do.
  void Opened() {
    if (following_) FinishFollow();
  }

  // The logs of queue |name|, of type |type| and file |file| when given.
  std::vector<QueueLog*> Find(const std::string& name, const QueueType* type,
                              const std::string* file) const;

  // A client stopped following |log|: forgets it when it left the catalogue.
  void Unfollow(QueueLog* log);

  // A number for the next record of any queue.  Every record takes one
  // first, so the logs are usable (Opened) by then.
  uint64_t NextOrder() {
    Opened();
    return ++order_;
  }

 private:
  // Opened's work: the journals' findings into their logs, then the
  // notices and the forgetting.
  void FinishFollow();
  // Keeps the last number of the log at |it| for a queue that comes back,
  // and closes its journal; the caller erases it.
  void Forget(std::map<std::string, std::unique_ptr<QueueLog>>::iterator it);
  // Puts |log| on the list of journals the next Sync syncs, once.
  void NeedsSync(QueueLog* log);

  // A journal of a new queue, made by Follow for Opened to open.
  struct Opening {
    QueueLog* log;
    std::unique_ptr<Journal> journal;
  };

  size_t keep_;
  bool following_ = false;  // a Follow not finished by Opened yet
  std::vector<Opening> opening_;
  std::map<QueueLog*, bool> was_present_;  // for the notices of a Follow
  uint64_t order_ = 0;
  int journal_dir_ = -1;
  uint64_t journal_size_ = 0;
  std::string boot_;
  std::string journal_id_;
  std::function<std::string()> renew_;
  std::function<void(QueueLog*)> recorded_;
  std::vector<QueueLog*> written_;   // logs whose journals have records to write
  std::vector<QueueLog*> degraded_;  // logs whose journals failed to write
  // Logs whose journals were written or made since their last sync: a
  // group sync pays for these, not for every queue.
  std::vector<QueueLog*> to_sync_;
  bool closed_ = false;
  bool unsynced_ = false;
  std::map<std::string, std::unique_ptr<QueueLog>> logs_;  // by type, file and name
  // The last sequence number of each queue forgotten, so that a queue that
  // comes back goes on numbering where it stopped: a client's "since" holds
  // for the whole run of the daemon.
  std::map<std::string, uint64_t> forgotten_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_QUEUE_LOG_H_
