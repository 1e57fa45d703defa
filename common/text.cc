// Escaping text for output.

#include "text.h"

#include <cstdio>

namespace zorvcommon {

std::string Printable(const std::string& text) {
  if (text.empty()) return "\"\"";
  std::string shown;
  shown.reserve(text.size());
  for (char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte < 0x20 || byte == 0x7F) {
      char escaped[5];
      snprintf(escaped, sizeof(escaped), "\\x%02X", byte);
      shown += escaped;
    } else {
      shown += c;
    }
  }
  return shown;
}

std::string Quoted(const std::string& text) {
  return text.empty() ? "\"\"" : "\"" + Printable(text) + "\"";
}

}  // namespace zorvcommon
