// The commands of zorvnotifyctl, built on the public API of libzorvnotifyd.

#include "commands.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <iostream>
#include <set>
#include <sstream>

#include "catalogue_view.h"
#include "json_output.h"
#include "masks.h"
#include "monitor_queue.h"
#include "monitor_queue_index.h"
#include "queue_file_name.h"
#include "queue_object.h"
#include "table.h"

namespace zorvnotifyctl {
namespace {

using ZORV::ZORVNOTIFYD::MonitorQueue;
using ZORV::ZORVNOTIFYD::MonitorQueueIndex;

// |text| in double quotes, control bytes escaped, for messages.
std::string Quoted(const std::string& text) {
  return text.empty() ? "\"\"" : "\"" + Printable(text) + "\"";
}

// "queue file "F" of type T", for messages.
std::string FileLabel(const Invocation& invocation, const std::string& file) {
  return "queue file " + Quoted(file) + " of type " + QueueTypeName(invocation.type);
}

// Refuses a queue file name the catalogue would not see (exit status 2).
bool CheckFileName(const std::string& file, int* status) {
  const std::string problem = QueueFileNameProblem(file);
  if (problem.empty()) return true;
  *status = Fail(kExitUsage, problem);
  return false;
}

// Adds one row per watch configuration and ignore pattern of |queue|,
// after the cells of |lead|; the lead and the name only on the first row.
void AddQueueRows(Table* table, std::vector<std::string> lead, const MonitorQueue& queue) {
  lead.push_back(Printable(queue._name));
  if (queue._configs.empty()) {
    lead.insert(lead.end(), {"-", "-", ""});
    table->AddRow(lead);
    return;
  }
  const std::vector<std::string> blank(lead.size());
  bool first = true;
  for (const MonitorQueue::MonitorQueueConfig& config : queue._configs) {
    std::vector<std::string> row = first ? lead : blank;
    first = false;
    row.push_back(Printable(config._path));
    row.push_back(FormatMask(config._mask));
    row.push_back(config._ignore.empty() ? "" : Printable(config._ignore.front()));
    table->AddRow(row);
    for (size_t i = 1; i < config._ignore.size(); ++i) {
      std::vector<std::string> more(lead.size() + 2);  // blank path and mask
      more.push_back(Printable(config._ignore[i]));
      table->AddRow(more);
    }
  }
}

void PrintTableOrNone(const Table& table, const char* none) {
  if (table.empty()) {
    std::cout << none << '\n';
  } else {
    table.Print(std::cout);
  }
}

// Prints queues of one file: a JSON array in the file's own form, or a table.
void PrintQueues(const Invocation& invocation, const std::vector<MonitorQueue>& queues) {
  if (invocation.json) {
    Json::Value array(Json::arrayValue);
    for (const MonitorQueue& queue : queues) array.append(queue.ToJson());
    WriteJson(std::cout, array);
    return;
  }
  Table table({"QUEUE", "PATH", "MASK", "IGNORE"});
  for (const MonitorQueue& queue : queues) AddQueueRows(&table, {}, queue);
  PrintTableOrNone(table, "(no queues)");
}

// The result of a write command for --json.
Json::Value WriteResult(const Invocation& invocation, const std::string& file,
                        const std::string& path, const std::string& name) {
  Json::Value result(Json::objectValue);
  result["type"] = QueueTypeName(invocation.type);
  result["file"] = file;
  result["path"] = path;
  result["queue"] = name;
  return result;
}

// Reads the whole of |source| ("-" is standard input) into |text|.
bool ReadSource(const std::string& source, std::string* text, std::string* error) {
  std::ostringstream content;
  if (source == "-") {
    content << std::cin.rdbuf();
    if (std::cin.bad()) {
      *error = "cannot read the queue object from standard input";
      return false;
    }
  } else {
    struct stat st;
    if (stat(source.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) {
      *error = "cannot read " + source + ": it is a directory";
      return false;
    }
    std::ifstream in(source, std::ios::binary);
    if (!in) {
      *error = "cannot open " + source + ": " + strerror(errno);
      return false;
    }
    content << in.rdbuf();
    if (in.bad()) {
      *error = "cannot read " + source;
      return false;
    }
  }
  *text = content.str();
  return true;
}

// The index over the queues of |queues|, in the same order.
MonitorQueueIndex CatalogueIndex(const std::vector<TypedQueue>& queues) {
  std::vector<MonitorQueue> plain;
  plain.reserve(queues.size());
  for (const TypedQueue& entry : queues) plain.push_back(entry.queue);
  return MonitorQueueIndex(plain);
}

// Loads the catalogue with types, or reports the failure (exit status 1).
bool LoadCatalogueOrFail(std::vector<TypedQueue>* queues, int* status) {
  if (LoadCatalogue(queues)) return true;
  *status = Fail(kExitRefused, "cannot read the catalogue (see the library's message above)");
  return false;
}

}  // namespace

int Fail(int status, const std::string& message) {
  std::cerr << "zorvnotifyctl: " << message << std::endl;
  return status;
}

int RunList(const Invocation& invocation) {
  const std::string& file = invocation.args[0];
  int status = kExitOk;
  if (!CheckFileName(file, &status)) return status;
  std::vector<MonitorQueue> queues;
  if (!MonitorQueue::List(queues, file, invocation.type)) {
    return Fail(kExitRefused, "cannot read " + FileLabel(invocation, file) +
                                  ": it is unreadable or not a valid queue file, "
                                  "or root privileges are missing");
  }
  PrintQueues(invocation, queues);
  return kExitOk;
}

int RunGet(const Invocation& invocation) {
  const std::string& name = invocation.args[0];
  const std::string& file = invocation.args[1];
  int status = kExitOk;
  if (!CheckFileName(file, &status)) return status;
  MonitorQueue queue{Json::Value()};
  if (!MonitorQueue::Get(queue, name, file, invocation.type)) {
    return Fail(kExitRefused,
                "no queue " + Quoted(name) + " could be read from " + FileLabel(invocation, file));
  }
  if (invocation.json) {
    WriteJson(std::cout, queue.ToJson());
  } else {
    PrintQueues(invocation, {queue});
  }
  return kExitOk;
}

int RunUpsert(const Invocation& invocation) {
  const std::string& file = invocation.args[0];
  int status = kExitOk;
  if (!CheckFileName(file, &status)) return status;
  const std::string source = invocation.args.size() > 1 ? invocation.args[1] : "-";
  // The source is read with the caller's own ids, before the library raises
  // any privilege.
  std::string text;
  std::string error;
  if (!ReadSource(source, &text, &error)) return Fail(kExitUsage, error);
  Json::Value object;
  const std::string problem = ParseQueueObject(text, &object);
  if (!problem.empty()) {
    return Fail(kExitUsage, "invalid queue object in " +
                                (source == "-" ? std::string("standard input") : source) + ": " +
                                problem);
  }
  const MonitorQueue queue(object);
  if (!MonitorQueue::Upsert(queue, file, invocation.type)) {
    return Fail(kExitRefused, "the library did not store queue " + Quoted(queue._name) + " in " +
                                  FileLabel(invocation, file));
  }
  const std::string path = MonitorQueue::GetConfDir(invocation.type) + "/" + file;
  if (invocation.json) {
    WriteJson(std::cout, WriteResult(invocation, file, path, queue._name));
  } else {
    std::cout << "stored queue " << Quoted(queue._name) << " in " << Printable(path) << " (type "
              << QueueTypeName(invocation.type) << ")\n";
  }
  return kExitOk;
}

int RunDelete(const Invocation& invocation) {
  const std::string& name = invocation.args[0];
  const std::string& file = invocation.args[1];
  int status = kExitOk;
  if (!CheckFileName(file, &status)) return status;
  // Whether the queue is there only shapes the report: the library treats
  // a missing name as success and so does the exit status.
  std::vector<MonitorQueue> before;
  bool present = false;
  if (MonitorQueue::List(before, file, invocation.type)) {
    for (const MonitorQueue& queue : before) present |= queue._name == name;
  }
  if (!MonitorQueue::Delete(name, file, invocation.type)) {
    return Fail(kExitRefused, "the library did not delete queue " + Quoted(name) + " from " +
                                  FileLabel(invocation, file));
  }
  const std::string path = MonitorQueue::GetConfDir(invocation.type) + "/" + file;
  if (invocation.json) {
    Json::Value result = WriteResult(invocation, file, path, name);
    result["removed"] = present;
    WriteJson(std::cout, result);
  } else if (present) {
    std::cout << "removed queue " << Quoted(name) << " from " << Printable(path) << '\n';
  } else {
    std::cout << "no queue " << Quoted(name) << " in " << Printable(path) << "; nothing changed\n";
  }
  return kExitOk;
}

int RunCatalogue(const Invocation& invocation) {
  std::vector<TypedQueue> queues;
  int status = kExitOk;
  if (!LoadCatalogueOrFail(&queues, &status)) return status;
  if (invocation.json) {
    Json::Value array(Json::arrayValue);
    for (const TypedQueue& entry : queues) {
      Json::Value object = entry.queue.ToJson();
      object["type"] = QueueTypeName(entry.type);
      array.append(object);
    }
    WriteJson(std::cout, array);
    return kExitOk;
  }
  Table table({"TYPE", "QUEUE", "PATH", "MASK", "IGNORE"});
  for (const TypedQueue& entry : queues) {
    AddQueueRows(&table, {QueueTypeName(entry.type)}, entry.queue);
  }
  PrintTableOrNone(table, "(no queues)");
  return kExitOk;
}

int RunMatch(const Invocation& invocation) {
  const std::string& path = invocation.args[0];
  unsigned int mask = 0;
  if (!ParseMask(invocation.args[1], &mask)) {
    return Fail(kExitUsage, "MASK \"" + invocation.args[1] +
                                "\" is not a 32-bit mask in decimal or 0x hexadecimal");
  }
  std::vector<TypedQueue> queues;
  int status = kExitOk;
  if (!LoadCatalogueOrFail(&queues, &status)) return status;
  Json::Value matches(Json::arrayValue);
  Table table({"TYPE", "QUEUE"});
  std::vector<size_t> wanting;
  CatalogueIndex(queues).Match(path, mask, wanting);
  for (size_t i : wanting) {
    const TypedQueue& entry = queues[i];
    Json::Value match(Json::objectValue);
    match["type"] = QueueTypeName(entry.type);
    match["queue"] = entry.queue._name;
    matches.append(match);
    table.AddRow({QueueTypeName(entry.type), Printable(entry.queue._name)});
  }
  if (invocation.json) {
    Json::Value result(Json::objectValue);
    result["path"] = path;
    result["mask"] = mask;
    result["queues"] = matches;
    WriteJson(std::cout, result);
  } else {
    PrintTableOrNone(table, "(no queue wants this event)");
  }
  return kExitOk;
}

int RunDirs(const Invocation& invocation) {
  const std::string& dir = invocation.args[0];
  std::vector<TypedQueue> queues;
  int status = kExitOk;
  if (!LoadCatalogueOrFail(&queues, &status)) return status;
  // The union over the catalogue is the index's; the rows name each queue.
  const unsigned int all = CatalogueIndex(queues).GetUnionMask(dir);
  Json::Value watchers(Json::arrayValue);
  Table table({"TYPE", "QUEUE", "MASK"});
  for (const TypedQueue& entry : queues) {
    if (!entry.queue.IsDirMonitoring(dir)) continue;
    const unsigned int mask = entry.queue.GetUnionMask(dir);
    Json::Value watcher(Json::objectValue);
    watcher["type"] = QueueTypeName(entry.type);
    watcher["queue"] = entry.queue._name;
    watcher["mask"] = mask;
    watchers.append(watcher);
    table.AddRow({QueueTypeName(entry.type), Printable(entry.queue._name), FormatMask(mask)});
  }
  if (invocation.json) {
    Json::Value result(Json::objectValue);
    result["dir"] = dir;
    result["mask"] = all;
    result["queues"] = watchers;
    WriteJson(std::cout, result);
    return kExitOk;
  }
  PrintTableOrNone(table, "(no queue watches this directory or below it)");
  std::cout << "union mask: " << FormatMask(all) << '\n';
  return kExitOk;
}

int RunShares(const Invocation& invocation) {
  std::vector<MonitorQueue> queues;
  if (!MonitorQueue::LoadAll(queues)) {
    return Fail(kExitRefused, "cannot read the catalogue (see the library's message above)");
  }
  const std::set<std::string> shares = MonitorQueue::GetShareSet(queues);
  if (invocation.json) {
    Json::Value array(Json::arrayValue);
    for (const std::string& share : shares) array.append(share);
    WriteJson(std::cout, array);
    return kExitOk;
  }
  Table table({"SHARE"});
  for (const std::string& share : shares) table.AddRow({Printable(share)});
  PrintTableOrNone(table, "(no shares)");
  return kExitOk;
}

}  // namespace zorvnotifyctl
