// The daemon's output: one line per queue and event.

#include "report.h"

#include <stdio.h>
#include <sys/inotify.h>

#include <json/json.h>

#include <algorithm>

#include "event_names.h"
#include "queue_types.h"
#include "text.h"

namespace zorvnotifyd {
namespace {

using zorvcommon::Printable;
using zorvcommon::QueueTypeName;

// |value| as one compact JSON line, bytes of paths written unchanged.
void PrintJson(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  const std::string line = Json::writeString(builder, value);
  printf("%s\n", line.c_str());
}

Json::Value JsonHead(const CatalogueQueue& entry) {
  Json::Value line(Json::objectValue);
  line["queue"] = entry.queue._name;
  line["type"] = QueueTypeName(entry.type);
  line["file"] = entry.file;
  return line;
}

std::string TextHead(const CatalogueQueue& entry) {
  return "queue " + Printable(entry.queue._name) + " [" + QueueTypeName(entry.type) + "/" +
         Printable(entry.file) + "]: ";
}

}  // namespace

void Reporter::Write(const CatalogueQueue& entry, const std::string& path, uint32_t mask) {
  if (json_) {
    Json::Value line = JsonHead(entry);
    line["path"] = path;
    line["mask"] = Json::UInt(mask);
    PrintJson(line);
  } else {
    printf("%s%s %s\n", TextHead(entry).c_str(), zorvcommon::MaskNames(mask).c_str(),
           Printable(path).c_str());
  }
}

void Reporter::Use(Catalogue catalogue) {
  std::vector<ZORV::ZORVNOTIFYD::MonitorQueue> queues;
  queues.reserve(catalogue.size());
  for (const CatalogueQueue& entry : catalogue) queues.push_back(entry.queue);
  index_ = ZORV::ZORVNOTIFYD::MonitorQueueIndex(queues);
  catalogue_ = std::move(catalogue);
  found_wanted_.assign(catalogue_.size(), 0);
}

void Reporter::Event(const std::string& path, uint32_t mask) {
  index_.Match(path, mask, matches_);
  for (size_t i : matches_) Write(catalogue_[i], path, mask);
}

void Reporter::Found(const std::string& path, bool is_dir) {
  // Each kind on its own: a queue gets the kinds that some configuration
  // of it wants at |path|.
  const uint32_t found = is_dir ? kFoundDirMask : kFoundFileMask;
  std::vector<size_t> wanting;
  for (uint32_t bit = 1; bit != 0; bit <<= 1) {
    if ((found & bit) == 0) continue;
    index_.Match(path, bit, matches_);
    for (size_t i : matches_) {
      if (found_wanted_[i] == 0) wanting.push_back(i);
      found_wanted_[i] |= bit;
    }
  }
  std::sort(wanting.begin(), wanting.end());
  for (size_t i : wanting) {
    Write(catalogue_[i], path, found_wanted_[i] | (found & IN_ISDIR));
    found_wanted_[i] = 0;
  }
}

void Reporter::Lost() {
  for (const CatalogueQueue& entry : catalogue_) {
    if (json_) {
      Json::Value line = JsonHead(entry);
      line["lost"] = true;
      PrintJson(line);
    } else {
      printf("%sLOST events may have been lost (inotify queue overflow)\n",
             TextHead(entry).c_str());
    }
  }
}

}  // namespace zorvnotifyd
