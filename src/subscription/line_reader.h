// Newline-delimited lines read from a stream within a bound: a line longer
// than kMaxLine bytes is never held, and the buffer never grows beyond it.
#ifndef ZORVNOTIFYD_SRC_SUBSCRIPTION_LINE_READER_H_
#define ZORVNOTIFYD_SRC_SUBSCRIPTION_LINE_READER_H_

#include <stddef.h>
#include <sys/types.h>

#include <vector>

namespace ZORV {
namespace ZORVNOTIFYD {
namespace subscription {

class LineReader {
 public:
  // The longest line accepted, its newline not counted.
  static constexpr size_t kMaxLine = 1 << 20;

  // Takes the next whole line (without its newline) when one is buffered:
  // [*data, *data + *size) stays valid until the next call of any member.
  bool NextLine(const char** data, size_t* size);
  // True when the bytes buffered after the last whole line already exceed
  // kMaxLine: the stream can no longer be read line by line.
  bool Overlong() const { return end_ - begin_ > kMaxLine && !HasLine(); }
  // True when a whole line is buffered.
  bool HasLine() const;
  // Reads once from |fd| into free space (compacting or growing the
  // buffer up to its bound first): read(2)'s result, errno as read left
  // it.  Reads nothing, returning -1 with EOVERFLOW, once Overlong().
  ssize_t ReadFrom(int fd);
  // Appends up to |size| bytes of |data| as ReadFrom would read them; the
  // number taken (0 once Overlong()).
  size_t Append(const char* data, size_t size);
  // Forgets everything buffered; keeps the memory.
  void Clear() { begin_ = end_ = scanned_ = 0; }

 private:
  // Makes room after end_; the room there.
  size_t Room();

  std::vector<char> buffer_;
  size_t begin_ = 0, end_ = 0;
  size_t scanned_ = 0;  // [begin_, scanned_) holds no newline
};

}  // namespace subscription
}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_SRC_SUBSCRIPTION_LINE_READER_H_
