// Event masks as the tool reads and shows them.
#ifndef ZORVNOTIFYD_TOOLS_MASKS_H_
#define ZORVNOTIFYD_TOOLS_MASKS_H_

#include <string>

namespace zorvnotifyctl {

// Parses a 32-bit mask written in decimal ("258") or in hexadecimal after
// "0x" or "0X" ("0x102").  No sign, blank or empty digit string is
// accepted, nor a value above 4294967295.  False, with |mask| unchanged,
// when |text| is not such a mask.
bool ParseMask(const std::string& text, unsigned int* mask);

// The mask as "0x" followed by eight hexadecimal digits, e.g. "0x00000102".
std::string FormatMask(unsigned int mask);

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_MASKS_H_
