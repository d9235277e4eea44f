// What `zarnutil export` prints: the exported partition list with the
// physical extents of each partition, as text or as one JSON object.
#ifndef VTR_TOOLS_ZARNUTIL_EXPORT_REPORT_H_
#define VTR_TOOLS_ZARNUTIL_EXPORT_REPORT_H_

#include <string>
#include <vector>

#include "storage/zarn_export.h"

namespace vtr {

std::string ExportText(const ZarnUuid& mediaIdentity, const std::vector<ZarnExportedPartition>& partitions);

// {"media_identity", "partitions": [{"index", "name", "type", "identity",
//  "size", "flags", "extents": [{"offset", "length"}...]}...]}, with a newline.
std::string ExportJson(const ZarnUuid& mediaIdentity, const std::vector<ZarnExportedPartition>& partitions);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_EXPORT_REPORT_H_
