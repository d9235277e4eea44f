// Little-endian integers in byte buffers. On-disk structures (the
// volume-manager header, GPT headers and entries) are read and written field
// by field through these, never by casting a struct over raw bytes, so the
// code is independent of host byte order and alignment.
#ifndef VTR_PLATFORM_LITTLE_ENDIAN_H_
#define VTR_PLATFORM_LITTLE_ENDIAN_H_

#include <cstddef>
#include <cstdint>

namespace vtr {

// Reads the N-byte little-endian unsigned integer at p (N <= 8).
template <typename T>
inline T LoadLittleEndian(const uint8_t* p) {
  T value = 0;
  for (size_t i = 0; i < sizeof(T); ++i) value |= static_cast<T>(static_cast<T>(p[i]) << (8 * i));
  return value;
}

// Writes value at p as a sizeof(T)-byte little-endian integer.
template <typename T>
inline void StoreLittleEndian(uint8_t* p, T value) {
  for (size_t i = 0; i < sizeof(T); ++i) p[i] = static_cast<uint8_t>(value >> (8 * i));
}

inline uint16_t LoadU16(const uint8_t* p) { return LoadLittleEndian<uint16_t>(p); }
inline uint32_t LoadU32(const uint8_t* p) { return LoadLittleEndian<uint32_t>(p); }
inline uint64_t LoadU64(const uint8_t* p) { return LoadLittleEndian<uint64_t>(p); }
inline void StoreU16(uint8_t* p, uint16_t v) { StoreLittleEndian(p, v); }
inline void StoreU32(uint8_t* p, uint32_t v) { StoreLittleEndian(p, v); }
inline void StoreU64(uint8_t* p, uint64_t v) { StoreLittleEndian(p, v); }

}  // namespace vtr

#endif  // VTR_PLATFORM_LITTLE_ENDIAN_H_
