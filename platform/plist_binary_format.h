// Layout of a binary ("bplist00") property list, shared by its reader and
// its writer. Internal to the platform library.
//
// A file is the 8-byte magic, the objects, an offset table (one big-endian
// offset of offsetIntSize bytes per object) and a 32-byte trailer. Objects
// refer to each other by index (objectRefSize bytes, big-endian). Each object
// starts with a marker byte: the high nibble is its type, the low nibble a
// size or count, where 0xF means that an integer object holding the count
// follows.
#ifndef VTR_PLATFORM_PLIST_BINARY_FORMAT_H_
#define VTR_PLATFORM_PLIST_BINARY_FORMAT_H_

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <span>
#include <string>
#include <string_view>
#include <vector>

namespace vtr::bplist {

inline constexpr std::string_view kMagic = "bplist00";
inline constexpr size_t kMagicSize = 8;
inline constexpr size_t kTrailerSize = 32;

// Marker bytes and type nibbles.
inline constexpr uint8_t kNull = 0x00;
inline constexpr uint8_t kFalse = 0x08;
inline constexpr uint8_t kTrue = 0x09;
inline constexpr uint8_t kIntType = 0x1;
inline constexpr uint8_t kRealType = 0x2;
inline constexpr uint8_t kDateMarker = 0x33;
inline constexpr uint8_t kDataType = 0x4;
inline constexpr uint8_t kAsciiType = 0x5;
inline constexpr uint8_t kUtf16Type = 0x6;
inline constexpr uint8_t kUidType = 0x8;
inline constexpr uint8_t kArrayType = 0xA;
inline constexpr uint8_t kDictType = 0xD;
// Low nibble meaning "an integer object with the count follows".
inline constexpr uint8_t kExtendedCount = 0xF;

// The trailer's fields: after 5 unused bytes, the sort version (unused
// too), the two sizes and three big-endian 8-byte numbers.
struct Trailer {
  uint8_t sortVersion = 0;
  uint8_t offsetIntSize = 0;
  uint8_t objectRefSize = 0;
  uint64_t numObjects = 0;
  uint64_t topObject = 0;
  uint64_t offsetTableOffset = 0;
};

// The big-endian unsigned integer of size bytes (1..8) at p.
inline uint64_t ReadBigEndian(const uint8_t* p, size_t size) {
  uint64_t v = 0;
  for (size_t i = 0; i < size; ++i) v = (v << 8) | p[i];
  return v;
}

// Stores the low size bytes (1..8) of v at p, big-endian.
inline void WriteBigEndian(uint8_t* p, uint64_t v, size_t size) {
  for (size_t i = size; i > 0; --i) {
    p[i - 1] = static_cast<uint8_t>(v);
    v >>= 8;
  }
}

// WriteBigEndian for the sizes 1, 2, 4 and 8, a byte swap each: references
// and offsets are written by the million.
inline void StoreBigEndian(uint8_t* p, uint64_t v, uint8_t size) {
  switch (size) {
    case 1:
      *p = static_cast<uint8_t>(v);
      break;
    case 2: {
      const uint16_t x = __builtin_bswap16(static_cast<uint16_t>(v));
      std::memcpy(p, &x, 2);
      break;
    }
    case 4: {
      const uint32_t x = __builtin_bswap32(static_cast<uint32_t>(v));
      std::memcpy(p, &x, 4);
      break;
    }
    default: {
      const uint64_t x = __builtin_bswap64(v);
      std::memcpy(p, &x, 8);
      break;
    }
  }
}

// The smallest of 1, 2, 4 and 8 bytes that holds v.
inline uint8_t BytesNeeded(uint64_t v) {
  if (v <= 0xFF) return 1;
  if (v <= 0xFFFF) return 2;
  if (v <= 0xFFFFFFFF) return 4;
  return 8;
}

// Appends the UTF-8 form of big-endian UTF-16 code units (units.size() is
// even) to out. Refuses unpaired surrogates; NUL units are kept. Returns
// false, with out partly filled, on invalid input.
bool AppendUtf8FromUtf16BigEndian(std::span<const uint8_t> units, std::string* out);

// Appends the big-endian UTF-16 form of UTF-8 text to out and adds the number
// of code units to *unitCount. Refuses malformed UTF-8 (overlong forms,
// surrogates, values past U+10FFFF, truncated sequences): returns false.
bool AppendUtf16BigEndianFromUtf8(std::string_view text, std::vector<uint8_t>* out, uint64_t* unitCount);

}  // namespace vtr::bplist

#endif  // VTR_PLATFORM_PLIST_BINARY_FORMAT_H_
