// The commands of zorvnotifyctl, built on the public API of libzorvnotifyd.

#include "commands.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <sys/signalfd.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <functional>
#include <iostream>
#include <memory>
#include <set>

#include "bounded_read.h"
#include "catalogue_view.h"
#include "daemon_client.h"
#include "event_names.h"
#include "json_bytes.h"
#include "json_output.h"
#include "library_log.h"
#include "lock_holder.h"
#include "masks.h"
#include "monitor_queue.h"
#include "monitor_queue_index.h"
#include "monitor_queue_subscription.h"
#include "queue_file_name.h"
#include "queue_files.h"
#include "queue_object.h"
#include "table.h"
#include "unique_fd.h"

namespace zorvnotifyctl {
namespace {

using ZORV::ZORVNOTIFYD::MonitorQueue;
using ZORV::ZORVNOTIFYD::MonitorQueueEvent;
using ZORV::ZORVNOTIFYD::MonitorQueueIndex;
using ZORV::ZORVNOTIFYD::MonitorQueueSubscription;
using zorvcommon::Quoted;

// Set once an upsert or delete has been stored.
bool g_store_changed = false;

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

// Why nothing could be written in the configuration directory of |type|,
// when its file system says so: ": the file system holding DIR is
// read-only" or "... is full"; otherwise "" (the library's lines say why).
std::string WhyNotWritten(QueueType type) {
  const std::string dir = MonitorQueue::GetConfDir(type);
  struct statvfs fs;
  if (statvfs(dir.c_str(), &fs) != 0) return "";
  if (fs.f_flag & ST_RDONLY) return ": the file system holding " + Printable(dir) + " is read-only";
  if (fs.f_bavail == 0 || fs.f_favail == 0) {
    return ": the file system holding " + Printable(dir) + " is full";
  }
  return "";
}

// Runs |store| (one Upsert or Delete of the library) until it succeeds,
// fails for a reason other than the store lock held by another writer, or
// |invocation.wait| seconds have passed.  Each call is a whole load, change
// and save under the lock, so calling it again is safe.  Returns true when
// stored; otherwise |status| is set: kExitBusy, with the lock's holder
// named, when the lock stayed held (the library's own "Lock failed" lines
// are then left out), else kExitRefused with |failure| (the library's
// message precedes it), also at once, with what stands there, when
// something other than a regular file was planted at the lock's path.
bool StoreWithRetry(const Invocation& invocation, const std::function<bool()>& store,
                    const std::string& failure, int* status) {
  using Clock = std::chrono::steady_clock;
  const Clock::time_point deadline = Clock::now() + std::chrono::seconds(invocation.wait);
  for (;;) {
    ResetLibraryLog(true);
    const bool stored = store();
    const bool busy = !stored && LibraryReportedLockFailure();
    const bool service_failed = LibraryReportedServiceFailure();
    ResetLibraryLog(false);
    if (stored) {
      g_store_changed = true;
      if (service_failed) {
        Fail(kExitOk,
             "the change is stored, but the service manager could not be asked to start or "
             "stop zorvnotifyd (systemctl is missing or failed); run \"systemctl start "
             "zorvnotifyd\" or \"systemctl stop zorvnotifyd\" as needed");
      }
      return true;
    }
    if (!busy) {
      *status = Fail(kExitRefused, failure + WhyNotWritten(invocation.type));
      return false;
    }
    // Something planted at the lock's fixed path is never locked by anyone:
    // waiting would not help, so the writer says what is there at once.
    const std::string planted = PlantedLockFile(kStoreLockFile);
    if (!planted.empty()) {
      *status =
          Fail(kExitRefused, failure + ": the store lock " + kStoreLockFile + " is " + planted +
                                 ", which the library never opens: nobody holds the store "
                                 "lock; root should remove it (rm -r " +
                                 kStoreLockFile + ") and try again");
      return false;
    }
    if (Clock::now() >= deadline) break;
    usleep(100000);
  }
  const std::string holder = LockHolder(kStoreLockFile);
  *status = Fail(kExitBusy, failure + ": the store lock " + kStoreLockFile + " was held by " +
                                (holder.empty() ? "another writer" : holder) + " for " +
                                std::to_string(invocation.wait) +
                                " s (--wait); nothing was changed, try again");
  return false;
}

// Reads the whole of |source| ("-" is standard input) into |text|, within
// the size of the largest queue file: a source that holds more (a device
// such as /dev/zero included) is refused once that much has been read.
// A fifo named as |source| is read as the user asked, until its writer ends.
bool ReadSource(const std::string& source, std::string* text, std::string* error) {
  const bool stdin_source = source == "-";
  const std::string name = stdin_source ? "standard input" : zorvcommon::Printable(source);
  const zorvcommon::UniqueFd opened(stdin_source ? -1 : open(source.c_str(), O_RDONLY | O_CLOEXEC));
  const int fd = stdin_source ? STDIN_FILENO : opened.get();
  struct stat st;
  if (fd < 0 || fstat(fd, &st) != 0) {
    *error = "cannot open " + name + ": " + strerror(errno);
    return false;
  }
  if (S_ISDIR(st.st_mode)) {
    *error = "cannot read " + name + ": it is a directory";
    return false;
  }
  switch (zorvcommon::ReadAtMost(fd, zorvcommon::kMaxQueueFileSize, text)) {
    case zorvcommon::BoundedRead::kWhole:
      return true;
    case zorvcommon::BoundedRead::kTooLarge:
      *error =
          "cannot read " + name + ": it holds more than 16 MiB, the most a queue file may hold";
      return false;
    default:
      *error = "cannot read " + name + ": " + strerror(errno);
      return false;
  }
}

// The index over the queues of |queues|, in the same order.
MonitorQueueIndex CatalogueIndex(const std::vector<TypedQueue>& queues) {
  std::vector<MonitorQueue> plain;
  plain.reserve(queues.size());
  for (const TypedQueue& entry : queues) plain.push_back(entry.queue);
  return MonitorQueueIndex(plain);
}

// Loads the catalogue with types, or reports the failure (exit status 1).
// When a queue file was refused or read only in part (each said on
// standard error), returns true with |status| set to kExitRefused: what
// loaded is still shown, and the status tells that it is not all.
bool LoadCatalogueOrFail(std::vector<TypedQueue>* queues, int* status) {
  bool complete = true;
  if (LoadCatalogue(queues, &complete)) {
    if (!complete) *status = kExitRefused;
    return true;
  }
  *status = Fail(kExitRefused, "cannot read the catalogue (see the message above)");
  return false;
}

// Refuses the queue file |file| of |invocation.type| when root alone does
// not control it (exit status 1).  A missing file passes: it holds no queues.
bool CheckTrusted(const Invocation& invocation, const std::string& file, int* status) {
  const std::string dir = MonitorQueue::GetConfDir(invocation.type);
  struct stat st;
  if (lstat((dir + "/" + file).c_str(), &st) != 0 && errno == ENOENT) return true;
  const std::string why = zorvcommon::UntrustedQueueFile(dir, file);
  if (why.empty()) return true;
  *status = Fail(kExitRefused, RefusedQueueFile(dir + "/" + file, why));
  return false;
}

// Blocks SIGINT and SIGTERM for the rest of the process's life (unblocking
// them would deliver a pending one with its default action) and reads them
// from fd (-1, with the signals left alone, when no signalfd could be made),
// so that a watch stops between two lines, never in the middle of one.
struct StopSignals {
  StopSignals() {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGINT);
    sigaddset(&set, SIGTERM);
    sigset_t old;
    if (sigprocmask(SIG_BLOCK, &set, &old) != 0) return;
    fd = signalfd(-1, &set, SFD_CLOEXEC);
    if (fd < 0) sigprocmask(SIG_SETMASK, &old, nullptr);
  }
  ~StopSignals() {
    if (fd >= 0) close(fd);
  }
  int fd = -1;
};

// |value| as one line of JSON, with UTF-8 as it is.
std::string JsonLine(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  return Json::writeString(builder, value);
}

// A string of the daemon's JSON as text: each "\udcXY" escape, which the
// JSON reader turns into the UTF-8 form of a lone surrogate, becomes its
// byte again, which Printable writes as "\udcXY" (valid UTF-8 naming it).
std::string Shown(const Json::Value& value) {
  return Printable(zorvcommon::DecodeRawBytes(value.asString()));
}

// Parses one line from the daemon; false when it is not a JSON object.
bool ParseLine(const std::string& line, Json::Value* value) {
  static const std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
  return reader->parse(line.data(), line.data() + line.size(), value, nullptr) && value->isObject();
}

// Connects to the daemon, sends |request| and reads the first line of the
// answer, parsed into |reply|: an object whose "reply" is |kind|.  A refusal
// ({"error": ...}) or anything else is reported (exit status 1).
bool Ask(DaemonClient* client, const Invocation& invocation, const Json::Value& request,
         const char* kind, int timeout_ms, Json::Value* reply, std::string* line, int* status) {
  std::string error;
  if (!client->Connect(invocation.socket, &error)) {
    *status = Fail(kExitRefused, error);
    return false;
  }
  // A refused peer gets its error line and is let go before the request is
  // read: the line is looked for even when sending failed.
  const bool sent = client->Send(JsonLine(request), &error);
  switch (client->ReadLine(line, timeout_ms, &error)) {
    case DaemonClient::Read::kLine:
      break;
    case DaemonClient::Read::kClosed:
      if (sent) error = "zorvnotifyd closed the connection without answering";
      [[fallthrough]];
    default:
      *status = Fail(kExitRefused, error);
      return false;
  }
  if (!ParseLine(*line, reply)) {
    *status = Fail(kExitRefused, "zorvnotifyd answered with something other than a JSON object: " +
                                     Printable(*line));
    return false;
  }
  const Json::Value& answer = *reply;  // read only: no member is added
  const Json::Value& refusal = answer["error"];
  if (refusal.isString()) {
    *status = Fail(kExitRefused, "zorvnotifyd refused: " + Shown(refusal));
    return false;
  }
  if (answer["reply"] != kind) {
    *status = Fail(kExitRefused, "unexpected answer from zorvnotifyd: " + Printable(*line));
    return false;
  }
  return true;
}

// "QUEUE [TYPE/FILE]" for a line about one queue; false when the line does
// not name one.
bool QueueLabel(const Json::Value& value, std::string* label) {
  const Json::Value& queue = value["queue"];
  const Json::Value& type = value["type"];
  const Json::Value& file = value["file"];
  if (!queue.isString() || !type.isString() || !file.isString()) return false;
  *label = Shown(queue) + " [" + Shown(type) + "/" + Shown(file) + "]";
  return true;
}

// The readable form of a record of a subscription.
std::string ReadableRecord(const MonitorQueueEvent& event) {
  std::string label = Printable(event._queue) + " [" + QueueTypeName(event._type) + "/" +
                      Printable(event._file) + "]";
  if (event._kind == MonitorQueueEvent::MISSED) {
    return label + " MISSED " + std::to_string(event._missed) + " events (no longer kept)";
  }
  label += " #" + std::to_string(event._seq) + " ";
  switch (event._kind) {
    case MonitorQueueEvent::EVENT:
      return label + zorvcommon::MaskNames(event._mask) + " " + Printable(event._path) +
             (event._offline ? " (offline: changed while zorvnotifyd was not watching)" : "");
    case MonitorQueueEvent::RESCAN:
      return label + "RESCAN " + Printable(event._path) + " (what changed there is not known)";
    case MonitorQueueEvent::LOST:
      return label + "LOST events may have been lost (inotify queue overflow)";
    case MonitorQueueEvent::REMOVED:
      return label + "removed from the catalogue";
    default:
      return label + "registered again";
  }
}

// The JSON line of a record the subscription made itself (a RESCAN of the
// whole trees after the daemon's journal changed), in the daemon's form
// without "seq".
std::string MadeRecordLine(const MonitorQueueEvent& event) {
  std::string line = "{\"queue\":";
  zorvcommon::AppendJsonString(&line, event._queue);
  line += ",\"type\":\"";
  line += QueueTypeName(event._type);
  line += "\",\"file\":";
  zorvcommon::AppendJsonString(&line, event._file);
  line += ",\"rescan\":";
  zorvcommon::AppendJsonString(&line, event._path);
  return line + "}";
}

// "watching QUEUE: TYPE/FILE (last #N), ...; journal ID", from the
// subscribe reply: with the journal id and the last number, a client
// resumes with --since after a restart of the daemon.
// Only the queues of |type| are named when it is not null.
std::string ReadableSubscription(const Json::Value& reply, const std::string& name,
                                 const char* type_only) {
  std::string queues;
  for (const Json::Value& queue : reply["queues"]) {
    const Json::Value& type = queue["type"];
    const Json::Value& file = queue["file"];
    const Json::Value& seq = queue["seq"];
    if (!type.isString() || !file.isString() || !seq.isUInt64()) continue;
    if (type_only != nullptr && type != type_only) continue;
    if (!queues.empty()) queues += ", ";
    queues += Shown(type) + "/" + Shown(file) + " (last #" + std::to_string(seq.asUInt64()) + ")";
  }
  const Json::Value& journal = reply["journal"];
  return "watching " + Printable(name) + ": " +
         (queues.empty() ? "not in the catalogue now; its events follow once it is registered"
                         : queues) +
         (journal.isString() ? "; journal " + Shown(journal) : "");
}

}  // namespace

bool StoreChanged() { return g_store_changed; }

int Fail(int status, const std::string& message) {
  std::cerr << "zorvnotifyctl: " << message << std::endl;
  return status;
}

int RunList(const Invocation& invocation) {
  const std::string& file = invocation.args[0];
  int status = kExitOk;
  if (!CheckFileName(file, &status) || !CheckTrusted(invocation, file, &status)) return status;
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
  if (!CheckFileName(file, &status) || !CheckTrusted(invocation, file, &status)) return status;
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
    return Fail(kExitUsage,
                "invalid queue object in " +
                    (source == "-" ? std::string("standard input") : Printable(source)) + ": " +
                    problem);
  }
  // A write keeps the file's other queues, in a file of root's alone: one
  // that others control would have theirs trusted from then on.
  if (!CheckTrusted(invocation, file, &status)) return status;
  const MonitorQueue queue(object);
  if (!StoreWithRetry(
          invocation, [&] { return MonitorQueue::Upsert(queue, file, invocation.type); },
          "the library did not store queue " + Quoted(queue._name) + " in " +
              FileLabel(invocation, file),
          &status)) {
    return status;
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
  if (!CheckFileName(file, &status) || !CheckTrusted(invocation, file, &status)) return status;
  // Whether the queue is there only shapes the report: the library treats
  // a missing name as success and so does the exit status.
  std::vector<MonitorQueue> before;
  bool present = false;
  if (MonitorQueue::List(before, file, invocation.type)) {
    for (const MonitorQueue& queue : before) present |= queue._name == name;
  }
  if (!StoreWithRetry(
          invocation, [&] { return MonitorQueue::Delete(name, file, invocation.type); },
          "the library did not delete queue " + Quoted(name) + " from " +
              FileLabel(invocation, file),
          &status)) {
    return status;
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
    return status;
  }
  Table table({"TYPE", "QUEUE", "PATH", "MASK", "IGNORE"});
  for (const TypedQueue& entry : queues) {
    AddQueueRows(&table, {QueueTypeName(entry.type)}, entry.queue);
  }
  PrintTableOrNone(table, "(no queues)");
  return status;
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
  return status;
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
    return status;
  }
  PrintTableOrNone(table, "(no queue watches this directory or below it)");
  std::cout << "union mask: " << FormatMask(all) << '\n';
  return status;
}

int RunShares(const Invocation& invocation) {
  std::vector<TypedQueue> typed;
  int status = kExitOk;
  if (!LoadCatalogueOrFail(&typed, &status)) return status;
  std::set<std::string> shares;
  for (const TypedQueue& entry : typed) entry.queue.CollectShareSet(shares);
  if (invocation.json) {
    Json::Value array(Json::arrayValue);
    for (const std::string& share : shares) array.append(share);
    WriteJson(std::cout, array);
    return status;
  }
  Table table({"SHARE"});
  for (const std::string& share : shares) table.AddRow({Printable(share)});
  PrintTableOrNone(table, "(no shares)");
  return status;
}

namespace {

// Why |subscription| lost the daemon, without the time-out Next adds.
std::string WhyAway(const MonitorQueueSubscription& subscription) {
  static const std::string kTimedOut = "timed out while reconnecting: ";
  const std::string& error = subscription.LastError();
  return Printable(
      error.compare(0, kTimedOut.size(), kTimedOut) == 0 ? error.substr(kTimedOut.size()) : error);
}

}  // namespace

int RunWatch(const Invocation& invocation) {
  const std::string& name = invocation.args[0];
  const bool has_file = invocation.args.size() > 1;
  int status = kExitOk;
  if (has_file && !CheckFileName(invocation.args[1], &status)) return status;
  const StopSignals stop;
  MonitorQueueSubscription subscription(invocation.socket);
  bool subscribed;
  if (has_file && invocation.since_given) {
    subscribed =
        subscription.Subscribe(name, invocation.type, invocation.args[1], invocation.since);
  } else if (has_file) {
    subscribed = subscription.Subscribe(name, invocation.type, invocation.args[1]);
  } else if (invocation.since_given) {
    subscribed = subscription.Subscribe(name, invocation.since);
  } else {
    subscribed = subscription.Subscribe(name);
  }
  Json::Value reply;
  const bool parsed = ParseLine(subscription.Reply(), &reply);
  if (!subscribed) {
    const Json::Value& answer = reply;  // read only: no member is added
    if (parsed && answer["error"].isString()) {
      return Fail(kExitRefused, "zorvnotifyd refused: " + Shown(answer["error"]));
    }
    // The tool's own words for a daemon that is not there or not root's.
    DaemonClient client;
    std::string error;
    if (!subscription.Connected() && !client.Connect(invocation.socket, &error)) {
      return Fail(kExitRefused, error);
    }
    return Fail(kExitRefused, "cannot subscribe: " + Printable(subscription.LastError()));
  }
  // With --type and no file every queue of the name is followed, and those
  // of other types are left out here.
  const char* type_only =
      invocation.type_given && !has_file ? QueueTypeName(invocation.type) : nullptr;
  std::string shown =
      invocation.json ? subscription.Reply() : ReadableSubscription(reply, name, type_only);
  // One line at a time, flushed, so that a reader sees each event as it
  // comes; a failed write is reported by main().
  if (!(std::cout << shown << '\n' << std::flush)) return kExitRefused;
  MonitorQueueEvent event;
  bool connected = true;
  for (;;) {
    while (subscription.Next(event, 0)) {
      if (!connected && subscription.Connected()) {
        connected = true;
        std::cerr << "zorvnotifyctl: zorvnotifyd is back; following again" << std::endl;
      }
      if (type_only != nullptr && event._type != invocation.type) continue;
      if (!invocation.json) {
        shown = ReadableRecord(event);
      } else if (subscription.Line().empty()) {
        shown = MadeRecordLine(event);
      } else {
        shown = subscription.Line();
      }
      if (!(std::cout << shown << '\n' << std::flush)) return kExitRefused;
    }
    if (connected != subscription.Connected()) {
      connected = !connected;
      std::cerr << "zorvnotifyctl: "
                << (connected ? "zorvnotifyd is back; following again"
                              : "zorvnotifyd went away (" + WhyAway(subscription) +
                                    "); following again once it is back")
                << std::endl;
    }
    // Readable when Next has something to do, the next reconnection
    // included; a stop signal ends the watch between two records.
    struct pollfd fds[2] = {{subscription.Fd(), POLLIN, 0}, {stop.fd, POLLIN, 0}};
    if (fds[0].fd < 0) {
      return Fail(kExitRefused,
                  "cannot wait for zorvnotifyd: " + Printable(subscription.LastError()));
    }
    if (poll(fds, 2, -1) < 0 && errno != EINTR) {
      return Fail(kExitRefused, std::string("cannot wait for zorvnotifyd: ") + strerror(errno));
    }
    if (fds[1].revents != 0) return kExitOk;
  }
}

int RunStatus(const Invocation& invocation) {
  // The daemon answers between two rounds of its event loop; a daemon that
  // does not answer in this long is reported rather than waited for.
  constexpr int kTimeoutMs = 30000;
  Json::Value request(Json::objectValue);
  request["request"] = "status";
  DaemonClient client;
  Json::Value reply;
  std::string line;
  int status = kExitOk;
  if (!Ask(&client, invocation, request, "status", kTimeoutMs, &reply, &line, &status)) {
    return status;
  }
  if (invocation.json) {
    WriteJson(std::cout, reply);
    return kExitOk;
  }
  const std::pair<const char*, const char*> rows[] = {
      {"directories", "directories watched"},
      {"queues", "queues"},
      {"clients", "clients"},
      {"events", "events handled"},
      {"overflows", "overflows (events lost)"},
      {"trees_missing", "trees missing"},
      {"directories_over_watch_limit", "directories over the watch limit"},
      {"run", "run id"},
      {"journal", "journal id"},
      {"state", "state"},
  };
  constexpr size_t kValueColumn = 34;  // the longest label and two blanks
  const Json::Value& answer = reply;   // read only: no member is added
  for (const auto& [key, label] : rows) {
    const Json::Value& value = answer[key];
    std::cout << label << std::string(kValueColumn - strlen(label), ' ')
              << (value.isUInt64()   ? std::to_string(value.asUInt64())
                  : value.isString() ? Shown(value)
                                     : "-")
              << '\n';
  }
  // Each queue's journal: the records it holds, and whether it is written.
  Table journals({"JOURNAL", "FIRST", "LAST", "BYTES", "STATE"});
  for (const Json::Value& journal : answer["journals"]) {
    std::string label;
    if (!QueueLabel(journal, &label)) continue;
    const auto number = [&journal](const char* key) {
      const Json::Value& value = journal[key];
      return value.isUInt64() ? std::to_string(value.asUInt64()) : std::string("-");
    };
    journals.AddRow({label, number("first"), number("last"), number("bytes"),
                     journal["healthy"] == false ? "degraded" : "ok"});
  }
  if (!answer["journals"].empty()) {
    std::cout << '\n';
    journals.Print(std::cout);
  }
  // Which backend watches each tree, and why.
  Table trees({"TREE", "BACKEND", "WHY"});
  for (const Json::Value& tree : answer["trees"]) {
    if (!tree.isObject() || !tree["path"].isString()) continue;
    trees.AddRow({Shown(tree["path"]), tree["backend"].isString() ? Shown(tree["backend"]) : "-",
                  tree["why"].isString() ? Shown(tree["why"]) : ""});
  }
  if (!answer["trees"].empty()) {
    std::cout << '\n';
    trees.Print(std::cout);
  }
  return kExitOk;
}

}  // namespace zorvnotifyctl
