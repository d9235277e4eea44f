// What `zarnutil show` prints: a Zarn header as text for people, or as one
// JSON object for programs.
#ifndef VTR_TOOLS_ZARNUTIL_HEADER_REPORT_H_
#define VTR_TOOLS_ZARNUTIL_HEADER_REPORT_H_

#include <string>

#include "storage/zarn_geometry.h"
#include "storage/zarn_layout.h"

namespace vtr {

// The header's fields, the medium's geometry, each listed partition (at most
// eight, whatever the count claims) and, with chunks, the chunk map, 16
// slots a line.
std::string HeaderText(const ZarnMediaProperties& props, ZarnHeaderView header, bool chunks);

// {"media_size", "media_identity", "partition_count", "crc", "flags",
//  "partitions": [{"index", "type", "identity", "begin", "end",
//  "attributes", "name"}...], "chunk_map": [1024 numbers]}, with a newline.
std::string HeaderJson(ZarnHeaderView header);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_HEADER_REPORT_H_
