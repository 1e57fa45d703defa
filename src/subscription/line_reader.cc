#include "subscription/line_reader.h"

#include <errno.h>
#include <string.h>
#include <unistd.h>

#include <algorithm>

namespace ZORV {
namespace ZORVNOTIFYD {
namespace subscription {

namespace {
constexpr size_t kFirstSize = 64 * 1024;
// A line of kMaxLine bytes with its newline fits.
constexpr size_t kMaxSize = LineReader::kMaxLine + 1;
}  // namespace

bool LineReader::HasLine() const {
  const size_t from = std::max(scanned_, begin_);
  return from < end_ && memchr(buffer_.data() + from, '\n', end_ - from) != nullptr;
}

bool LineReader::NextLine(const char** data, size_t* size) {
  const size_t from = std::max(scanned_, begin_);
  const void* found = from < end_ ? memchr(buffer_.data() + from, '\n', end_ - from) : nullptr;
  if (found == nullptr) {
    scanned_ = end_;
    return false;
  }
  const size_t newline = size_t(static_cast<const char*>(found) - buffer_.data());
  *data = buffer_.data() + begin_;
  *size = newline - begin_;
  begin_ = scanned_ = newline + 1;
  if (begin_ == end_) begin_ = end_ = scanned_ = 0;
  return true;
}

size_t LineReader::Room() {
  if (begin_ > 0 && (end_ == buffer_.size() || begin_ >= buffer_.size() / 2)) {
    memmove(buffer_.data(), buffer_.data() + begin_, end_ - begin_);
    end_ -= begin_;
    scanned_ = scanned_ > begin_ ? scanned_ - begin_ : 0;
    begin_ = 0;
  }
  if (end_ == buffer_.size() && buffer_.size() < kMaxSize) {
    buffer_.resize(std::min(kMaxSize, std::max(kFirstSize, buffer_.size() * 2)));
  }
  return buffer_.size() - end_;
}

ssize_t LineReader::ReadFrom(int fd) {
  const size_t room = Overlong() ? 0 : Room();
  if (room == 0) {
    errno = EOVERFLOW;
    return -1;
  }
  const ssize_t n = read(fd, buffer_.data() + end_, room);
  if (n > 0) end_ += size_t(n);
  return n;
}

size_t LineReader::Append(const char* data, size_t size) {
  const size_t room = Overlong() ? 0 : Room();
  const size_t n = std::min(room, size);
  if (n > 0) memcpy(buffer_.data() + end_, data, n);
  end_ += n;
  return n;
}

}  // namespace subscription
}  // namespace ZORVNOTIFYD
}  // namespace ZORV
