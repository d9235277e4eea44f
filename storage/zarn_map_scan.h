// Searches of the chunk map shared by the check, the repair and the export.
#ifndef VTR_STORAGE_ZARN_MAP_SCAN_H_
#define VTR_STORAGE_ZARN_MAP_SCAN_H_

#include <algorithm>
#include <cstdint>
#include <utility>
#include <vector>

#include "storage/zarn_geometry.h"
#include "storage/zarn_layout.h"

namespace vtr {

// One past the last map slot that lies on the medium, never past the map
// (props that did not come from zarnInitMediaGeometry may claim more).
inline uint32_t ZarnMediumSlots(const ZarnMediaProperties& props) {
  return std::min(props.chunkCount, kZarnChunkMapSlots);
}

// Number of chunks a partition of length bytes spans (rounded up).
inline uint64_t ZarnChunksSpanned(const ZarnMediaProperties& props, uint64_t length) {
  const uint64_t whole = length >> props.chunkShift;
  return whole + ((length & (props.chunkSize - 1)) != 0 ? 1 : 0);
}

// The map value of chunk offset k of partition i, (i << 12) | k, kept in
// full width as the volume manager compares it with a slot.
inline uint64_t ZarnChunkValue(uint32_t partition, uint64_t k) {
  return (uint64_t{partition} << kZarnChunkPartitionShift) | k;
}

// The offset in bytes, within its partition, of the chunk a map value names.
inline uint64_t ZarnChunkByteOffset(const ZarnMediaProperties& props, uint16_t value) {
  return uint64_t{static_cast<uint16_t>(value & kZarnChunkOffsetMask)} << props.chunkShift;
}

// The slots on the medium (1 .. chunk count - 1) grouped by the value they
// hold, so that finding a chunk costs a search rather than a pass over the
// map: the check and the repair look up every chunk of every partition.
// A snapshot: later edits of the header are not seen.
class ZarnSlotIndex {
 public:
  ZarnSlotIndex(const ZarnMediaProperties& props, ZarnHeaderView header);

  // The slots holding value, in increasing order; none for a value wider
  // than a map slot.
  std::vector<uint32_t> slotsHolding(uint64_t value) const;

 private:
  std::vector<std::pair<uint16_t, uint16_t>> entries_;  // (value, slot), sorted
};

}  // namespace vtr

#endif  // VTR_STORAGE_ZARN_MAP_SCAN_H_
