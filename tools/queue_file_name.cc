// Checks of queue file names.

#include "queue_file_name.h"

namespace zorvnotifyctl {

std::string QueueFileNameProblem(const std::string& name) {
  const std::string quoted = "queue file name \"" + name + "\"";
  if (name.empty()) return "the queue file name is empty";
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
