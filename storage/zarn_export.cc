#include "storage/zarn_export.h"

#include <algorithm>
#include <optional>

#include "storage/utf16.h"
#include "storage/zarn_geometry.h"
#include "storage/zarn_header.h"
#include "storage/zarn_map_scan.h"

namespace vtr {
namespace {

constexpr size_t kNameCapacity = 256;

// The medium chunk of each chunk offset of partition i, in offset order, or
// nothing when the partition spans no chunk or more than the map can hold,
// or a chunk is missing. Slots naming an offset past the partition's end are
// passed over.
std::optional<std::vector<uint16_t>> ChunksOf(const ZarnMediaProperties& props, ZarnHeaderView h, uint32_t i,
                                              uint64_t size) {
  const uint64_t chunks = ZarnChunksSpanned(props, size);
  if (chunks == 0 || chunks > kZarnChunkMapSlots) return std::nullopt;
  std::vector<uint16_t> slots(chunks, kZarnChunkInvalid);
  for (uint32_t j = 0; j < kZarnChunkMapSlots; ++j) {
    const uint16_t value = h.chunk(j);
    const uint32_t offset = value & kZarnChunkOffsetMask;
    if ((value >> kZarnChunkPartitionShift) == i && offset < chunks) slots[offset] = static_cast<uint16_t>(j);
  }
  if (std::find(slots.begin(), slots.end(), kZarnChunkInvalid) != slots.end()) return std::nullopt;
  return slots;
}

// The chunks as runs on the medium, neighbours merged.
std::vector<ZarnExtent> ExtentsOf(const ZarnMediaProperties& props, const std::vector<uint16_t>& slots) {
  std::vector<ZarnExtent> extents;
  for (uint16_t slot : slots) {
    const uint64_t offset = uint64_t{slot} << props.chunkShift;
    if (!extents.empty() && extents.back().offset + extents.back().length == offset) {
      extents.back().length += props.chunkSize;
    } else {
      extents.push_back({offset, props.chunkSize});
    }
  }
  extents.shrink_to_fit();
  return extents;
}

std::optional<ZarnExportedPartition> ExportPartition(const ZarnMediaProperties& props, ZarnHeaderView h,
                                                     uint32_t i) {
  const ZarnEntryView entry = h.entry(i);
  if (entry.end() < entry.begin()) return std::nullopt;
  ZarnExportedPartition partition;
  partition.size = entry.end() - entry.begin();
  std::copy(entry.type().begin(), entry.type().end(), partition.type.begin());
  std::copy(entry.identity().begin(), entry.identity().end(), partition.identity.begin());
  partition.index = static_cast<uint8_t>(i);
  if ((entry.attributes() & kZarnEntryExportedAttribute) != 0) {
    partition.flags = kZarnExportFlagAttribute;
    if ((h.flags() & 1) != 0) partition.flags |= kZarnExportFlagHeader;
  }
  uint8_t name[kNameCapacity];
  size_t nameLength = 0;
  utf_encodestr2(entry.name().data(), entry.name().size(), name, &nameLength, kNameCapacity);
  partition.name.assign(reinterpret_cast<const char*>(name), nameLength);

  std::optional<std::vector<uint16_t>> slots = ChunksOf(props, h, i, partition.size);
  if (!slots) return std::nullopt;
  partition.extents = ExtentsOf(props, *slots);
  return partition;
}

}  // namespace

int Zarn_ExportMediaInfo(const ZarnMedium& medium, uint8_t* mediaIdentityOut,
                         std::vector<ZarnExportedPartition>* listOut) {
  if (mediaIdentityOut == nullptr || listOut == nullptr) return -1;
  Result<uint32_t> blockSize = medium.blockSize();
  if (!blockSize.ok()) return -1;
  Result<uint64_t> blockCount = medium.blockCount();
  if (!blockCount.ok()) return -1;
  ZarnMediaProperties props;
  if (zarnInitMediaGeometry(&props, *blockCount * *blockSize, *blockSize) != 0) return -1;

  std::vector<uint8_t> block(std::max<size_t>(*blockSize, kZarnHeaderSize));
  if (medium.readAt(block.data(), block.size(), 0) != static_cast<ssize_t>(block.size())) return -1;
  if (zarnValidateHeader(block.data()) != 0) return -1;
  const ZarnHeaderView h(std::span<const uint8_t, kZarnHeaderSize>(block.data(), kZarnHeaderSize));
  std::copy(h.mediaIdentity().begin(), h.mediaIdentity().end(), mediaIdentityOut);

  // The table holds eight entries; a larger count would lead past it.
  const uint32_t count = h.partitionCount();
  if (count > kZarnMaxPartitions) return -1;
  std::vector<ZarnExportedPartition> list;
  for (uint32_t i = 0; i < count; ++i) {
    std::optional<ZarnExportedPartition> partition = ExportPartition(props, h, i);
    if (!partition) return -1;
    list.push_back(std::move(*partition));
  }
  *listOut = std::move(list);
  return 0;
}

int Zarn_ExportMediaInfo(int fd, uint8_t* mediaIdentityOut, std::vector<ZarnExportedPartition>* listOut,
                         uint32_t imageBlockSize) {
  return Zarn_ExportMediaInfo(FdZarnMedium(fd, imageBlockSize), mediaIdentityOut, listOut);
}

}  // namespace vtr
