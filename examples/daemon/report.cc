// The daemon's output: one line per queue and event.

#include "report.h"

#include <stdio.h>
#include <sys/inotify.h>

#include <json/json.h>

namespace zorvnotifyd {
namespace {

struct BitName {
  uint32_t bit;
  const char* name;
};

constexpr BitName kBitNames[] = {
    {IN_ACCESS, "IN_ACCESS"},
    {IN_MODIFY, "IN_MODIFY"},
    {IN_ATTRIB, "IN_ATTRIB"},
    {IN_CLOSE_WRITE, "IN_CLOSE_WRITE"},
    {IN_CLOSE_NOWRITE, "IN_CLOSE_NOWRITE"},
    {IN_OPEN, "IN_OPEN"},
    {IN_MOVED_FROM, "IN_MOVED_FROM"},
    {IN_MOVED_TO, "IN_MOVED_TO"},
    {IN_CREATE, "IN_CREATE"},
    {IN_DELETE, "IN_DELETE"},
    {IN_DELETE_SELF, "IN_DELETE_SELF"},
    {IN_MOVE_SELF, "IN_MOVE_SELF"},
    {IN_UNMOUNT, "IN_UNMOUNT"},
    {IN_ISDIR, "IN_ISDIR"},
};

// One compact JSON object, without a line break.
std::string JsonLine(const CatalogueQueue& entry, const std::string& path, uint32_t mask) {
  Json::Value line(Json::objectValue);
  line["queue"] = entry.queue._name;
  line["type"] = zorvnotifyctl::QueueTypeName(entry.type);
  line["file"] = entry.file;
  line["path"] = path;
  line["mask"] = Json::UInt(mask);
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;  // paths are bytes: write them unchanged, not as \u escapes
  return Json::writeString(builder, line);
}

}  // namespace

std::string MaskNames(uint32_t mask) {
  std::string names;
  for (const BitName& bit : kBitNames) {
    if ((mask & bit.bit) == 0) continue;
    names += names.empty() ? bit.name : std::string("|") + bit.name;
    mask &= ~bit.bit;
  }
  if (mask != 0 || names.empty()) {
    char rest[16];
    snprintf(rest, sizeof(rest), "0x%x", mask);
    names += names.empty() ? rest : std::string("|") + rest;
  }
  return names;
}

void ReportEvent(Catalogue& catalogue, const std::string& path, uint32_t mask, bool json) {
  for (CatalogueQueue& entry : catalogue) {
    if (!entry.queue.IsMonitoring(path, mask)) continue;
    const std::string line = json ? JsonLine(entry, path, mask)
                                  : "queue " + entry.queue._name + " [" +
                                        zorvnotifyctl::QueueTypeName(entry.type) + "/" +
                                        entry.file + "]: " + MaskNames(mask) + " " + path;
    printf("%s\n", line.c_str());
    fflush(stdout);
  }
}

}  // namespace zorvnotifyd
