// Text from queue files and file systems made safe to print.
#ifndef ZORVNOTIFYD_COMMON_TEXT_H_
#define ZORVNOTIFYD_COMMON_TEXT_H_

#include <string>

namespace zorvcommon {

// |text| with every control byte (below 0x20, and 0x7F) written as "\xNN",
// so that a name or path holding a newline or an escape sequence cannot
// break or forge a line of output, and every byte that is not part of
// valid UTF-8 written as "\udcXY" (the escape of the JSON output), so that
// the text stays valid UTF-8 and still names the byte.  The empty text
// becomes "\"\"" so that it stays visible.  Valid UTF-8 passes unchanged.
std::string Printable(const std::string& text);

// |text| as Printable writes it, in double quotes ("\"\"" when empty).
std::string Quoted(const std::string& text);

}  // namespace zorvcommon

#endif  // ZORVNOTIFYD_COMMON_TEXT_H_
