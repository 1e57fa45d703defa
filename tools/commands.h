// The commands of zorvnotifyctl.  Each writes its result to standard output
// (a table, or JSON with --json) and its complaints to standard error, and
// returns the process exit status.
#ifndef ZORVNOTIFYD_TOOLS_COMMANDS_H_
#define ZORVNOTIFYD_TOOLS_COMMANDS_H_

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
  kExitOk = 0,       // done
  kExitRefused = 1,  // the library refused or failed (its log lines say why)
  kExitUsage = 2,    // bad command line or invalid input; nothing was changed
};

// What a command runs with.  The caller has checked the number of
// arguments; the commands check their content.
struct Invocation {
  std::vector<std::string> args;  // the positional arguments after the command
  QueueType type;                 // the queue type of --type (default etc)
  bool json;                      // --json
};

// Writes "zorvnotifyctl: " and |message| as one line to standard error and
// returns |status|.
int Fail(int status, const std::string& message);

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

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_COMMANDS_H_
