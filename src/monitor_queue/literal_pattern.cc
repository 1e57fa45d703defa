// LiteralPattern: recognising literal ignore patterns and answering them with
// byte comparisons.

#include "monitor_queue/literal_pattern.h"

#include <langinfo.h>
#include <stdlib.h>

#include <cstring>

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

// True when |c| stands for itself unescaped in an extended regular
// expression.  Control bytes and bytes above 0x7F are refused: their
// meaning depends on the locale.
bool IsPlainByte(char c) {
  return c >= 0x20 && c < 0x7f && std::strchr(".[]()*+?{}|^$\\", c) == nullptr;
}

// True when "\" followed by |c| stands for |c|: ASCII punctuation, except
// the four escapes glibc reads as anchors (word edges, buffer edges).
// Letters and digits are refused (classes and back-references).
bool IsEscapedByte(char c) {
  return c != '\0' && std::strchr("!\"#$%&()*+,-./:;=?@[\\]^_{|}~", c) != nullptr;
}

// The first position at or after |from| where the |size| bytes at |needle|
// occur in |text| of |length| bytes, or |length| when they do not.
size_t Find(const char* text, size_t length, size_t from, const char* needle, size_t size) {
  if (from > length) return length;
  const void* found = memmem(text + from, length - from, needle, size);
  return found ? static_cast<size_t>(static_cast<const char*>(found) - text) : length;
}

}  // namespace

bool LiteralPattern::Parse(const char* pattern) {
  size_ = 0;
  at_start_ = *pattern == '^';
  if (at_start_) ++pattern;
  end_ = End::kAnywhere;
  for (;;) {
    if (*pattern == '\0') break;
    if (pattern[0] == '$' && pattern[1] == '\0') {
      end_ = End::kAtEnd;
      break;
    }
    if (std::strcmp(pattern, "(/|$)") == 0 || std::strcmp(pattern, "($|/)") == 0) {
      end_ = End::kAtSlashOrEnd;
      break;
    }
    char byte;
    if (IsPlainByte(pattern[0])) {
      byte = pattern[0];
      pattern += 1;
    } else if (pattern[0] == '\\' && IsEscapedByte(pattern[1])) {
      byte = pattern[1];
      pattern += 2;
    } else {
      return false;
    }
    if (size_ == kMaxBytes) return false;
    bytes_[size_++] = byte;
  }
  // An empty literal ("", "^", "$", "(/|$)") is left to the regex engine.
  return size_ > 0;
}

bool LiteralPattern::Matches(const char* subject, size_t length) const {
  if (length < size_) return false;
  if (at_start_) {
    if (std::memcmp(subject, bytes_, size_) != 0) return false;
    switch (end_) {
      case End::kAnywhere:
        return true;
      case End::kAtEnd:
        return length == size_;
      case End::kAtSlashOrEnd:
        return length == size_ || subject[size_] == '/';
    }
    return false;
  }
  switch (end_) {
    case End::kAnywhere:
      return Find(subject, length, 0, bytes_, size_) != length;
    case End::kAtEnd:
      return std::memcmp(subject + length - size_, bytes_, size_) == 0;
    case End::kAtSlashOrEnd:
      // Every occurrence is a candidate: "/.git" in "/.github/.git" fails
      // at the first and holds at the second.
      for (size_t at = Find(subject, length, 0, bytes_, size_); at != length;
           at = Find(subject, length, at + 1, bytes_, size_)) {
        if (at + size_ == length || subject[at + size_] == '/') return true;
      }
      return false;
  }
  return false;
}

bool LiteralAnswersHere() {
  return MB_CUR_MAX == 1 || std::strcmp(nl_langinfo(CODESET), "UTF-8") == 0;
}

}  // namespace ZORVNOTIFYD
}  // namespace ZORV
