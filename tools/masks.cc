// Reading and showing event masks.

#include "masks.h"

#include <cstdint>
#include <cstdio>

namespace zorvnotifyctl {

static_assert(sizeof(unsigned int) == 4, "event masks are 32-bit unsigned ints");

bool ParseMask(const std::string& text, unsigned int* mask) {
  const bool hex = text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X');
  const unsigned base = hex ? 16 : 10;
  const size_t first = hex ? 2 : 0;
  if (text.size() <= first) return false;
  uint64_t value = 0;
  for (size_t i = first; i < text.size(); ++i) {
    const char c = text[i];
    unsigned digit;
    if (c >= '0' && c <= '9') {
      digit = static_cast<unsigned>(c - '0');
    } else if (hex && c >= 'a' && c <= 'f') {
      digit = static_cast<unsigned>(c - 'a' + 10);
    } else if (hex && c >= 'A' && c <= 'F') {
      digit = static_cast<unsigned>(c - 'A' + 10);
    } else {
      return false;
    }
    value = value * base + digit;
    if (value > UINT32_MAX) return false;  // checked per digit, so it never wraps
  }
  *mask = static_cast<unsigned int>(value);
  return true;
}

std::string FormatMask(unsigned int mask) {
  char text[11];
  snprintf(text, sizeof(text), "0x%08X", mask);
  return text;
}

}  // namespace zorvnotifyctl
