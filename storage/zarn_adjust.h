// Re-packing the partitions of a GPT after one of them is created, resized or
// deleted: the partitions keep their table positions and lengths and are laid
// out again back to back, in the order of their first LBAs, from the first
// usable LBA. Works on the caller's buffers only.
#ifndef VTR_STORAGE_ZARN_ADJUST_H_
#define VTR_STORAGE_ZARN_ADJUST_H_

#include <cstdint>

#include "storage/gpt_layout.h"
#include "storage/zarn_geometry.h"

namespace vtr {

// Gives partition partitionIndex of the GPT (gptHeader: kGptHeaderSize
// bytes; gptEntries: the kGptTableSize-byte table) newSizeBytes, rounded up
// to whole blocks of props' block size, then re-packs the table:
// - index equal to the entry count: a new HFS Plus partition "New" with a
//   fresh identity is appended (a zero size is refused);
// - a zero size: the partition is deleted and the entries after it move down;
// - otherwise the partition's last LBA follows from its first.
// Returns 0 after storing the new entry count in the header. Returns -1
// after one message for an index above 7 or above the entry count (or a
// header claiming more entries than the table holds), a zero-sized
// creation, or a layout that overflows the last usable LBA (the excess is
// printed in blocks, in hexadecimal; the entries then stay re-packed and the
// count is not stored). The GPT's CRCs are not touched: the caller computes
// them.
int zarnAdjustPartition(const ZarnMediaProperties* props, uint8_t* gptHeader, uint8_t* gptEntries,
                        uint32_t partitionIndex, uint64_t newSizeBytes);

}  // namespace vtr

#endif  // VTR_STORAGE_ZARN_ADJUST_H_
