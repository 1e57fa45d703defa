// JSON output of the tool (--json).
#ifndef ZORVNOTIFYD_TOOLS_JSON_OUTPUT_H_
#define ZORVNOTIFYD_TOOLS_JSON_OUTPUT_H_

#include <ostream>

#include <json/json.h>

namespace zorvnotifyctl {

// Writes |value| to |out| as one JSON text, indented by two blanks, with a
// final newline.  Strings are written as zorvcommon::AppendJsonString does:
// valid UTF-8 as it is, each byte that is not part of valid UTF-8 as
// \udcXY, so that reading the output back (ParseQueueObject) gives the
// same bytes.
void WriteJson(std::ostream& out, const Json::Value& value);

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_JSON_OUTPUT_H_
