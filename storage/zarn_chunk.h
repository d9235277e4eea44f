// Finding the medium chunk that holds a given place of a partition.
#ifndef VTR_STORAGE_ZARN_CHUNK_H_
#define VTR_STORAGE_ZARN_CHUNK_H_

#include <cstdint>

#include "storage/zarn_geometry.h"

namespace vtr {

// Stores in *chunkOut the map slot (medium chunk number) holding byte
// byteOffset of partition `partition` of header (4096 bytes), and returns 0.
// Returns -1, printing nothing, for a partition index above 7, an offset at
// or past the partition's end, a chunk offset above the medium's chunk count
// (an offset equal to the count is let through, as the volume manager does),
// a chunk that no map slot holds, or a null argument. The first matching
// slot wins.
int zarnChunkContainingPartitionByte(const ZarnMediaProperties* props, const uint8_t* header, uint32_t partition,
                                     uint64_t byteOffset, uint16_t* chunkOut);

// The same for block `block` of the partition (block x block size bytes in).
int zarnChunkContainingPartitionBlock(const ZarnMediaProperties* props, const uint8_t* header, uint32_t partition,
                                      uint64_t block, uint16_t* chunkOut);

}  // namespace vtr

#endif  // VTR_STORAGE_ZARN_CHUNK_H_
