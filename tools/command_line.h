// The command line of zorvnotifyctl: global options, the command and its
// positional arguments.
#ifndef ZORVNOTIFYD_TOOLS_COMMAND_LINE_H_
#define ZORVNOTIFYD_TOOLS_COMMAND_LINE_H_

#include <string>
#include <vector>

namespace zorvnotifyctl {

// What the user asked for, before any command-specific check.
struct CommandLine {
  std::string command;            // the first positional argument; empty when none
  std::vector<std::string> args;  // the positional arguments after the command
  bool json = false;              // --json: machine-readable output
  bool help = false;              // --help or -h
  bool version = false;           // --version
  bool verbose = false;           // --verbose or -v: the library's extra log lines
  bool type_given = false;        // --type appeared
  std::string type;               // the value of the last --type
  bool since_given = false;       // --since appeared
  std::string since;              // the value of the last --since
  bool wait_given = false;        // --wait appeared
  std::string wait;               // the value of the last --wait
  // --socket: the daemon's socket (the default unless given)
  std::string socket = "/run/zorvnotifyd/zorvnotifyd.sock";
};

// Parses argv[1] to argv[argc - 1] into |line|.  Options may stand before or
// after the command; "--type", "--since", "--wait" and "--socket" take their value as
// the next argument or after "=".  "--" ends the options, and "-" alone is
// a positional argument (the standard input).  Returns "" on success,
// otherwise the usage error.
std::string ParseCommandLine(int argc, const char* const* argv, CommandLine* line);

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_COMMAND_LINE_H_
