// zorvnotifyctl: inspects and edits the catalogue of monitor queues of the
// zorvnotifyd daemon through the public API of libzorvnotifyd, and asks the
// running daemon for events and counters over its Unix socket.
//
// Exit status: 0 done (for watch: stopped by SIGINT or SIGTERM), 1 the
// library or the daemon refused or failed, the daemon is not running, a
// queue file was refused or not read completely, or something other than a
// file stands at the store lock's path, 2 bad command line or invalid input
// (nothing was changed), 75 the store lock stayed held by another writer
// (try again), 77 not run by root.  The library's own log lines go to
// standard error as well as to syslog.

#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <iostream>
#include <string>

#include "command_line.h"
#include "commands.h"
#include "monitor_queue.h"
#include "queue_types.h"

namespace zorvnotifyctl {
namespace {

// What a command takes beyond --json (and --socket, which every command
// accepts and watch and status use).
enum Takes : unsigned {
  kNoOption = 0,
  kFileType = 1,    // --type: the type of its one queue file (default etc)
  kTypeFilter = 2,  // --type: only queues of that type
  kSince = 4,       // --since
  kDaemon = 8,      // asks the daemon (the usage line shows --socket)
  kWait = 16,       // --wait: changes the store
};

// One command: its arguments, the options it takes, what runs it, and its
// help.
struct CommandInfo {
  const char* name;
  size_t min_args;
  size_t max_args;
  unsigned takes;
  int (*run)(const Invocation&);
  const char* synopsis;     // the arguments, e.g. "NAME FILE"
  const char* description;  // the paragraph of its --help
};

constexpr CommandInfo kCommands[] = {
    {"list", 1, 1, kFileType, RunList, "FILE",
     "Shows the queues of queue file FILE of the chosen type, in file order.  A file\n"
     "that does not exist holds no queues.  With --json: the queues as a JSON array\n"
     "in the file's own form.  A file that root alone does not control (its owner,\n"
     "or write permission for group or others on it or a directory above it) is\n"
     "refused with exit status 1, as it is by get, upsert and delete.\n"},
    {"get", 2, 2, kFileType, RunGet, "NAME FILE",
     "Shows the first queue named NAME (exactly, case included) of queue file FILE.\n"
     "Exit status 1 when the file holds no such queue.  With --json: the queue\n"
     "object, which upsert accepts back.\n"},
    {"upsert", 1, 2, kFileType | kWait, RunUpsert, "FILE [SOURCE]",
     "Stores one queue object, read from SOURCE (a file; standard input when SOURCE\n"
     "is absent or \"-\"), in queue file FILE: it replaces the first queue of the\n"
     "same name or is appended.  The library then asks for the service zorvnotifyd\n"
     "to be started.  The object must look like\n"
     "  {\"queue\": \"NAME\", \"config\": [{\"path\": \"/DIR\", \"mask\": 258,\n"
     "                                 \"ignore\": [\"\\\\.tmp$\"]}]}\n"
     "with \"queue\" a string, each \"path\" a string, each \"mask\" an integer from 0\n"
     "to 4294967295 and \"ignore\" (optional) an array of POSIX extended regular\n"
     "expressions.  Each \"path\" must be an absolute directory written the way the\n"
     "daemon reports paths, from real directory names: \"/srv/share\", not\n"
     "\"/srv/share/\", \"/srv//share\", \"/srv/./share\" or \"/srv/x/../share\".  Such a\n"
     "path, a relative or empty one, or \"/\" alone could never match an event.\n"
     "Unknown keys, wrong types, missing keys, such paths and patterns that do not\n"
     "compile are refused with exit status 2, before anything is written; for a\n"
     "path the message says how to write it.  At most 16 MiB of SOURCE are read; a\n"
     "larger source is refused with exit status 2.\n"},
    {"delete", 2, 2, kFileType | kWait, RunDelete, "NAME FILE",
     "Removes the first queue named NAME from queue file FILE.  A name the file does\n"
     "not hold changes nothing and is not an error.  When no queue is left in the\n"
     "whole catalogue, the library asks for the service zorvnotifyd to be stopped.\n"},
    {"catalogue", 0, 0, kNoOption, RunCatalogue, "",
     "Shows every queue of every type (share, etc, local-etc), with its type.\n"
     "With --json: an array of queue objects, each with an added \"type\".  A queue\n"
     "file that cannot be read completely, or that root alone does not control\n"
     "(refused whole), is named on standard error with why; what loaded is shown\n"
     "and the exit status is 1.  Likewise for match, dirs and shares.\n"},
    {"match", 2, 2, kNoOption, RunMatch, "PATH MASK",
     "Shows the queues of the catalogue that want an event of the kinds MASK on\n"
     "PATH: some configuration shares a bit with MASK, PATH is its directory or\n"
     "below it, and none of its ignore patterns matches PATH.  MASK is decimal or\n"
     "hexadecimal after 0x.\n"},
    {"dirs", 1, 1, kNoOption, RunDirs, "DIR",
     "Shows the queues of the catalogue that watch DIR itself or a directory below\n"
     "it, each with the union of the masks of those configurations, and the union\n"
     "of all of them: the event kinds a watch on DIR must report.\n"},
    {"shares", 0, 0, kNoOption, RunShares, "",
     "Shows the share set of the catalogue: the distinct first two components\n"
     "(such as /vol/share) of the absolute paths the queues watch.\n"},
    {"watch", 1, 2, kTypeFilter | kSince | kDaemon, RunWatch, "QUEUE [FILE]",
     "Subscribes to the queues named QUEUE at the running daemon zorvnotifyd (only\n"
     "those of queue file FILE when given, only those of type TYPE when --type is\n"
     "given) and shows their events as they happen, one line each, e.g.\n"
     "  backup [etc/nas] #12 IN_CREATE|IN_ISDIR /vol/share/docs\n"
     "with the queue's sequence number of each event, and its notices:\n"
     "  backup [etc/nas] #13 IN_DELETE /vol/share/a (offline: changed while\n"
     "      zorvnotifyd was not watching)\n"
     "  backup [etc/nas] #14 RESCAN /vol/share (what changed there is not known)\n"
     "  backup [etc/nas] #15 removed from the catalogue\n"
     "  backup [etc/nas] #16 registered again\n"
     "  backup [etc/nas] MISSED 40 events (no longer kept)\n"
     "The first line names the queues subscribed to, the number of their last\n"
     "event and the daemon's journal id.  Without --since, events from now on;\n"
     "with --since N, first every event after number N the daemon's journal\n"
     "still keeps, across restarts of the daemon while the journal id stays the\n"
     "same (a new id: rescan, the numbers start afresh).  Runs until SIGINT or SIGTERM\n"
     "(exit status 0); when the daemon goes away it says so on standard error,\n"
     "connects again (100 ms, doubling up to 5 s) and goes on after the last event\n"
     "shown of each queue.\n"
     "With --json: the subscription's reply, then the daemon's lines as they are,\n"
     "one JSON object per line.\n"},
    {"status", 0, 0, kDaemon, RunStatus, "",
     "Shows the counters of the running daemon zorvnotifyd: directories watched,\n"
     "queues, clients, events handled, overflows (events lost), trees missing,\n"
     "directories over the watch limit, the id of its run, its journal id and the\n"
     "state's health (ok, degraded while a journal cannot be written), then each\n"
     "queue's journal: first and last numbers kept, bytes.  With --json: the\n"
     "daemon's reply object.\n"},
};

const char kProgram[] = "zorvnotifyctl";

const char kOverview[] =
    "Inspects or edits the catalogue of monitor queues of the zorvnotifyd daemon.\n"
    "\n"
    "Commands on one queue file (of the type given by --type):\n"
    "  list FILE              show the queues of queue file FILE\n"
    "  get NAME FILE          show the queue NAME of queue file FILE\n"
    "  upsert FILE [SOURCE]   store the queue object of SOURCE (default: stdin)\n"
    "  delete NAME FILE       remove the queue NAME from queue file FILE\n"
    "Commands on the whole catalogue:\n"
    "  catalogue              show every queue of every type\n"
    "  match PATH MASK        show the queues that want an event MASK on PATH\n"
    "  dirs DIR               show the queues that watch DIR or below, and their masks\n"
    "  shares                 show the share set of the catalogue\n"
    "Commands on the running daemon:\n"
    "  watch QUEUE [FILE]     show the events of queue QUEUE as they happen\n"
    "  status                 show the daemon's counters\n"
    "\n"
    "  help [COMMAND]         show this text, or the help of COMMAND\n"
    "\n"
    "Options (anywhere on the line):\n"
    "  -t, --type TYPE   queue type of FILE: share, etc (default) or local-etc;\n"
    "                    for watch, only queues of that type\n"
    "      --json        write JSON instead of tables\n"
    "      --since N     watch: first the kept events after number N\n"
    "      --wait SECONDS  upsert, delete: retry this long while another writer\n"
    "                    holds the store lock (default 10; 0: no retry)\n"
    "      --socket PATH the daemon's socket, for watch and status\n"
    "                    (default /run/zorvnotifyd/zorvnotifyd.sock)\n"
    "  -v, --verbose     also show the library's detailed log lines\n"
    "  -h, --help        show help; after a command, that command's help\n"
    "      --version     show the version and exit\n"
    "\n"
    "FILE is a plain name inside the configuration directory of the type, not\n"
    "beginning with \".\".  The store operations and the daemon's socket need root;\n"
    "the tool refuses to run set-user-ID.\n"
    "Exit status: 0 done, 1 the library or the daemon refused or failed, the\n"
    "daemon is not running, a queue file was refused or not read completely, or\n"
    "something other than a file stands at the store lock's path, 2 bad usage or\n"
    "input, 75 the store lock stayed busy (try again), 77 not run by root.\n"
    "See zorvnotifyctl(1).\n";

const CommandInfo* FindCommand(const std::string& name) {
  for (const CommandInfo& info : kCommands) {
    if (name == info.name) return &info;
  }
  return nullptr;
}

std::string UsageLine(const CommandInfo& info) {
  std::string line = std::string("Usage: ") + kProgram;
  if (info.takes & kDaemon) line += " [--socket PATH]";
  if (info.takes & (kFileType | kTypeFilter)) line += " [--type TYPE]";
  if (info.takes & kSince) line += " [--since N]";
  if (info.takes & kWait) line += " [--wait SECONDS]";
  line += " [--json] ";
  line += info.name;
  if (*info.synopsis != '\0') line += std::string(" ") + info.synopsis;
  return line;
}

void PrintOverview(std::ostream& out) {
  out << "Usage: " << kProgram << " [OPTIONS] COMMAND [ARGS]\n\n" << kOverview;
}

void PrintCommandHelp(const CommandInfo& info, std::ostream& out) {
  out << UsageLine(info) << "\n\n" << info.description;
  if (info.takes & kFileType) out << "\nTYPE is share, etc (default) or local-etc.\n";
  if (info.takes & kTypeFilter) out << "\nTYPE is share, etc or local-etc.\n";
}

// The longest --wait: one day.
constexpr uint64_t kMaxWait = 86400;

// Parses a decimal number of up to 64 bits, digits only.
bool ParseDecimal(const std::string& text, uint64_t* since) {
  if (text.empty() || text.find_first_not_of("0123456789") != std::string::npos) return false;
  errno = 0;
  const unsigned long long value = strtoull(text.c_str(), nullptr, 10);
  if (errno == ERANGE) return false;
  *since = value;
  return true;
}

// Why the tool must not run |info| with the process's ids; "" when it may.
// Installed set-user-ID or set-group-ID, the tool would open any file the
// caller names with raised ids (and quote its contents in messages) and let
// any user change any queue, so it refuses whenever the real user is not
// root and its ids differ from the caller's.  A non-root caller running it
// plainly may still ask the daemon, whose socket may admit its group;
// every store command needs root.  Nothing has been read or changed yet.
std::string PrivilegeRefusal(const CommandInfo& info) {
  const uid_t uid = getuid();
  if (uid == 0) return std::string();
  const bool set_id = geteuid() != uid || getegid() != getgid();
  if (!set_id && (info.takes & kDaemon)) return std::string();
  return "must be run as root (real user id " + std::to_string(uid) + ")" +
         (set_id ? "; it is not meant to be installed set-user-ID or set-group-ID" : "");
}

int UsageError(const std::string& message) {
  Fail(kExitUsage, message);
  std::cerr << "Try '" << kProgram << " --help'.\n";
  return kExitUsage;
}

// "help [COMMAND]", "--help" and "COMMAND --help".
int RunHelp(const CommandLine& line) {
  const bool help_command = line.command == "help";
  const std::string topic =
      help_command ? (line.args.empty() ? std::string() : line.args[0]) : line.command;
  if (help_command && line.args.size() > 1) return UsageError("help takes at most one COMMAND");
  if (topic.empty()) {
    PrintOverview(std::cout);
    return kExitOk;
  }
  const CommandInfo* info = FindCommand(topic);
  if (info == nullptr) return UsageError("unknown command \"" + topic + "\"");
  PrintCommandHelp(*info, std::cout);
  return kExitOk;
}

int Dispatch(int argc, char** argv) {
  CommandLine line;
  const std::string error = ParseCommandLine(argc, argv, &line);
  if (!error.empty()) return UsageError(error);
  if (line.version) {
    std::cout << kProgram << ' ' << ZORVNOTIFYD_VERSION_STRING << '\n';
    return kExitOk;
  }
  if (line.help || line.command == "help") return RunHelp(line);
  if (line.command.empty()) {
    PrintOverview(std::cerr);
    return kExitUsage;
  }
  const CommandInfo* info = FindCommand(line.command);
  if (info == nullptr) return UsageError("unknown command \"" + line.command + "\"");
  const std::string refusal = PrivilegeRefusal(*info);
  if (!refusal.empty()) return Fail(kExitNotRoot, refusal);
  if (line.args.size() < info->min_args || line.args.size() > info->max_args) {
    Fail(kExitUsage, std::string(info->name) + ": wrong number of arguments");
    std::cerr << UsageLine(*info) << '\n';
    return kExitUsage;
  }
  Invocation invocation;
  invocation.args = line.args;
  invocation.json = line.json;
  invocation.socket = line.socket;
  invocation.type_given = line.type_given;
  if (line.type_given) {
    if (!(info->takes & (kFileType | kTypeFilter))) {
      return UsageError(std::string("--type does not apply to ") + info->name +
                        (info->takes & kDaemon ? "" : ", which covers every type"));
    }
    if (!ParseQueueType(line.type, &invocation.type)) {
      return UsageError("unknown queue type \"" + line.type + "\" (use share, etc or local-etc)");
    }
  }
  if (line.since_given) {
    if (!(info->takes & kSince))
      return UsageError(std::string("--since does not apply to ") + info->name);
    if (!ParseDecimal(line.since, &invocation.since)) {
      return UsageError("--since \"" + line.since +
                        "\" is not a sequence number (0 to 18446744073709551615)");
    }
    invocation.since_given = true;
  }
  if (line.wait_given) {
    if (!(info->takes & kWait))
      return UsageError(std::string("--wait does not apply to ") + info->name);
    uint64_t seconds = 0;
    if (!ParseDecimal(line.wait, &seconds) || seconds > kMaxWait) {
      return UsageError("--wait \"" + line.wait + "\" is not a number of seconds (0 to " +
                        std::to_string(kMaxWait) + ")");
    }
    invocation.wait = static_cast<unsigned>(seconds);
  }
  if (line.verbose) ZORV::ZORVNOTIFYD::LOG_LEVEL = 7;
  return info->run(invocation);
}

}  // namespace
}  // namespace zorvnotifyctl

int main(int argc, char** argv) {
  // The library logs through syslog and never opens the log itself;
  // LOG_PERROR puts its lines on standard error too, where the user sees
  // why an operation was refused.
  openlog("zorvnotifyctl", LOG_PERROR, LOG_USER);
  int status;
  try {
    status = zorvnotifyctl::Dispatch(argc, argv);
  } catch (const std::exception& e) {
    status = zorvnotifyctl::Fail(zorvnotifyctl::kExitRefused,
                                 std::string("unexpected failure: ") + e.what());
  }
  std::cout.flush();
  if (!std::cout && zorvnotifyctl::StoreChanged()) {
    // The change is made: a report that could not be written does not undo it.
    zorvnotifyctl::Fail(status,
                        "the change is stored, but its report could not be written to "
                        "standard output");
  } else if (!std::cout) {
    status = zorvnotifyctl::Fail(zorvnotifyctl::kExitRefused, "cannot write the output");
  }
  closelog();
  return status;
}
