// JSON output of the tool (--json).
#ifndef ZORVNOTIFYD_TOOLS_JSON_OUTPUT_H_
#define ZORVNOTIFYD_TOOLS_JSON_OUTPUT_H_

#include <ostream>

#include <json/json.h>

namespace zorvnotifyctl {

// Writes |value| to |out| as one JSON text, indented by two blanks, with a
// final newline.  Non-ASCII text is written as \u escapes, so the output is
// plain ASCII.
void WriteJson(std::ostream& out, const Json::Value& value);

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_JSON_OUTPUT_H_
