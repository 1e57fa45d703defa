// The checksum of the daemon's state records: CRC-32 (the polynomial of
// zlib and Ethernet), which catches every burst of up to 32 flipped bits and
// any cut within a record, at a few cycles a byte.
#ifndef ZORVNOTIFYD_DAEMON_CHECKSUM_H_
#define ZORVNOTIFYD_DAEMON_CHECKSUM_H_

#include <cstddef>
#include <cstdint>

namespace zorvnotifyd {

// Continues the CRC-32 |crc| (0 to start) over |size| bytes at |data|.
uint32_t Crc32(uint32_t crc, const void* data, size_t size);

}  // namespace zorvnotifyd

#endif  // ZORVNOTIFYD_DAEMON_CHECKSUM_H_
