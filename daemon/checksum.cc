// CRC-32, reflected, polynomial 0xEDB88320, eight bytes a step ("slicing
// by 8": eight table lookups for eight bytes, against eight dependent ones
// a byte at a time); the bytes are combined one by one, so the result does
// not depend on the machine's byte order.

#include "checksum.h"

#include <array>

namespace zorvnotifyd {
namespace {

using Tables = std::array<std::array<uint32_t, 256>, 8>;

// tables[0] is the classic table; tables[k][i] is the CRC of byte i
// followed by k zero bytes.
constexpr Tables MakeTables() {
  Tables tables = {};
  for (uint32_t i = 0; i < 256; ++i) {
    uint32_t c = i;
    for (int k = 0; k < 8; ++k) c = (c & 1) ? 0xEDB88320u ^ (c >> 1) : c >> 1;
    tables[0][i] = c;
  }
  for (uint32_t i = 0; i < 256; ++i) {
    for (size_t k = 1; k < 8; ++k) {
      tables[k][i] = (tables[k - 1][i] >> 8) ^ tables[0][tables[k - 1][i] & 0xff];
    }
  }
  return tables;
}

constexpr Tables kTables = MakeTables();

}  // namespace

uint32_t Crc32(uint32_t crc, const void* data, size_t size) {
  const unsigned char* p = static_cast<const unsigned char*>(data);
  crc = ~crc;
  for (; size >= 8; p += 8, size -= 8) {
    const uint32_t low =
        crc ^ (uint32_t{p[0]} | uint32_t{p[1]} << 8 | uint32_t{p[2]} << 16 | uint32_t{p[3]} << 24);
    crc = kTables[7][low & 0xff] ^ kTables[6][(low >> 8) & 0xff] ^ kTables[5][(low >> 16) & 0xff] ^
          kTables[4][low >> 24] ^ kTables[3][p[4]] ^ kTables[2][p[5]] ^ kTables[1][p[6]] ^
          kTables[0][p[7]];
  }
  for (; size > 0; ++p, --size) crc = kTables[0][(crc ^ *p) & 0xff] ^ (crc >> 8);
  return ~crc;
}

}  // namespace zorvnotifyd
