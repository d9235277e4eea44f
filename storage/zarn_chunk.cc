#include "storage/zarn_chunk.h"

#include "storage/zarn_layout.h"

namespace vtr {

int zarnChunkContainingPartitionByte(const ZarnMediaProperties* props, const uint8_t* header, uint32_t partition,
                                     uint64_t byteOffset, uint16_t* chunkOut) {
  if (props == nullptr || header == nullptr || chunkOut == nullptr) return -1;
  if (partition >= kZarnMaxPartitions) return -1;
  const ZarnHeaderView h(header);
  const ZarnEntryView entry = h.entry(partition);
  if (entry.begin() + byteOffset >= entry.end()) return -1;
  const uint64_t k = byteOffset >> props->chunkShift;
  if ((k & 0xFFFF) > props->chunkCount) return -1;
  const auto wanted = static_cast<uint16_t>(((partition << kZarnChunkPartitionShift) & 0xF000) |
                                            (k & kZarnChunkOffsetMask));
  for (uint32_t s = 0; s < kZarnChunkMapSlots; ++s) {
    if (h.chunk(s) == wanted) {
      *chunkOut = static_cast<uint16_t>(s);
      return 0;
    }
  }
  return -1;
}

int zarnChunkContainingPartitionBlock(const ZarnMediaProperties* props, const uint8_t* header, uint32_t partition,
                                      uint64_t block, uint16_t* chunkOut) {
  if (props == nullptr) return -1;
  return zarnChunkContainingPartitionByte(props, header, partition, block * props->blockSize, chunkOut);
}

}  // namespace vtr
