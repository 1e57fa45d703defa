// LiteralPattern: an ignore pattern whose whole meaning is "these bytes, here
// in the path", answered with byte comparisons instead of the regex engine.
//
// Most ignore patterns are a literal with an anchor or two: "\.tmp$", "~$",
// "^/srv/x/", "node_modules", "/\.cache(/|$)".  Parse accepts exactly these
// shapes, where E is one or more literal bytes:
//
//   E        E anywhere in the subject
//   ^E       the subject begins with E
//   E$       the subject ends with E
//   ^E$      the subject is E
//   E(/|$)   E followed by "/" or by the end of the subject (also "($|/)")
//   ^E(/|$)  the subject begins with E, followed by "/" or its end
//
// A literal byte is printable ASCII other than . [ ] ( ) * + ? { } | ^ $ \,
// or "\" followed by printable ASCII punctuation other than < > ` ' (those
// four escapes are anchors to glibc).  For these shapes, compiled with
// REG_EXTENDED alone, regexec's answer is "E occurs at such a place in the
// subject up to its first NUL byte" whenever every ASCII byte of the subject
// is a character of its own: in a single-byte locale or in UTF-8.
// LiteralAnswersHere tells whether the calling thread's locale is one of
// those; in another multibyte locale an ASCII byte may be the second half of
// a character, and regexec must answer.
#ifndef ZORVNOTIFYD_SRC_MONITOR_QUEUE_LITERAL_PATTERN_H_
#define ZORVNOTIFYD_SRC_MONITOR_QUEUE_LITERAL_PATTERN_H_

#include <stddef.h>

namespace ZORV {
namespace ZORVNOTIFYD {

class LiteralPattern {
 public:
  // The longest literal accepted; a longer one is left to regexec.
  static constexpr size_t kMaxBytes = 128;

  // Reads |pattern| up to its first NUL byte, as regcomp does.  True, with
  // this object describing it, when it has one of the shapes above; false
  // otherwise (this object is then unusable).
  bool Parse(const char* pattern);

  // regexec's answer for the parsed pattern on the |length| bytes at
  // |subject|, which hold no NUL byte (the part of a C string regexec
  // reads).  Valid only after Parse returned true and when
  // LiteralAnswersHere() is true.
  bool Matches(const char* subject, size_t length) const;

 private:
  // Where the literal must end.
  enum class End : unsigned char { kAnywhere, kAtEnd, kAtSlashOrEnd };

  char bytes_[kMaxBytes];
  size_t size_;
  bool at_start_;
  End end_;
};

// True when the calling thread's locale makes every ASCII byte a character
// of its own (single-byte or UTF-8), so that LiteralPattern::Matches gives
// regexec's answer.
bool LiteralAnswersHere();

}  // namespace ZORVNOTIFYD
}  // namespace ZORV

#endif  // ZORVNOTIFYD_SRC_MONITOR_QUEUE_LITERAL_PATTERN_H_
