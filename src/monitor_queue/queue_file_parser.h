// A fast reader for queue files in the plain form the library itself
// writes, building the records directly instead of through a Json::Value
// tree.  It reads a strict subset of JSON and refuses everything else, so
// that the general reader decides every text it does not read.
//
// The subset: an array of objects whose only keys are "queue" (a string)
// and "config" (an array of objects whose only keys are "path" (a string),
// "mask" (an unsigned integer) and "ignore" (an array of strings)), each key
// at most once per object.  Whitespace is space, tab, LF and CR only, and
// nothing but whitespace follows the array.  A string is its raw bytes with
// the escapes \" \\ \/ \b \f \n \r \t decoded; a NUL byte or a \u escape is
// refused.  A mask is decimal digits without sign, fraction, exponent or
// leading zero, at most 4294967295.  A missing key gives the default of the
// record's JSON constructor: name "", no configurations, path "", mask 0, no
// patterns.  For every text of the subset the records are those the JSON
// constructors build from the general reader's value of the same text.
#ifndef ZORVNOTIFYD_SRC_MONITOR_QUEUE_QUEUE_FILE_PARSER_H_
#define ZORVNOTIFYD_SRC_MONITOR_QUEUE_QUEUE_FILE_PARSER_H_

#include <stddef.h>

#include <vector>

#include "monitor_queue.h"

namespace ZORV {
namespace ZORVNOTIFYD {

// Appends to |queues| one queue per element of the queue-file text of
// |size| bytes at |text| and returns true when the text lies in the subset
// above.  Otherwise (and when memory runs out) returns false with |queues|
// untouched, capacity included.
bool ParseQueueFileSubset(const char* text, size_t size, std::vector<MonitorQueue>& queues);

}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_SRC_MONITOR_QUEUE_QUEUE_FILE_PARSER_H_
