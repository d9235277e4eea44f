#include "storage/zarn_check.h"

#include "storage/zarn_diagnostics.h"
#include "storage/zarn_layout.h"
#include "storage/zarn_map_scan.h"

namespace vtr {
namespace {

// Lowest byte a partition may start at: past chunk 0's header blocks.
uint64_t PartitionFloor(uint64_t blockBytes) { return 2 * blockBytes + 16384; }

// The tests of one used partition entry i; false after printing the fault.
bool CheckPartition(const ZarnMediaProperties& props, ZarnHeaderView h, uint32_t i) {
  const ZarnEntryView entry = h.entry(i);
  const uint64_t floor = PartitionFloor(props.blockSize);
  const uint64_t alignment = (uint64_t{1} << props.blockShift) - 1;
  const int index = static_cast<int>(i);
  if (entry.typeIsZero()) {
    std::fprintf(stderr, "zarn: partition %d has type zero\n", index);
    return false;
  }
  if (entry.identityIsZero()) {
    std::fprintf(stderr, "zarn: partition %d has identity zero\n", index);
    return false;
  }
  if (entry.begin() < floor) {
    std::fprintf(stderr, "zarn: partition %d starts too low\n", index);
    return false;
  }
  if (entry.end() > props.usableSize + floor) {
    std::fprintf(stderr, "zarn: partition %d ends too high\n", index);
    return false;
  }
  if (entry.end() <= entry.begin()) {
    std::fprintf(stderr, "zarn: partition %d start/end not in order\n", index);
    return false;
  }
  if ((entry.begin() & alignment) != 0 || (entry.end() & alignment) != 0) {
    std::fprintf(stderr, "zarn: partition %d start/end not block aligned\n", index);
    return false;
  }
  for (uint32_t j = 0; j < i; ++j) {
    const ZarnEntryView other = h.entry(j);
    if (other.begin() < entry.end() && entry.begin() < other.end()) {
      std::fprintf(stderr, "zarn: partition %d overlaps partition %d\n", index, static_cast<int>(j));
      return false;
    }
  }
  // Each chunk must stand exactly once; a duplicate counts as missing. At
  // most 1023 slots can match, so this ends by offset 1023 at the latest.
  const uint64_t chunks = ZarnChunksSpanned(props, entry.end() - entry.begin());
  const ZarnSlotIndex slots(props, h);
  for (uint64_t k = 0; k < chunks; ++k) {
    if (slots.slotsHolding(ZarnChunkValue(i, k)).size() != 1) {
      std::fprintf(stderr, "zarn: partition %d missing chunk 0x%04x\n", index, static_cast<unsigned>(k));
      return false;
    }
  }
  return true;
}

// Every map slot on the medium is free or a valid chunk of a partition.
bool CheckMediumSlots(const ZarnMediaProperties& props, ZarnHeaderView h, uint32_t count) {
  for (uint32_t s = 1; s < ZarnMediumSlots(props); ++s) {
    const uint16_t value = h.chunk(s);
    if (value == kZarnChunkFree) continue;
    const uint32_t p = value >> kZarnChunkPartitionShift;
    if (p >= count) {
      std::fprintf(stderr, "zarn: chunk 0x%04x claims nonexistent partition (0x%04x)\n", s, unsigned{value});
      return false;
    }
    // A chunk starting exactly at the partition's end passes, as in the
    // volume manager.
    const ZarnEntryView owner = h.entry(p);
    if (ZarnChunkByteOffset(props, value) > owner.end() - owner.begin()) {
      std::fprintf(stderr, "zarn: chunk 0x%04x assigned to invalid partition offset (0x%04x)\n", s,
                   unsigned{value});
      return false;
    }
  }
  return true;
}

}  // namespace

int zarnCheckHeader(const ZarnMediaProperties* props, const uint8_t* header) {
  if (!ZarnArgumentsPresent(props, header)) return -1;
  const ZarnHeaderView h(header);
  if (!h.hasKnownType()) {
    ZarnPrint("zarn: media header mismatch\n");
    return -1;
  }
  if (h.mediaSize() != props->mediaSize) {
    ZarnPrint("zarn: media size mismatch\n");
    return -1;
  }
  const uint32_t count = h.partitionCount();
  if (count > kZarnMaxPartitions) {
    ZarnPrint("zarn: illegal partition count\n");
    return -1;
  }
  for (uint32_t i = 0; i < count; ++i) {
    if (!CheckPartition(*props, h, i)) return -1;
  }
  for (uint32_t i = count; i < kZarnMaxPartitions; ++i) {
    if (!h.entry(i).isEmpty()) {
      std::fprintf(stderr, "zarn: partition %d orphaned\n", static_cast<int>(i));
      return -1;
    }
  }
  if (h.chunk(0) != kZarnChunkReserved) {
    ZarnPrint("zarn: chunk zero not marked reserved\n");
    return -1;
  }
  if (!CheckMediumSlots(*props, h, count)) return -1;
  for (uint32_t s = props->chunkCount; s < kZarnChunkMapSlots; ++s) {
    if (h.chunk(s) != kZarnChunkInvalid) {
      std::fprintf(stderr, "zarn: chunk 0x%04x not invalid (0x%04x)\n", s, unsigned{h.chunk(s)});
      return -1;
    }
  }
  return 0;
}

}  // namespace vtr
