#include "tools/zarnutil/chunk_map_picture.h"

#include <algorithm>
#include <optional>
#include <utility>
#include <vector>

#include "tools/zarnutil/report_format.h"

namespace vtr {
namespace {

constexpr uint32_t kColumns = 32;

// The partition a map value gives a chunk of, or nothing.
std::optional<uint32_t> OwnerOf(uint16_t value, uint32_t partitions) {
  const uint32_t p = value >> kZarnChunkPartitionShift;
  const bool wellFormed = (value & 0x0C00) == 0;
  if (p < partitions && wellFormed) return p;
  return std::nullopt;
}

char MarkOf(uint16_t value, uint32_t partitions) {
  if (value == kZarnChunkReserved) return '#';
  if (value == kZarnChunkFree) return '.';
  if (value == kZarnChunkInvalid) return 'x';
  if (std::optional<uint32_t> p = OwnerOf(value, partitions)) return static_cast<char>('A' + *p);
  return '?';
}

// Number of runs in (chunk offset, medium slot) pairs: a run goes on while
// the next chunk of the partition lies in the next slot.
size_t RunsOf(std::vector<std::pair<uint32_t, uint32_t>> chunks) {
  std::sort(chunks.begin(), chunks.end());
  size_t runs = 0;
  for (size_t i = 0; i < chunks.size(); ++i) {
    const bool continues = i > 0 && chunks[i].first == chunks[i - 1].first + 1 &&
                           chunks[i].second == chunks[i - 1].second + 1;
    if (!continues) ++runs;
  }
  return runs;
}

std::string Plural(size_t n, const char* word) {
  return std::to_string(n) + " " + word + (n == 1 ? "" : "s");
}

}  // namespace

std::string ChunkMapPicture(const ZarnMediaProperties& props, ZarnHeaderView header) {
  const uint32_t partitions = std::min(header.partitionCount(), kZarnMaxPartitions);
  std::string out = "chunk map: " + std::to_string(props.chunkCount) + " chunks of " +
                    HumanSize(props.chunkSize) + " on a medium of " + HumanSize(props.mediaSize) + "\n";
  out += "       0       8       16      24\n";
  for (uint32_t row = 0; row < kZarnChunkMapSlots; row += kColumns) {
    out += Hex(row, 3) + "  ";
    for (uint32_t s = row; s < row + kColumns; ++s) out += MarkOf(header.chunk(s), partitions);
    out += "\n";
  }

  std::vector<std::vector<std::pair<uint32_t, uint32_t>>> owned(partitions);
  size_t freeChunks = 0;
  size_t freeRuns = 0;
  for (uint32_t s = 0; s < kZarnChunkMapSlots; ++s) {
    const uint16_t value = header.chunk(s);
    if (value == kZarnChunkFree) {
      ++freeChunks;
      if (s == 0 || header.chunk(s - 1) != kZarnChunkFree) ++freeRuns;
    } else if (std::optional<uint32_t> p = OwnerOf(value, partitions)) {
      owned[*p].emplace_back(value & kZarnChunkOffsetMask, s);
    }
  }
  out += "legend: # reserved  . free  x beyond the medium  ? stray value\n";
  for (uint32_t p = 0; p < partitions; ++p) {
    out += "        " + std::string(1, static_cast<char>('A' + p)) + " partition " + std::to_string(p) + " " +
           JsonQuote(EntryName(header.entry(p))) + ": " + Plural(owned[p].size(), "chunk") + " in " +
           Plural(RunsOf(owned[p]), "run") + "\n";
  }
  out += "free: " + Plural(freeChunks, "chunk") + " (" + HumanSize(freeChunks * props.chunkSize) + ") in " +
         Plural(freeRuns, "run") + "\n";
  return out;
}

}  // namespace vtr
