// The commands of zorvnotifyctl.  Each writes its result to standard output
// (a table, or JSON with --json) and its complaints to standard error, and
// returns the process exit status.
#ifndef ZORVNOTIFYD_TOOLS_COMMANDS_H_
#define ZORVNOTIFYD_TOOLS_COMMANDS_H_

#include <cstdint>
#include <string>
#include <vector>

#include "queue_types.h"

namespace zorvnotifyctl {

using zorvcommon::kAllQueueTypes;
using zorvcommon::ParseQueueType;
using zorvcommon::QueueType;
using zorvcommon::QueueTypeName;

// Exit statuses of the tool.
enum ExitStatus : int {
  kExitOk = 0,        // done
  kExitRefused = 1,   // the library or zorvnotifyd refused or failed, or is not running
  kExitUsage = 2,     // bad command line or invalid input; nothing was changed
  kExitBusy = 75,     // the store lock stayed held by another writer: try again (EX_TEMPFAIL)
  kExitNotRoot = 77,  // not run by root, or run set-user-ID: nothing was read (EX_NOPERM)
};

// What a command runs with.  The caller has checked the number of
// arguments; the commands check their content.
struct Invocation {
  std::vector<std::string> args;  // the positional arguments after the command
  QueueType type = ZORV::ZORVNOTIFYD::MONITOR_QUEUE_TYPE_ETC_DIR;  // --type (default etc)
  bool json = false;                                               // --json
  bool type_given = false;   // --type appeared (watch filters by type only then)
  bool since_given = false;  // --since appeared
  uint64_t since = 0;        // its sequence number
  std::string socket;        // the daemon's socket
  unsigned wait = 10;        // --wait: seconds upsert and delete retry while the store is busy
};

// Writes "zorvnotifyctl: " and |message| as one line to standard error and
// returns |status|.
int Fail(int status, const std::string& message);

// True once upsert or delete has stored its change (also when writing its
// report fails afterwards).
bool StoreChanged();

// list FILE: the queues of one queue file.
int RunList(const Invocation& invocation);
// get NAME FILE: the first queue of that name in one queue file.
int RunGet(const Invocation& invocation);
// upsert FILE [SOURCE]: stores the queue object read from SOURCE (a file,
// or standard input when SOURCE is absent or "-").
int RunUpsert(const Invocation& invocation);
// delete NAME FILE: removes the first queue of that name from a queue file.
int RunDelete(const Invocation& invocation);
// catalogue: every queue of every type.
int RunCatalogue(const Invocation& invocation);
// match PATH MASK: the queues that want an event of kinds MASK on PATH.
int RunMatch(const Invocation& invocation);
// dirs DIR: the queues that watch DIR or below it, with their union masks.
int RunDirs(const Invocation& invocation);
// shares: the share set of the catalogue.
int RunShares(const Invocation& invocation);
// watch QUEUE [FILE]: subscribes to the queue at the daemon and prints its
// events and notices, one line each as they come, until SIGINT or SIGTERM
// (exit status 0) or until the daemon ends the connection (1).
int RunWatch(const Invocation& invocation);
// status: the daemon's counters.
int RunStatus(const Invocation& invocation);

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_COMMANDS_H_
