// The geometry of a medium managed by the Zarn volume manager: its size and
// block size, and the chunk size that lets 1024 chunks cover it. Plain data,
// filled once by zarnInitMediaGeometry and then only read.
#ifndef VTR_STORAGE_ZARN_GEOMETRY_H_
#define VTR_STORAGE_ZARN_GEOMETRY_H_

#include <cstdint>

namespace vtr {

// Largest medium the header can describe (4 TiB; 1024 chunks of 4 GiB).
inline constexpr uint64_t kZarnMaxMediaSize = uint64_t{1} << 42;
inline constexpr uint32_t kZarnMinBlockSize = 4096;
inline constexpr uint32_t kZarnMaxBlockSize = 16384;

struct ZarnMediaProperties {
  uint64_t mediaSize = 0;   // bytes
  uint64_t usableSize = 0;  // bytes given to partition 0 of a fresh header
  uint32_t chunkCount = 0;  // whole chunks on the medium, at most 1024
  uint32_t blockSize = 0;   // bytes; not necessarily a power of two
  uint32_t blockShift = 0;  // floor(log2(blockSize))
  // 1 << chunkShift. Kept in 64 bits: a medium above 2 TiB has 4 GiB chunks,
  // which a 32-bit field would turn into 0.
  uint64_t chunkSize = 0;
  uint32_t chunkShift = 0;  // 0..32
};

// Fills props for a medium of mediaSize bytes read in blocks of blockSize.
// Returns 0, or -1 after one message: null props, a medium above 4 TiB
// (exactly 4 TiB is accepted), a block size below 4096 or above 16384. The
// media and block sizes are stored even when refused. A chunk smaller than a
// block prints "zarn: media too small" but still succeeds.
// usableSize is (chunkCount - 8) chunks with the subtraction done in 32 bits,
// so a medium of fewer than 8 chunks gets a huge usable size; kept as the
// volume manager computes it.
int zarnInitMediaGeometry(ZarnMediaProperties* props, uint64_t mediaSize, uint32_t blockSize);

}  // namespace vtr

#endif  // VTR_STORAGE_ZARN_GEOMETRY_H_
