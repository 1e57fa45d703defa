// What the daemon keeps of each queue's events for its clients: the most
// recent records, numbered, so that a client that reconnects gets what it
// missed and a slow client is told how much it lost.
#ifndef ZORVNOTIFYD_DAEMON_QUEUE_LOG_H_
#define ZORVNOTIFYD_DAEMON_QUEUE_LOG_H_

#include <cstdint>
#include <deque>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "catalogue.h"

namespace zorvnotifyd {

// One record: a JSON line, newline included, and its place among the
// records of every queue (so that a client of several queues gets them in
// the order they happened).
struct LogRecord {
  uint64_t order;
  std::string line;
};

// The records of one queue, numbered from 1 by a sequence number of its
// own; only the last |keep| are kept.
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
  const LogRecord& at(uint64_t seq) const { return records_[seq - first_seq()]; }

  // Appends an event: {..,"seq":N,"path":..,"mask":M}, with
  // ,"offline":true before the brace for a change made while the daemon was
  // not watching.
  void AddEvent(const std::string& path, uint32_t mask, uint64_t order, bool offline = false);
  // Appends a rescan record: {..,"seq":N,"rescan":PATH}: what happened at
  // or below PATH is not known.
  void AddRescan(const std::string& path, uint64_t order);
  // Appends a notice: {..,"seq":N,"KEY":true} ("lost", "removed",
  // "registered").
  void AddNotice(const char* key, uint64_t order);

  // Whether the queue is in the catalogue now, and how many clients follow
  // it; a log in neither case is forgotten.
  bool present = false;
  int followers = 0;
  // The order of the last finding recorded (set by the reporter).
  uint64_t last_order = 0;

 private:
  LogRecord& Next(uint64_t order);

  QueueType type_;
  std::string file_, name_, head_;
  size_t keep_;
  std::deque<LogRecord> records_;
  uint64_t next_seq_ = 1;
};

// The logs of every queue of the catalogue, and of removed queues that
// clients still follow.
class QueueLogs {
 public:
  explicit QueueLogs(size_t keep) : keep_(keep) {}

  // Follows a new catalogue: |by_position| gets the log of each queue of
  // |catalogue| (created when new; one log for queues of the same name in
  // one file).  A followed queue that left the catalogue gets a "removed"
  // notice, one that came back a "registered" notice; logs no longer
  // present nor followed are forgotten.  |created| gets the new logs.
  void Follow(const Catalogue& catalogue, std::vector<QueueLog*>* by_position,
              std::vector<QueueLog*>* created);

  // The logs of queue |name|, of type |type| and file |file| when given.
  std::vector<QueueLog*> Find(const std::string& name, const QueueType* type,
                              const std::string* file) const;

  // A client stopped following |log|: forgets it when it left the catalogue.
  void Unfollow(QueueLog* log);

  // A number for the next record of any queue.
  uint64_t NextOrder() { return ++order_; }

 private:
  size_t keep_;
  uint64_t order_ = 0;
  std::map<std::string, std::unique_ptr<QueueLog>> logs_;  // by type, file and name
  // The last sequence number of each queue forgotten, so that a queue that
  // comes back goes on numbering where it stopped: a client's "since" holds
  // for the whole run of the daemon.
  std::map<std::string, uint64_t> forgotten_;
};

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_QUEUE_LOG_H_
