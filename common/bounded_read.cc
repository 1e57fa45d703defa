// Reading a descriptor whole, within a bound.

#include "bounded_read.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>

namespace zorvcommon {

BoundedRead ReadAtMost(int fd, size_t limit, std::string* text) {
  text->clear();
  char buffer[65536];
  while (text->size() <= limit) {
    const ssize_t n = read(fd, buffer, std::min(sizeof buffer, limit + 1 - text->size()));
    if (n == 0) return BoundedRead::kWhole;
    if (n < 0) {
      if (errno == EINTR) continue;
      return BoundedRead::kError;
    }
    text->append(buffer, static_cast<size_t>(n));
  }
  return BoundedRead::kTooLarge;
}

}  // namespace zorvcommon
