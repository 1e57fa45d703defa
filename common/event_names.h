// Names of inotify event bits, for readable output.
#ifndef ZORVNOTIFYD_COMMON_EVENT_NAMES_H_
#define ZORVNOTIFYD_COMMON_EVENT_NAMES_H_

#include <cstdint>
#include <string>

namespace zorvcommon {

// The names of the inotify bits of |mask| joined by "|", e.g.
// "IN_CREATE|IN_ISDIR"; bits without a name as one hexadecimal number
// ("0x..."), which is also the whole text for a mask of 0.
std::string MaskNames(uint32_t mask);

}  // namespace zorvcommon

#endif  // ZORVNOTIFYD_COMMON_EVENT_NAMES_H_
