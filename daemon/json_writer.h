// Writing JSON lines directly into a reused buffer, without building a
// Json::Value and a writer per line: the daemon writes one line per queue
// and event.
#ifndef ZORVNOTIFYD_DAEMON_JSON_WRITER_H_
#define ZORVNOTIFYD_DAEMON_JSON_WRITER_H_

#include <cstdint>
#include <string>
#include <string_view>

namespace zorvnotifyd {

// Appends |text| to |out| as a JSON string, quotes included: '"', '\' and
// control bytes escaped (\n, \t, ... or \u00XX), each byte that is not part
// of valid UTF-8 as \udcXY, valid UTF-8 as it is (see json_bytes.h).
void AppendJsonString(std::string* out, std::string_view text);

// Appends "KEY": and |text| as a JSON string (KEY is written as it is).
void AppendJsonField(std::string* out, const char* key, std::string_view text);

// Appends "KEY": and |bytes| as a JSON string, as AppendJsonField does;
// when |bytes| is not valid UTF-8 (a name or path straight from a file
// system or a queue file), also ,"KEY_b64": and the base64 of the exact
// bytes, which every reader can decode.  Valid UTF-8 costs no second pass.
void AppendJsonBytesField(std::string* out, const char* key, std::string_view bytes);

// Appends "KEY": and the decimal |value|.
void AppendJsonNumber(std::string* out, const char* key, uint64_t value);

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_JSON_WRITER_H_
