// The daemon's lines read without a JSON tree: one flat object per line,
// with the one array a subscribe reply carries.  Reading reuses the
// strings and the array of the record it fills, so a warmed-up record
// allocates nothing.
#ifndef ZORVNOTIFYD_SRC_SUBSCRIPTION_WIRE_RECORD_H_
#define ZORVNOTIFYD_SRC_SUBSCRIPTION_WIRE_RECORD_H_

#include <stddef.h>
#include <stdint.h>

#include <string>
#include <vector>

#include "monitor_queue.h"

namespace ZORV {
namespace ZORVNOTIFYD {
namespace subscription {

// One queue of a subscribe reply.
struct WireQueue {
  _tag_monitor_queue_type_ type = MONITOR_QUEUE_TYPE_SHARE_DIR;
  std::string file;
  uint64_t seq = 0;
};

// What one line says.  The has_* flags tell which members came; the
// strings are valid only where their flag is set.
struct WireRecord {
  bool has_reply, has_error, has_queue, has_type, has_file, has_seq, has_path, has_mask, has_missed,
      has_rescan, has_journal, has_queues;
  bool lost, removed, registered, offline;
  std::string reply, error, queue, file, path, rescan, journal;
  _tag_monitor_queue_type_ type;
  uint64_t seq, missed;
  uint32_t mask;
  std::vector<WireQueue> queues;  // the first |queue_count| are this line's
  size_t queue_count;
  std::string scratch_key, scratch_text;  // the reader's own, kept to reuse
};

// Reads the JSON object in [data, data + size) into |out|.  Strict: the
// whole text is one object with nothing but white space after it, no
// duplicate known member, and each known member of its type ("seq",
// "missed" whole numbers, "mask" one of 32 bits, the notices booleans,
// "type" "share", "etc" or "local-etc"); unknown members of any JSON type
// are skipped (nested at most 16 levels).  A \udcXY escape stands for the
// byte XY; other lone surrogates are refused.  "queue_b64", "file_b64",
// "path_b64" and "rescan_b64", standard base64 of a name's exact bytes,
// take the place of their member's text.  False when the text is not such
// an object.
bool ParseWireRecord(const char* data, size_t size, WireRecord* out);

}  // namespace subscription
}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_SRC_SUBSCRIPTION_WIRE_RECORD_H_
