// Queue file names that the whole catalogue can see.
#ifndef ZORVNOTIFYD_TOOLS_QUEUE_FILE_NAME_H_
#define ZORVNOTIFYD_TOOLS_QUEUE_FILE_NAME_H_

#include <string>

namespace zorvnotifyctl {

// Returns "" when |name| names a file directly inside a configuration
// directory that the catalogue loads; otherwise says what is wrong with it.
// Refused: the empty name, "." and "..", any name containing "/" and any
// name beginning with "." (the catalogue skips hidden files, so a daemon
// would never see the queues in it), and any name longer than NAME_MAX - 12
// bytes (the library could not name its temporary file for it).
std::string QueueFileNameProblem(const std::string& name);

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_QUEUE_FILE_NAME_H_
