// Checks of queue file names.

#include "queue_file_name.h"

#include <climits>

namespace zorvnotifyctl {
namespace {

// The library saves a queue file through a temporary file named
// ".NAME.tmp.XXXXXX" in the same directory, 12 bytes longer than NAME; both
// names must fit in a directory entry (NAME_MAX bytes).
constexpr size_t kMaxName = NAME_MAX - 12;

}  // namespace

std::string QueueFileNameProblem(const std::string& name) {
  const std::string quoted = "queue file name \"" + name + "\"";
  if (name.empty()) return "the queue file name is empty";
  if (name.size() > kMaxName) {
    return "the queue file name is " + std::to_string(name.size()) +
           " bytes long; a queue file name has at most " + std::to_string(kMaxName) + " bytes";
  }
  if (name == "." || name == "..") return "the " + quoted + " names a directory, not a file";
  if (name.find('/') != std::string::npos) {
    return "the " + quoted +
           " contains \"/\"; give a plain name within the configuration directory";
  }
  if (name[0] == '.') {
    return "the " + quoted + " begins with \".\"; the catalogue skips such files";
  }
  return std::string();
}

}  // namespace zorvnotifyctl
