#include <algorithm>

#include "storage/zarn_check.h"
#include "storage/zarn_diagnostics.h"
#include "storage/zarn_layout.h"
#include "storage/zarn_map_scan.h"

namespace vtr {
namespace {

enum class Outcome { kKept, kDeleted, kFailed };

// Removes partitions i.. (lenient repair of a fault at partition i).
void DeleteFrom(ZarnHeaderEditor h, uint32_t i, uint32_t* count) {
  ZarnPrint("zarn: deleting partition(s) and fixing partition count\n");
  *count = i;
  h.setPartitionCount(i);
  for (uint32_t j = i; j < kZarnMaxPartitions; ++j) h.entry(j).clear();
}

// The first fault of entry i's placement, printed; false when there is none.
bool ReportEntryFault(const ZarnMediaProperties& props, ZarnHeaderView h, uint32_t i) {
  const ZarnEntryView entry = h.entry(i);
  const uint64_t floor = 2 * (uint64_t{1} << props.blockShift) + 16384;
  const int index = static_cast<int>(i);
  const auto misaligned = [&props](uint64_t offset) {
    return props.blockSize == 0 || offset % props.blockSize != 0;
  };
  if (entry.typeIsZero() || entry.identityIsZero()) {
    ZarnPrint("zarn: found null partition type/identity\n");
  } else if (entry.begin() <= entry.end()) {
    // The reverse of the check's order test, as the volume manager has it.
    std::fprintf(stderr, "zarn: partition %d start/end not in order\n", index);
  } else if (entry.begin() < floor) {
    std::fprintf(stderr, "zarn: partition %d starts too low\n", index);
  } else if (entry.end() > props.usableSize + floor) {
    std::fprintf(stderr, "zarn: partition %d ends too high\n", index);
  } else if (misaligned(entry.begin()) || misaligned(entry.end())) {
    std::fprintf(stderr, "zarn: partition %d start/end not block aligned\n", index);
  } else if (i >= 2 && entry.begin() < h.entry(i - 1).end()) {
    std::fprintf(stderr, "zarn: partition %d out of order or overlapping\n", index);
  } else {
    return false;
  }
  return true;
}

// Finds each chunk of partition i in the map: duplicates are freed, a
// missing first chunk deletes the partition, a later missing chunk k
// truncates it to k chunks (the span is taken anew for each k, so the scan
// ends there). Strict mode fails at the first of these. Each chunk found
// takes one of at most 1023 slots, so the scan ends by offset 1023 whatever
// length the entry claims.
Outcome RepairChunks(const ZarnMediaProperties& props, ZarnHeaderEditor h, uint32_t i, bool strict,
                     uint32_t* count) {
  ZarnEntryEditor entry = h.entry(i);
  const int index = static_cast<int>(i);
  const ZarnSlotIndex slots(props, h);
  for (uint64_t k = 0; k < ZarnChunksSpanned(props, entry.end() - entry.begin()); ++k) {
    const std::vector<uint32_t> holding = slots.slotsHolding(ZarnChunkValue(i, k));
    const bool found = !holding.empty();
    if (holding.size() > 1 && strict) {
      std::fprintf(stderr, "zarn: partition %d duplicate chunk 0x%04x\n", index, static_cast<unsigned>(k));
      return Outcome::kFailed;
    }
    // The first slot keeps the chunk; later ones are freed silently.
    for (size_t d = 1; d < holding.size(); ++d) h.setChunk(holding[d], kZarnChunkFree);
    if (found) continue;
    if (strict) {
      std::fprintf(stderr, "zarn: partition %d missing chunk 0x%04x\n", index, static_cast<unsigned>(k));
      return Outcome::kFailed;
    }
    if (k == 0) {
      DeleteFrom(h, i, count);
      return Outcome::kDeleted;
    }
    entry.setEnd(entry.begin() + (k << props.chunkShift));
    std::fprintf(stderr, "zarn: truncated partition %d\n", index);
  }
  return Outcome::kKept;
}

// Frees every slot on the medium that is not a chunk within a partition.
void ReclaimStraySlots(const ZarnMediaProperties& props, ZarnHeaderEditor h, uint32_t count) {
  for (uint32_t s = 1; s < ZarnMediumSlots(props); ++s) {
    const uint16_t value = h.chunk(s);
    const uint32_t p = value >> kZarnChunkPartitionShift;
    if (p < count) {
      // Unlike the check, a chunk exactly at the end is reclaimed.
      const ZarnEntryView owner = h.entry(p);
      if (ZarnChunkByteOffset(props, value) >= owner.end() - owner.begin()) {
        std::fprintf(stderr, "zarn: reclaiming chunk 0x%04x off the end of partition %d\n", s, static_cast<int>(p));
        h.setChunk(s, kZarnChunkFree);
      }
    } else {
      // Free slots land here too and are announced each time, as the
      // volume manager does.
      std::fprintf(stderr, "zarn: reclaiming chunk 0x%04x not assigned to valid partition\n", s);
      h.setChunk(s, kZarnChunkFree);
    }
  }
}

}  // namespace

int zarnRepairHeader(const ZarnMediaProperties* props, uint8_t* header, int strict) {
  if (!ZarnArgumentsPresent(props, header)) return -1;
  ZarnHeaderEditor h(header);
  if (!h.hasKnownType()) {
    ZarnPrint("zarn: media header mismatch\n");
    return -1;
  }
  if (h.mediaSize() != props->mediaSize) {
    if (h.mediaSize() > props->mediaSize && strict) {
      ZarnPrint("zarn: media size smaller than required by header\n");
      return -1;
    }
    ZarnPrint("zarn: adjusting header media size\n");
    h.setMediaSize(props->mediaSize);
  }
  uint32_t count = h.partitionCount();
  if (count > kZarnMaxPartitions) {
    ZarnPrint("zarn: fixing illegal partition count\n");
    count = kZarnMaxPartitions;
    h.setPartitionCount(count);
  }
  for (uint32_t i = 0; i < count; ++i) {
    if (ReportEntryFault(*props, h, i)) {
      if (strict) {
        ZarnPrint("zarn: partition table corrupt\n");
        return -1;
      }
      DeleteFrom(h, i, &count);
      break;
    }
    const Outcome outcome = RepairChunks(*props, h, i, strict != 0, &count);
    if (outcome == Outcome::kFailed) return -1;
    if (outcome == Outcome::kDeleted) break;
  }
  if (h.chunk(0) != kZarnChunkReserved) {
    ZarnPrint("zarn: fixing chunk0 assignment\n");
    h.setChunk(0, kZarnChunkReserved);
  }
  ReclaimStraySlots(*props, h, count);
  return 0;
}

}  // namespace vtr
