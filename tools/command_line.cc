// Parsing of the zorvnotifyctl command line.

#include "command_line.h"

namespace zorvnotifyctl {
namespace {

// Where the value of the option NAME ("--type", "--since", "--wait" or
// "--socket") goes, marking it as given; null for any other NAME.
std::string* ValueOf(const std::string& name, CommandLine* line) {
  if (name == "--type") {
    line->type_given = true;
    return &line->type;
  }
  if (name == "--since") {
    line->since_given = true;
    return &line->since;
  }
  if (name == "--wait") {
    line->wait_given = true;
    return &line->wait;
  }
  return name == "--socket" ? &line->socket : nullptr;
}

}  // namespace

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
    } else if (std::string* value =
                   ValueOf(arg == "-t" ? "--type" : arg.substr(0, arg.find('=')), line)) {
      // "--NAME VALUE" or "--NAME=VALUE"; "-t VALUE" only.
      const size_t equals = arg.find('=');
      if (equals != std::string::npos) {
        *value = arg.substr(equals + 1);
      } else if (i + 1 < argc) {
        *value = argv[++i];
      } else {
        return "option " + arg + " needs a value (" +
               (value == &line->type    ? "share, etc or local-etc"
                : value == &line->since ? "N"
                : value == &line->wait  ? "SECONDS"
                                        : "PATH") +
               ")";
      }
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
