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

}  // namespace

void Reporter::Use(Catalogue catalogue, std::vector<QueueLog*>* created) {
  masks_ = WatchMasks(catalogue);
  indexed_ = false;
  logs_.Follow(catalogue, &logs_by_position_, created);
  catalogue_ = std::move(catalogue);
  found_wanted_.assign(catalogue_.size(), 0);
  trees_.clear();  // made again by the first rescan
}

void Reporter::BuildIndex() {
  if (indexed_) return;
  std::vector<ZORV::ZORVNOTIFYD::MonitorQueue> queues;
  queues.reserve(catalogue_.size());
  for (const CatalogueQueue& entry : catalogue_) queues.push_back(entry.queue);
  index_ = ZORV::ZORVNOTIFYD::MonitorQueueIndex(queues);
  indexed_ = true;
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
  BuildIndex();
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
  BuildIndex();
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
  // Per queue, the narrower of |path| and the queue's tree: |path| when a
  // tree holds it, else the first of its trees (in its order) below it;
  // the queue hears of nothing outside its trees.  (queue, rank, tree):
  // rank 0 for a tree holding |path|, 1 + position for one below it.
  std::vector<std::tuple<size_t, size_t, const std::string*>> hits;
  if (trees_.empty()) {
    for (size_t i = 0; i < catalogue_.size(); ++i) {
      const auto& configs = catalogue_[i].queue._configs;
      for (size_t j = 0; j < configs.size(); ++j) trees_.emplace_back(configs[j]._path, i, j);
    }
    std::sort(trees_.begin(), trees_.end());
  }
  const auto add = [&](const std::string& tree, bool holds) {
    auto it =
        std::lower_bound(trees_.begin(), trees_.end(), tree,
                         [](const auto& a, const std::string& b) { return std::get<0>(a) < b; });
    for (; it != trees_.end() && std::get<0>(*it).compare(0, tree.size(), tree) == 0; ++it) {
      const std::string& found = std::get<0>(*it);
      if (holds && found.size() != tree.size()) break;
      hits.emplace_back(std::get<1>(*it), holds ? 0 : 1 + std::get<2>(*it), holds ? &path : &found);
    }
  };
  for (size_t i = 1; i <= path.size(); ++i) {
    if (i == path.size() || path[i] == '/') add(path.substr(0, i), true);
  }
  if (path.size() > 1 && path[0] == '/') add("/", true);
  add(path == "/" ? path : path + "/", false);
  std::sort(hits.begin(), hits.end());
  for (size_t h = 0; h < hits.size(); ++h) {
    const size_t i = std::get<0>(hits[h]);
    if (h > 0 && std::get<0>(hits[h - 1]) == i) continue;
    const std::string* what = std::get<2>(hits[h]);
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
