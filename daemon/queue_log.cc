// Keeping each queue's recent records.

#include "queue_log.h"

#include <algorithm>

#include "json_writer.h"
#include "text.h"

namespace zorvnotifyd {
namespace {

std::string Key(QueueType type, const std::string& file, const std::string& name) {
  std::string key = zorvcommon::QueueTypeName(type);
  key.push_back('\0');
  key += file;
  key.push_back('\0');
  key += name;
  return key;
}

}  // namespace

QueueLog::QueueLog(QueueType type, std::string file, std::string name, size_t keep,
                   uint64_t last_seq)
    : type_(type),
      file_(std::move(file)),
      name_(std::move(name)),
      keep_(keep),
      next_seq_(last_seq + 1) {
  head_ = "{";
  AppendJsonBytesField(&head_, "queue", name_);
  head_ += ',';
  AppendJsonField(&head_, "type", zorvcommon::QueueTypeName(type_));
  head_ += ',';
  AppendJsonBytesField(&head_, "file", file_);
  head_ += ',';
}

LogRecord& QueueLog::Next(uint64_t order) {
  LogRecord* record;
  if (records_.size() < keep_) {
    record = &records_.emplace_back();
  } else {
    record = &records_[oldest_];
    oldest_ = (oldest_ + 1) % records_.size();
  }
  record->seq = next_seq_;
  record->order = order;
  record->line.assign(head_);
  AppendJsonNumber(&record->line, "seq", next_seq_++);
  return *record;
}

void QueueLog::AddEvent(const std::string& path, uint32_t mask, uint64_t order, bool offline) {
  LogRecord& record = Next(order);
  std::string& line = record.line;
  line += ',';
  AppendJsonBytesField(&line, "path", path);
  line += ',';
  AppendJsonNumber(&line, "mask", mask);
  line += offline ? ",\"offline\":true}\n" : "}\n";
  Keep(record);
}

void QueueLog::Keep(const LogRecord& record) {
  if (!journal_) return;
  journal_->Append(record.seq, record.order, record.line);
  if (!listed_) {
    listed_ = true;
    written_->push_back(this);
  }
}

void QueueLog::AddRescans(uint64_t order) {
  for (const std::string& tree : trees) AddRescan(tree, order);
}

void QueueLog::AddRescan(const std::string& path, uint64_t order) {
  LogRecord& record = Next(order);
  std::string& line = record.line;
  line += ',';
  AppendJsonBytesField(&line, "rescan", path);
  line += "}\n";
  Keep(record);
}

void QueueLog::AddNotice(const char* key, uint64_t order) {
  LogRecord& record = Next(order);
  std::string& line = record.line;
  line += ",\"";
  line += key;
  line += "\":true}\n";
  Keep(record);
}

void QueueLogs::UseJournals(int dir, uint64_t size, std::string boot,
                            std::function<std::string()> renew) {
  journal_dir_ = dir;
  journal_size_ = size;
  boot_ = std::move(boot);
  renew_ = std::move(renew);
}

void QueueLogs::Follow(const Catalogue& catalogue, std::vector<QueueLog*>* by_position,
                       std::vector<QueueLog*>* created) {
  Opened();  // an earlier Follow's journals first
  was_present_.clear();
  for (auto& [key, log] : logs_) {
    was_present_[log.get()] = log->present;
    log->present = false;
    log->trees.clear();
  }
  by_position->clear();
  for (const CatalogueQueue& entry : catalogue) {
    const std::string key = Key(entry.type, entry.file, entry.queue._name);
    std::unique_ptr<QueueLog>& log = logs_[key];
    if (!log) {
      const auto before = forgotten_.find(key);
      const uint64_t last_seq = before == forgotten_.end() ? 0 : before->second;
      log = std::make_unique<QueueLog>(entry.type, entry.file, entry.queue._name, keep_, last_seq);
      if (journal_dir_ >= 0) {
        const std::string shown = "queue " + zorvcommon::Quoted(entry.queue._name) + " (" +
                                  zorvcommon::QueueTypeName(entry.type) + "/" +
                                  zorvcommon::Printable(entry.file) + ")";
        opening_.push_back(
            {log.get(), std::make_unique<Journal>(journal_dir_, key, shown, journal_size_, boot_)});
      }
      created->push_back(log.get());
    }
    log->present = true;
    for (const auto& config : entry.queue._configs) {
      if (std::find(log->trees.begin(), log->trees.end(), config._path) == log->trees.end()) {
        log->trees.push_back(config._path);
      }
    }
    by_position->push_back(log.get());
  }
  // The rest waits for Opened: opening a thousand journals is a few reads
  // each, which need not delay the watches or the daemon's readiness.
  following_ = true;
}

void QueueLogs::FinishFollow() {
  following_ = false;
  std::vector<QueueLog*> damaged;
  for (Opening& opening : opening_) {
    QueueLog* log = opening.log;
    const JournalStart start = opening.journal->Open();
    log->NumberAfter(std::max(log->last_seq(), start.last_seq));
    order_ = std::max(order_, start.last_order);
    log->UseJournal(std::move(opening.journal), &written_);
    NeedsSync(log);  // opening may have made or replaced its files
    log->Skip(start.last_record + 1, start.last_seq + 1);
    if (start.damaged) damaged.push_back(log);
    // A client's "since" for this queue means nothing now.
    if (start.lost && renew_) journal_id_ = renew_();
  }
  opening_.clear();
  // What a damaged journal lost is not known: its queue rescans its trees.
  for (QueueLog* log : damaged) log->AddRescans(NextOrder());
  for (auto it = logs_.begin(); it != logs_.end();) {
    QueueLog& log = *it->second;
    const auto before = was_present_.find(&log);
    if (before != was_present_.end() && before->second != log.present && log.followers > 0) {
      log.AddNotice(log.present ? "registered" : "removed", NextOrder());
    }
    if (!log.present && log.followers == 0) {
      Forget(it);
      it = logs_.erase(it);
    } else {
      ++it;
    }
  }
  was_present_.clear();
}

void QueueLogs::Forget(std::map<std::string, std::unique_ptr<QueueLog>>::iterator it) {
  QueueLog& log = *it->second;
  forgotten_[it->first] = log.last_seq();
  if (log.journal() == nullptr) return;
  log.journal()->Close(log.last_seq());
  written_.erase(std::remove(written_.begin(), written_.end(), &log), written_.end());
  to_sync_.erase(std::remove(to_sync_.begin(), to_sync_.end(), &log), to_sync_.end());
  degraded_.erase(std::remove(degraded_.begin(), degraded_.end(), &log), degraded_.end());
}

void QueueLogs::WriteOut() {
  Opened();
  if (written_.empty()) return;
  unsynced_ = true;
  for (QueueLog* log : written_) {
    log->Written();
    NeedsSync(log);
    const bool was_healthy = log->journal()->healthy();
    if (!log->journal()->WriteOut() && was_healthy) degraded_.push_back(log);
  }
  written_.clear();
}

void QueueLogs::BeforeSend() {
  Opened();
  for (QueueLog* log : written_) {
    if (log->journal()->NeedsSyncFor(log->last_seq())) log->journal()->Sync();
  }
  WriteOut();
}

void QueueLogs::NeedsSync(QueueLog* log) {
  if (log->to_sync) return;
  log->to_sync = true;
  to_sync_.push_back(log);
}

void QueueLogs::Sync() {
  Opened();
  unsynced_ = false;
  std::vector<QueueLog*> logs;
  logs.swap(to_sync_);
  for (QueueLog* log : logs) {
    log->to_sync = false;
    // One that failed is tried again at the next.
    if (!log->journal()->Sync()) NeedsSync(log);
  }
}

bool QueueLogs::Settle() {
  Opened();
  bool added = false;
  for (auto it = degraded_.begin(); it != degraded_.end();) {
    QueueLog* log = *it;
    if (!log->journal()->healthy()) {
      ++it;
      continue;
    }
    // Records made while it failed are not in the journal.
    log->AddRescans(NextOrder());
    if (recorded_) recorded_(log);
    added = true;
    it = degraded_.erase(it);
  }
  return added;
}

void QueueLogs::Close() {
  Opened();
  if (closed_) return;
  closed_ = true;
  for (auto& [key, log] : logs_) {
    if (log->journal() != nullptr) log->journal()->Close(log->last_seq());
  }
  written_.clear();
  for (QueueLog* log : to_sync_) log->to_sync = false;
  to_sync_.clear();
}

bool QueueLogs::degraded() const {
  for (const auto& [key, log] : logs_) {
    if (log->journal() != nullptr && !log->journal()->healthy()) return true;
  }
  return false;
}

void QueueLogs::AppendStatus(std::string* out) const {
  *out += "\"journals\":[";
  bool first = true;
  for (const auto& [key, log] : logs_) {
    if (log->journal() == nullptr) continue;
    if (!first) *out += ',';
    first = false;
    *out += '{';
    AppendJsonBytesField(out, "queue", log->name());
    *out += ',';
    AppendJsonField(out, "type", zorvcommon::QueueTypeName(log->type()));
    *out += ',';
    AppendJsonBytesField(out, "file", log->file());
    *out += ',';
    AppendJsonNumber(out, "first", log->journal()->first_seq());
    *out += ',';
    AppendJsonNumber(out, "last", log->last_seq());
    *out += ',';
    AppendJsonNumber(out, "bytes", log->journal()->bytes());
    *out += ",\"healthy\":";
    *out += log->journal()->healthy() ? "true}" : "false}";
  }
  *out += ']';
}

std::vector<QueueLog*> QueueLogs::Find(const std::string& name, const QueueType* type,
                                       const std::string* file) const {
  std::vector<QueueLog*> found;
  for (const auto& [key, log] : logs_) {
    if (log->name() == name && (type == nullptr || log->type() == *type) &&
        (file == nullptr || log->file() == *file)) {
      found.push_back(log.get());
    }
  }
  return found;
}

void QueueLogs::Unfollow(QueueLog* log) {
  Opened();
  if (--log->followers > 0 || log->present) return;
  for (auto it = logs_.begin(); it != logs_.end(); ++it) {
    if (it->second.get() == log) {
      Forget(it);
      logs_.erase(it);
      return;
    }
  }
}

}  // namespace zorvnotifyd
