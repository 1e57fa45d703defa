// Direct JSON output.

#include "json_writer.h"

#include <charconv>

#include "json_bytes.h"

namespace zorvnotifyd {

void AppendJsonString(std::string* out, std::string_view text) {
  zorvcommon::AppendJsonString(out, text);
}

void AppendJsonField(std::string* out, const char* key, std::string_view text) {
  out->push_back('"');
  out->append(key);
  out->append("\":");
  AppendJsonString(out, text);
}

void AppendJsonBytesField(std::string* out, const char* key, std::string_view bytes) {
  out->push_back('"');
  out->append(key);
  out->append("\":");
  if (!zorvcommon::AppendJsonString(out, bytes)) return;
  out->append(",\"");
  out->append(key);
  out->append("_b64\":\"");
  zorvcommon::AppendBase64(out, bytes);
  out->push_back('"');
}

void AppendJsonNumber(std::string* out, const char* key, uint64_t value) {
  char digits[24];
  const char* const end = std::to_chars(digits, digits + sizeof(digits), value).ptr;
  out->push_back('"');
  out->append(key);
  out->append("\":");
  out->append(digits, static_cast<size_t>(end - digits));
}

}  // namespace zorvnotifyd
