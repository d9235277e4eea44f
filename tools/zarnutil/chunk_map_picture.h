// What `zarnutil map` prints: the chunk map as a 32 x 32 grid, one character
// per chunk, so that free space and fragmentation show at a glance:
//   A..H  a chunk of partition 0..7     #  reserved (chunk 0, the headers)
//   .     free                          x  beyond the end of the medium
//   ?     anything else (a stray value, or a partition the table lacks)
// A legend follows, with each partition's chunk count and number of runs
// (contiguous stretches on the medium), and the free chunks and their runs.
#ifndef VTR_TOOLS_ZARNUTIL_CHUNK_MAP_PICTURE_H_
#define VTR_TOOLS_ZARNUTIL_CHUNK_MAP_PICTURE_H_

#include <string>

#include "storage/zarn_geometry.h"
#include "storage/zarn_layout.h"

namespace vtr {

std::string ChunkMapPicture(const ZarnMediaProperties& props, ZarnHeaderView header);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_CHUNK_MAP_PICTURE_H_
