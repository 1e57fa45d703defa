// Parsing of the zorvnotifyctl command line.

#include "command_line.h"

namespace zorvnotifyctl {

std::string ParseCommandLine(int argc, const char* const* argv, CommandLine* line) {
  *line = CommandLine();
  std::vector<std::string> positionals;
  bool options_ended = false;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    if (options_ended || arg.empty() || arg[0] != '-' || arg == "-") {
      positionals.push_back(arg);
    } else if (arg == "--") {
      options_ended = true;
    } else if (arg == "--json") {
      line->json = true;
    } else if (arg == "--help" || arg == "-h") {
      line->help = true;
    } else if (arg == "--version") {
      line->version = true;
    } else if (arg == "--verbose" || arg == "-v") {
      line->verbose = true;
    } else if (arg == "--type" || arg == "-t") {
      if (i + 1 >= argc) return "option " + arg + " needs a value (share, etc or local-etc)";
      line->type_given = true;
      line->type = argv[++i];
    } else if (arg.compare(0, 7, "--type=") == 0) {
      line->type_given = true;
      line->type = arg.substr(7);
    } else {
      return "unknown option " + arg;
    }
  }
  if (!positionals.empty()) {
    line->command = positionals.front();
    line->args.assign(positionals.begin() + 1, positionals.end());
  }
  return std::string();
}

}  // namespace zorvnotifyctl
