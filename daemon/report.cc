// The daemon's output: one line per queue and event.

#include "report.h"

#include <stdio.h>
#include <sys/inotify.h>

#include <json/json.h>

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

void Reporter::Event(const std::string& path, uint32_t mask) {
  for (CatalogueQueue& entry : catalogue_) {
    if (entry.queue.IsMonitoring(path, mask)) Write(entry, path, mask);
  }
}

void Reporter::Found(const std::string& path, bool is_dir) {
  const uint32_t found = is_dir ? kFoundDirMask : kFoundFileMask;
  for (CatalogueQueue& entry : catalogue_) {
    uint32_t wanted = 0;
    for (auto& config : entry.queue._configs) {
      if (config.IsMonitoring(path, found)) wanted |= config._mask;
    }
    if (wanted != 0) Write(entry, path, (found & wanted) | (found & IN_ISDIR));
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
