// Reading /proc/self/mountinfo.

#include "mount_table.h"

#include <errno.h>
#include <fcntl.h>
#include <string.h>

#include <cstdlib>

#include "bounded_read.h"
#include "unique_fd.h"

namespace zorvnotifyd {
namespace {

using zorvcommon::UniqueFd;

// The next field of |line| from |at| (spaces separate fields; a space in
// a path is escaped), moving |at| past it; empty at the end.
std::string_view NextField(std::string_view line, size_t* at) {
  while (*at < line.size() && line[*at] == ' ') ++*at;
  const size_t start = *at;
  while (*at < line.size() && line[*at] != ' ') ++*at;
  return line.substr(start, *at - start);
}

// |field| with each "\ooo" (three octal digits) turned back into its byte.
std::string Unescape(std::string_view field) {
  std::string text;
  text.reserve(field.size());
  for (size_t i = 0; i < field.size(); ++i) {
    const auto octal = [&](size_t at) { return field[at] >= '0' && field[at] <= '7'; };
    if (field[i] == '\\' && i + 3 < field.size() && octal(i + 1) && octal(i + 2) && octal(i + 3)) {
      text += char((field[i + 1] - '0') * 64 + (field[i + 2] - '0') * 8 + (field[i + 3] - '0'));
      i += 3;
    } else {
      text += field[i];
    }
  }
  return text;
}

}  // namespace

bool MountTable::Read(std::string* why) {
  const UniqueFd fd(open("/proc/self/mountinfo", O_RDONLY | O_CLOEXEC));
  std::string text;
  const zorvcommon::BoundedRead read =
      fd.get() < 0 ? zorvcommon::BoundedRead::kError
                   : zorvcommon::ReadAtMost(fd.get(), size_t{16} << 20, &text);
  if (read != zorvcommon::BoundedRead::kWhole) {
    *why =
        read == zorvcommon::BoundedRead::kTooLarge ? "it is larger than 16 MiB" : strerror(errno);
    return false;
  }
  Parse(text);
  return true;
}

void MountTable::Parse(std::string_view text) {
  // "ID PARENT MAJOR:MINOR ROOT MOUNT-POINT OPTIONS ..." a line.
  for (size_t start = 0; start < text.size();) {
    size_t end = text.find('\n', start);
    if (end == std::string_view::npos) end = text.size();
    const std::string_view line = text.substr(start, end - start);
    start = end + 1;
    size_t at = 0;
    const std::string_view id = NextField(line, &at);
    NextField(line, &at);
    NextField(line, &at);
    const std::string_view root = NextField(line, &at);
    const std::string_view point = NextField(line, &at);
    char* id_end = nullptr;
    const std::string digits(id);
    const unsigned long long number = strtoull(digits.c_str(), &id_end, 10);
    if (point.empty() || digits.empty() || *id_end != '\0') continue;
    roots_[number] = Unescape(root);
    points_.insert(Unescape(point));
  }
}

const std::string* MountTable::RootOf(uint64_t id) const {
  const auto found = roots_.find(id);
  return found == roots_.end() ? nullptr : &found->second;
}

}  // namespace zorvnotifyd
