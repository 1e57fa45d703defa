// Reading a descriptor whole, within a bound.
#ifndef ZORVNOTIFYD_COMMON_BOUNDED_READ_H_
#define ZORVNOTIFYD_COMMON_BOUNDED_READ_H_

#include <cstddef>
#include <string>

namespace zorvcommon {

// The most a queue file holds, in bytes (16 MiB): the library neither reads
// nor writes a larger one, and the tool reads its own input within it.
inline constexpr size_t kMaxQueueFileSize = size_t{16} << 20;

// How ReadAtMost ended.
enum class BoundedRead { kWhole, kTooLarge, kError };

// Reads |fd| to its end into |text| (replaced), reading never more than
// |limit| + 1 bytes: kWhole when the end came within |limit| bytes,
// kTooLarge when there was more, kError (errno set) when a read failed.
// EINTR is retried.  A descriptor that never ends (a device such as
// /dev/zero) is read only up to the bound.
BoundedRead ReadAtMost(int fd, size_t limit, std::string* text);

}  // namespace zorvcommon

#endif  // ZORVNOTIFYD_COMMON_BOUNDED_READ_H_
