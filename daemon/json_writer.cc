// Direct JSON output.

#include "json_writer.h"

#include <charconv>
#include <cstdio>

namespace zorvnotifyd {

void AppendJsonString(std::string* out, std::string_view text) {
  out->push_back('"');
  for (char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte >= 0x20 && c != '"' && c != '\\') {
      out->push_back(c);
      continue;
    }
    out->push_back('\\');
    switch (c) {
      case '"':
        out->push_back('"');
        break;
      case '\\':
        out->push_back('\\');
        break;
      case '\n':
        out->push_back('n');
        break;
      case '\t':
        out->push_back('t');
        break;
      case '\r':
        out->push_back('r');
        break;
      case '\b':
        out->push_back('b');
        break;
      case '\f':
        out->push_back('f');
        break;
      default: {
        char escaped[6];
        snprintf(escaped, sizeof(escaped), "u%04x", byte);
        out->append(escaped);
      }
    }
  }
  out->push_back('"');
}

void AppendJsonField(std::string* out, const char* key, std::string_view text) {
  out->push_back('"');
  out->append(key);
  out->append("\":");
  AppendJsonString(out, text);
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
