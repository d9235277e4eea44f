// The partition list of a Zarn medium with the physical extents of each
// partition, for callers that address the partitions on the raw medium.
#ifndef VTR_STORAGE_ZARN_EXPORT_H_
#define VTR_STORAGE_ZARN_EXPORT_H_

#include <cstdint>
#include <string>
#include <vector>

#include "platform/block_geometry.h"
#include "storage/zarn_layout.h"
#include "storage/zarn_medium.h"

namespace vtr {

// A run of whole chunks on the medium.
struct ZarnExtent {
  uint64_t offset = 0;  // byte offset on the medium
  uint64_t length = 0;  // bytes
};

// Flag bits of an exported partition.
inline constexpr uint8_t kZarnExportFlagAttribute = 0x01;  // entry attribute bit 48 set
inline constexpr uint8_t kZarnExportFlagHeader = 0x02;     // with it, header flag bit 0

// One partition as exported. The caller owns it and its extents.
struct ZarnExportedPartition {
  std::string name;  // UTF-8, from the entry's UTF-16LE name
  ZarnUuid type{};
  ZarnUuid identity{};
  uint64_t size = 0;  // end - begin, bytes
  uint8_t flags = 0;
  uint8_t index = 0;  // position in the header's partition table
  std::vector<ZarnExtent> extents;  // in partition order, adjacent chunks merged
};

// Reads the main header copy of the medium, stores the media identity in
// mediaIdentityOut (16 bytes) and the partitions in *listOut (empty when the
// header has none), and returns 0. Chunks named past a partition's end are
// passed over.
// Returns -1, leaving *listOut untouched, when the geometry cannot be had or
// is refused, the header cannot be read or does not validate, it claims more
// than 8 partitions, or a partition has a negative or zero size, spans more
// than 1024 chunks or misses one of its chunks in the map. The backup copy is
// not consulted. Only the geometry refusal prints (its own message).
int Zarn_ExportMediaInfo(const ZarnMedium& medium, uint8_t* mediaIdentityOut,
                         std::vector<ZarnExportedPartition>* listOut);

// The same for the medium open as fd: a block device, or a regular file
// holding a disk image read in blocks of imageBlockSize (see BlockSizeOf).
int Zarn_ExportMediaInfo(int fd, uint8_t* mediaIdentityOut, std::vector<ZarnExportedPartition>* listOut,
                         uint32_t imageBlockSize = kDefaultImageBlockSize);

}  // namespace vtr

#endif  // VTR_STORAGE_ZARN_EXPORT_H_
