// Creating a fresh Zarn header and protecting it with its CRC. Buffers are
// the caller's 4096-byte header images (kZarnHeaderSize); nothing is kept
// between calls, so different buffers may be worked on from different threads.
#ifndef VTR_STORAGE_ZARN_HEADER_H_
#define VTR_STORAGE_ZARN_HEADER_H_

#include <cstdint>

#include "storage/zarn_geometry.h"
#include "storage/zarn_layout.h"

namespace vtr {

// Fills header (4096 bytes) with a fresh CRC-protected header for props: a
// new random media identity, the given flags, one HFS Plus partition named
// "Zarn" from 2 x block size + 16 KiB over the usable size, the chunk map
// giving that partition its chunks in order, the remaining chunks free and
// slots beyond the medium invalid. The CRC field stays zero: call
// zarnSetHeaderCRC before writing. Returns 0, or -1 after a message when
// props or header is null.
int zarnCreateHeaderWithFlags(const ZarnMediaProperties* props, uint8_t* header, uint64_t flags);
// zarnCreateHeaderWithFlags with flags 0.
int zarnCreateHeader(const ZarnMediaProperties* props, uint8_t* header);

// For a CRC-protected header: zeroes the CRC field, computes zlib's crc32
// over the 4096 bytes, stores it and returns it (as the int of its bits).
// For any other kind the header is left alone and the non-zero result of
// comparing its type identifier with the CRC-protected one is returned.
// header must not be null.
int zarnSetHeaderCRC(uint8_t* header);

// 0 when header is a CRC-protected header whose stored CRC is right, or a
// header without CRC (its CRC field is not looked at); -1 on a CRC mismatch;
// -2 for an unknown type identifier. Validating a CRC-protected header
// rewrites its CRC field with the recomputed value, so a header that failed
// once passes a second validation: callers re-read instead of re-validating.
// header must not be null.
int zarnValidateHeader(uint8_t* header);

}  // namespace vtr

#endif  // VTR_STORAGE_ZARN_HEADER_H_
