// LiteralPattern: recognising literal ignore patterns and answering them with
// byte comparisons.

#include "monitor_queue/literal_pattern.h"

#include <langinfo.h>
#include <stdlib.h>

#include <cstring>

namespace ZORV {
namespace ZORVNOTIFYD {

namespace {

// What a byte of a pattern is to Parse.
enum ByteClass : unsigned char {
  kOther,    // ends the literal shapes
  kPlain,    // stands for itself
  kEscaped,  // punctuation that stands for itself after "\" (but not alone)
  kBoth,     // punctuation that stands for itself either way
};

// The class of every byte.  Plain: printable ASCII other than the
// operators . [ ] ( ) * + ? { } | ^ $ \; control bytes and bytes above 0x7F
// mean what the locale makes of them.  Escaped: ASCII punctuation except
// the four escapes glibc reads as anchors (< > ` ': word and buffer
// edges); letters and digits are classes and back-references.
struct ByteClasses {
  ByteClass of[256] = {};
  constexpr ByteClasses() {
    for (int c = 0x20; c < 0x7f; ++c) of[c] = kPlain;
    for (const char* p = ".[]()*+?{}|^$\\"; *p; ++p) of[static_cast<unsigned char>(*p)] = kOther;
    for (const char* p = "!\"#$%&()*+,-./:;=?@[\\]^_{|}~"; *p; ++p) {
      ByteClass& c = of[static_cast<unsigned char>(*p)];
      c = c == kPlain ? kBoth : kEscaped;
    }
  }
};
constexpr ByteClasses kClasses;

// True when |p| is "(/|$)" or "($|/)" and nothing after it.  Each byte is
// read only after the one before it proved not to be the final NUL.
bool IsSlashOrEnd(const char* p) {
  return p[0] == '(' &&
         ((p[1] == '/' && p[2] == '|' && p[3] == '$') ||
          (p[1] == '$' && p[2] == '|' && p[3] == '/')) &&
         p[4] == ')' && p[5] == '\0';
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
    const unsigned char c = static_cast<unsigned char>(pattern[0]);
    if (c == '\0') break;
    if (c == '$' && pattern[1] == '\0') {
      end_ = End::kAtEnd;
      break;
    }
    if (IsSlashOrEnd(pattern)) {
      end_ = End::kAtSlashOrEnd;
      break;
    }
    char byte;
    const ByteClass here = kClasses.of[c];
    if (here == kPlain || here == kBoth) {
      byte = pattern[0];
      pattern += 1;
    } else if (c == '\\' && kClasses.of[static_cast<unsigned char>(pattern[1])] >= kEscaped) {
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
