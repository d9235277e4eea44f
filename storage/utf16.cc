#include "storage/utf16.h"

#include "platform/little_endian.h"

namespace vtr {

int utf_encodestr2(const uint8_t* src, size_t srcBytes, uint8_t* dst, size_t* dstLengthOut, size_t dstCapacity) {
  size_t length = 0;
  for (size_t u = 0; u < srcBytes / 2; ++u) {
    const uint16_t unit = LoadU16(src + 2 * u);
    if (unit == 0) continue;
    const size_t size = unit < 0x80 ? 1 : unit < 0x800 ? 2 : 3;
    if (size > dstCapacity - length) break;
    if (size == 1) {
      dst[length] = static_cast<uint8_t>(unit);
    } else if (size == 2) {
      dst[length] = static_cast<uint8_t>(0xC0 | (unit >> 6));
      dst[length + 1] = static_cast<uint8_t>(0x80 | (unit & 0x3F));
    } else {
      dst[length] = static_cast<uint8_t>(0xE0 | (unit >> 12));
      dst[length + 1] = static_cast<uint8_t>(0x80 | ((unit >> 6) & 0x3F));
      dst[length + 2] = static_cast<uint8_t>(0x80 | (unit & 0x3F));
    }
    length += size;
  }
  *dstLengthOut = length;
  return 0;
}

}  // namespace vtr
