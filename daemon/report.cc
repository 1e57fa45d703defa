// Handing findings to the queues that want them.

#include "report.h"

#include <stdio.h>
#include <sys/inotify.h>

#include <algorithm>

#include "event_names.h"
#include "json_writer.h"
#include "queue_types.h"
#include "text.h"

namespace zorvnotifyd {
namespace {

using zorvcommon::Printable;
using zorvcommon::QueueTypeName;

// The start of a standard-output line about queue |entry|.
void Head(const CatalogueQueue& entry, bool json, std::string* line) {
  line->clear();
  if (!json) {
    *line += "queue " + Printable(entry.queue._name) + " [" + QueueTypeName(entry.type) + "/" +
             Printable(entry.file) + "]: ";
    return;
  }
  *line += '{';
  AppendJsonBytesField(line, "queue", entry.queue._name);
  *line += ',';
  AppendJsonField(line, "type", QueueTypeName(entry.type));
  *line += ',';
  AppendJsonBytesField(line, "file", entry.file);
  *line += ',';
}

// True when the tree at |root| holds |path|: the same path, or one below
// it.
bool Holds(const std::string& root, const std::string& path) {
  return path.compare(0, root.size(), root) == 0 &&
         (path.size() == root.size() || path[root.size()] == '/' || root == "/");
}

}  // namespace

void Reporter::Use(Catalogue catalogue, std::vector<QueueLog*>* created) {
  std::vector<ZORV::ZORVNOTIFYD::MonitorQueue> queues;
  queues.reserve(catalogue.size());
  for (const CatalogueQueue& entry : catalogue) queues.push_back(entry.queue);
  index_ = ZORV::ZORVNOTIFYD::MonitorQueueIndex(queues);
  logs_.Follow(catalogue, &logs_by_position_, created);
  catalogue_ = std::move(catalogue);
  found_wanted_.assign(catalogue_.size(), 0);
}

void Reporter::Record(size_t i, const std::string& path, uint32_t mask, uint64_t order,
                      bool offline) {
  // Two queues of one name in one file share a log: one record each event.
  QueueLog* log = logs_by_position_[i];
  if (log->last_order != order) {
    log->last_order = order;
    log->AddEvent(path, mask, order, offline);
    if (recorded_) recorded_(log);
  }
  if (stdout_ == Stdout::kNone) return;
  Head(catalogue_[i], stdout_ == Stdout::kJson, &line_);
  if (stdout_ == Stdout::kJson) {
    AppendJsonBytesField(&line_, "path", path);
    line_ += ',';
    AppendJsonNumber(&line_, "mask", mask);
    line_ += offline ? ",\"offline\":true}\n" : "}\n";
  } else {
    line_ +=
        zorvcommon::MaskNames(mask) + " " + Printable(path) + (offline ? " (offline)\n" : "\n");
  }
  fwrite(line_.data(), 1, line_.size(), stdout);
}

void Reporter::Event(const std::string& path, uint32_t mask) {
  ++events_;
  index_.Match(path, mask, matches_);
  if (matches_.empty()) return;
  const uint64_t order = logs_.NextOrder();
  for (size_t i : matches_) Record(i, path, mask, order);
}

void Reporter::Found(const std::string& path, bool is_dir) {
  const uint32_t found = is_dir ? kFoundDirMask : kFoundFileMask;
  RecordWanted(path, found, found & IN_ISDIR, false);
}

void Reporter::Offline(const std::string& path, uint32_t mask) {
  RecordWanted(path, mask & ~IN_ISDIR, mask & IN_ISDIR, true);
}

void Reporter::RecordWanted(const std::string& path, uint32_t kinds, uint32_t extra, bool offline) {
  // Each kind on its own: a queue gets the kinds that some configuration
  // of it wants at |path|.
  std::vector<size_t> wanting;
  for (uint32_t bit = 1; bit != 0; bit <<= 1) {
    if ((kinds & bit) == 0) continue;
    index_.Match(path, bit, matches_);
    for (size_t i : matches_) {
      if (found_wanted_[i] == 0) wanting.push_back(i);
      found_wanted_[i] |= bit;
    }
  }
  if (wanting.empty()) return;
  ++events_;
  std::sort(wanting.begin(), wanting.end());
  const uint64_t order = logs_.NextOrder();
  for (size_t i : wanting) {
    Record(i, path, found_wanted_[i] | extra, order, offline);
    found_wanted_[i] = 0;
  }
}

void Reporter::Lost() {
  // Which events were lost is not known, only where they may have been:
  // each queue is told to rescan its trees.
  ++overflows_;
  const uint64_t order = logs_.NextOrder();
  for (size_t i = 0; i < catalogue_.size(); ++i) {
    QueueLog* log = logs_by_position_[i];
    if (log->last_order != order) {
      log->last_order = order;
      log->AddRescans(order);
      if (recorded_) recorded_(log);
    }
    if (stdout_ == Stdout::kNone) continue;
    for (const std::string& tree : log->trees) {
      Head(catalogue_[i], stdout_ == Stdout::kJson, &line_);
      if (stdout_ == Stdout::kJson) {
        AppendJsonBytesField(&line_, "rescan", tree);
        line_ += "}\n";
      } else {
        line_ += "RESCAN " + Printable(tree) + " (inotify queue overflow)\n";
      }
      fwrite(line_.data(), 1, line_.size(), stdout);
    }
  }
}

void Reporter::Rescan(const std::string& path) {
  const uint64_t order = logs_.NextOrder();
  for (size_t i = 0; i < catalogue_.size(); ++i) {
    // The narrower of |path| and the queue's tree: the queue hears of
    // nothing outside its trees.
    const std::string* what = nullptr;
    for (const auto& config : catalogue_[i].queue._configs) {
      if (Holds(config._path, path)) {
        what = &path;
        break;
      }
      if (what == nullptr && Holds(path, config._path)) what = &config._path;
    }
    if (what == nullptr) continue;
    QueueLog* log = logs_by_position_[i];
    if (log->last_order != order) {
      log->last_order = order;
      log->AddRescan(*what, order);
      if (recorded_) recorded_(log);
    }
    if (stdout_ == Stdout::kNone) continue;
    Head(catalogue_[i], stdout_ == Stdout::kJson, &line_);
    if (stdout_ == Stdout::kJson) {
      AppendJsonBytesField(&line_, "rescan", *what);
      line_ += "}\n";
    } else {
      line_ += "RESCAN " + Printable(*what) + "\n";
    }
    fwrite(line_.data(), 1, line_.size(), stdout);
  }
}

}  // namespace zorvnotifyd
