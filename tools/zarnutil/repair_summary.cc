#include "tools/zarnutil/repair_summary.h"

#include <algorithm>

namespace vtr {
namespace {

uint32_t ListedPartitions(ZarnHeaderView header) { return std::min(header.partitionCount(), kZarnMaxPartitions); }

// The map slots on the medium (chunk 0 aside) that give partition i a chunk.
uint32_t ChunksOf(const ZarnMediaProperties& props, ZarnHeaderView header, uint32_t i) {
  uint32_t chunks = 0;
  for (uint32_t s = 1; s < std::min(props.chunkCount, kZarnChunkMapSlots); ++s) {
    const uint16_t value = header.chunk(s);
    if (value != kZarnChunkFree && value != kZarnChunkInvalid && (value >> kZarnChunkPartitionShift) == i) ++chunks;
  }
  return chunks;
}

uint64_t SizeOf(const ZarnEntryView& entry) { return entry.end() > entry.begin() ? entry.end() - entry.begin() : 0; }

std::string Named(const RepairSummary::Partition& p) {
  return "partition " + std::to_string(p.index) + " " + JsonQuote(p.name);
}

}  // namespace

bool RepairSummary::empty() const {
  return !losesData() && freedChunks == 0 && !oldMediaSize && !partitionCountFixed && !chunkZeroReserved;
}

RepairSummary SummariseRepair(const ZarnMediaProperties& props, ZarnHeaderView before, ZarnHeaderView after) {
  RepairSummary summary;
  if (before.mediaSize() != after.mediaSize()) summary.oldMediaSize = before.mediaSize();
  summary.partitionCountFixed = before.partitionCount() > kZarnMaxPartitions;
  summary.chunkZeroReserved = before.chunk(0) != kZarnChunkReserved && after.chunk(0) == kZarnChunkReserved;
  for (uint32_t i = 0; i < ListedPartitions(before); ++i) {
    const ZarnEntryView entry = before.entry(i);
    RepairSummary::Partition p{i, EntryName(entry), ChunksOf(props, before, i), SizeOf(entry), 0};
    if (i >= after.partitionCount()) {
      summary.deleted.push_back(p);
    } else if (after.entry(i).end() != entry.end()) {
      p.newSize = SizeOf(after.entry(i));
      summary.truncated.push_back(p);
    }
  }
  for (uint32_t s = 1; s < std::min(props.chunkCount, kZarnChunkMapSlots); ++s) {
    summary.freedChunks += before.chunk(s) != kZarnChunkFree && after.chunk(s) == kZarnChunkFree;
  }
  return summary;
}

std::vector<std::string> RepairSummary::lines(const ZarnMediaProperties& props) const {
  std::vector<std::string> out;
  for (const Partition& p : deleted) {
    out.push_back("deletes " + Named(p) + " (" + HumanSize(p.size) + ", " + std::to_string(p.chunks) + " chunks)");
  }
  for (const Partition& p : truncated) {
    out.push_back("cuts " + Named(p) + " short from " + HumanSize(p.size) + " to " + HumanSize(p.newSize));
  }
  if (freedChunks != 0) {
    out.push_back("frees " + std::to_string(freedChunks) + " chunks (" +
                  HumanSize(uint64_t{freedChunks} * props.chunkSize) + ")");
  }
  if (oldMediaSize) out.push_back("sets the media size from " + std::to_string(*oldMediaSize) + " bytes to " +
                                  std::to_string(props.mediaSize));
  if (partitionCountFixed) out.push_back("limits the partition count to 8");
  if (chunkZeroReserved) out.push_back("reserves chunk 0 for the header copies");
  return out;
}

Json RepairSummary::json() const {
  auto list = [](const std::vector<Partition>& partitions, bool withNewSize) {
    Json out = Json::array();
    for (const Partition& p : partitions) {
      Json entry = {{"index", p.index}, {"name", p.name}, {"chunks", p.chunks}, {"size", p.size}};
      if (withNewSize) entry["new_size"] = p.newSize;
      out.push_back(std::move(entry));
    }
    return out;
  };
  return {{"deleted_partitions", list(deleted, false)},
          {"truncated_partitions", list(truncated, true)},
          {"freed_chunks", freedChunks},
          {"media_size_corrected", oldMediaSize.has_value()},
          {"partition_count_corrected", partitionCountFixed},
          {"chunk_zero_reserved", chunkZeroReserved}};
}

}  // namespace vtr
