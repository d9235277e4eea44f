// Consistency of a Zarn header with its medium: the check reports the first
// fault it finds; the repair edits the header until it is consistent (or, in
// strict mode, refuses at the first fault in the partition table or map).
// Neither looks at the CRC. Both work only on the caller's buffers.
#ifndef VTR_STORAGE_ZARN_CHECK_H_
#define VTR_STORAGE_ZARN_CHECK_H_

#include <cstdint>

#include "storage/zarn_geometry.h"

namespace vtr {

// 0 when header (4096 bytes) is consistent with props: a known type, the
// medium's size, at most 8 partitions each well placed, block aligned,
// apart from the others and holding each of its chunks exactly once in the
// map, unused entries empty, chunk 0 reserved, every map slot on the medium
// free or a valid chunk of an existing partition, and every slot beyond the
// medium invalid. Otherwise -1 after one message naming the first fault.
// A chunk that stands twice in the map is reported as missing, as the
// volume manager does.
int zarnCheckHeader(const ZarnMediaProperties* props, const uint8_t* header);

// Repairs header (4096 bytes) in place for props: the media size and
// partition count are corrected, faulty partitions are deleted (with all
// that follow them), a partition missing a chunk is cut short before it (or
// deleted when its first chunk is missing), duplicate and
// stray map slots are freed, chunk 0 is reserved. Slots beyond the medium are
// left alone, and the CRC is not refreshed (call zarnSetHeaderCRC).
// With strict non-zero, the first fault in the media size, the partition
// table or a partition's chunks fails the repair instead (header may then be
// partly edited). Returns 0, or -1 on bad arguments or a strict failure.
// The order test is the reverse of the check's (a partition whose begin lies
// below its end is taken as faulty), and free slots are each "reclaimed" with
// a message: both kept as the volume manager does them.
int zarnRepairHeader(const ZarnMediaProperties* props, uint8_t* header, int strict);

}  // namespace vtr

#endif  // VTR_STORAGE_ZARN_CHECK_H_
