// What a repair by the volume-manager library's rules did to a header, told
// in a few lines: the library prints a line per chunk it touches (and one for
// every free chunk), which says little to a person.
#ifndef VTR_TOOLS_ZARNUTIL_REPAIR_SUMMARY_H_
#define VTR_TOOLS_ZARNUTIL_REPAIR_SUMMARY_H_

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "storage/zarn_geometry.h"
#include "storage/zarn_layout.h"
#include "tools/zarnutil/report_format.h"

namespace vtr {

struct RepairSummary {
  struct Partition {
    uint32_t index = 0;
    std::string name;
    uint32_t chunks = 0;  // chunks the map gave it before the repair
    uint64_t size = 0;    // bytes before the repair
    uint64_t newSize = 0; // bytes after (0 when deleted)
  };
  std::vector<Partition> deleted;
  std::vector<Partition> truncated;
  uint32_t freedChunks = 0;  // map slots on the medium that held a chunk and are free now
  std::optional<uint64_t> oldMediaSize;  // set when the media size was corrected
  bool partitionCountFixed = false;
  bool chunkZeroReserved = false;  // slot 0 was not reserved and now is

  // Whether partitions lose data: deleted or cut short.
  bool losesData() const { return !deleted.empty() || !truncated.empty(); }
  bool empty() const;
  // One line per fact, without a trailing newline.
  std::vector<std::string> lines(const ZarnMediaProperties& props) const;
  // {"deleted_partitions": [{"index", "name", "chunks", "size"}...],
  //  "truncated_partitions": [{..., "new_size"}...], "freed_chunks",
  //  "media_size_corrected", "partition_count_corrected",
  //  "chunk_zero_reserved"}.
  Json json() const;
};

// Compares the header before and after a repair on props' medium.
RepairSummary SummariseRepair(const ZarnMediaProperties& props, ZarnHeaderView before, ZarnHeaderView after);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_REPAIR_SUMMARY_H_
