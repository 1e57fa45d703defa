// Keeping each queue's recent records.

#include "queue_log.h"

#include "json_writer.h"

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
  AppendJsonField(&head_, "queue", name_);
  head_ += ',';
  AppendJsonField(&head_, "type", zorvcommon::QueueTypeName(type_));
  head_ += ',';
  AppendJsonField(&head_, "file", file_);
  head_ += ',';
}

LogRecord& QueueLog::Next(uint64_t order) {
  // The oldest record's string is reused for the newest, so a full log
  // stops allocating once its lines have grown to size.
  LogRecord record;
  if (records_.size() >= keep_ && !records_.empty()) {
    record = std::move(records_.front());
    records_.pop_front();
  }
  record.order = order;
  record.line.assign(head_);
  AppendJsonNumber(&record.line, "seq", next_seq_++);
  records_.push_back(std::move(record));
  return records_.back();
}

void QueueLog::AddEvent(const std::string& path, uint32_t mask, uint64_t order, bool offline) {
  std::string& line = Next(order).line;
  line += ',';
  AppendJsonField(&line, "path", path);
  line += ',';
  AppendJsonNumber(&line, "mask", mask);
  line += offline ? ",\"offline\":true}\n" : "}\n";
}

void QueueLog::AddRescan(const std::string& path, uint64_t order) {
  std::string& line = Next(order).line;
  line += ',';
  AppendJsonField(&line, "rescan", path);
  line += "}\n";
}

void QueueLog::AddNotice(const char* key, uint64_t order) {
  std::string& line = Next(order).line;
  line += ",\"";
  line += key;
  line += "\":true}\n";
}

void QueueLogs::Follow(const Catalogue& catalogue, std::vector<QueueLog*>* by_position,
                       std::vector<QueueLog*>* created) {
  std::map<QueueLog*, bool> was_present;
  for (auto& [key, log] : logs_) {
    was_present[log.get()] = log->present;
    log->present = false;
  }
  by_position->clear();
  for (const CatalogueQueue& entry : catalogue) {
    const std::string key = Key(entry.type, entry.file, entry.queue._name);
    std::unique_ptr<QueueLog>& log = logs_[key];
    if (!log) {
      const auto before = forgotten_.find(key);
      log = std::make_unique<QueueLog>(entry.type, entry.file, entry.queue._name, keep_,
                                       before == forgotten_.end() ? 0 : before->second);
      created->push_back(log.get());
    }
    log->present = true;
    by_position->push_back(log.get());
  }
  for (auto it = logs_.begin(); it != logs_.end();) {
    QueueLog& log = *it->second;
    const auto before = was_present.find(&log);
    if (before != was_present.end() && before->second != log.present && log.followers > 0) {
      log.AddNotice(log.present ? "registered" : "removed", NextOrder());
    }
    if (!log.present && log.followers == 0) {
      forgotten_[it->first] = log.last_seq();
      it = logs_.erase(it);
    } else {
      ++it;
    }
  }
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
  if (--log->followers > 0 || log->present) return;
  for (auto it = logs_.begin(); it != logs_.end(); ++it) {
    if (it->second.get() == log) {
      forgotten_[it->first] = log->last_seq();
      logs_.erase(it);
      return;
    }
  }
}

}  // namespace zorvnotifyd
