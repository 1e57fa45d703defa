// Strict reading of one queue object, as an administrator supplies it.
#ifndef ZORVNOTIFYD_TOOLS_QUEUE_OBJECT_H_
#define ZORVNOTIFYD_TOOLS_QUEUE_OBJECT_H_

#include <string>

#include <json/json.h>

namespace zorvnotifyctl {

// Parses |text| as one JSON queue object and checks it more strictly than
// the library does, so that nothing the user wrote is silently dropped or
// defaulted:
//   - the text is one JSON value, without comments, duplicate keys or
//     trailing content, and the value is an object;
//   - it has a string "queue" and optionally "config", an array of objects,
//     and no other key;
//   - each element of "config" has a string "path" that the daemon can
//     watch (see zorvcommon::WatchPathProblem: absolute and normalised), a
//     "mask" that is an integer from 0 to 4294967295, optionally "ignore",
//     an array of strings each of which compiles as a POSIX extended
//     regular expression, and no other key.
// Returns "" and sets |queue| on success.  Otherwise returns one line that
// names the offending place (e.g. "config[1].mask must not be negative
// (-1)") and leaves |queue| unchanged.
std::string ParseQueueObject(const std::string& text, Json::Value* queue);

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_QUEUE_OBJECT_H_
