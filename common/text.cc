// Escaping text for output.

#include "text.h"

#include <cstdio>
#include <string_view>

#include "json_bytes.h"

namespace zorvcommon {

std::string Printable(const std::string& text) {
  if (text.empty()) return "\"\"";
  std::string shown;
  shown.reserve(text.size());
  for (size_t i = 0; i < text.size();) {
    const auto byte = static_cast<unsigned char>(text[i]);
    const size_t length = Utf8SequenceLength(std::string_view(text).substr(i));
    if (length > 1 || (length == 1 && byte >= 0x20 && byte != 0x7F)) {
      shown.append(text, i, length);
      i += length;
      continue;
    }
    char escaped[7];
    snprintf(escaped, sizeof(escaped), length == 1 ? "\\x%02X" : "\\udc%02x", byte);
    shown += escaped;
    ++i;
  }
  return shown;
}

std::string Quoted(const std::string& text) {
  return text.empty() ? "\"\"" : "\"" + Printable(text) + "\"";
}

}  // namespace zorvcommon
