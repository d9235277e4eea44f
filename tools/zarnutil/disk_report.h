// "zarnutil disk": the boot disk as the data-partition resize sees it.
#ifndef VTR_TOOLS_ZARNUTIL_DISK_REPORT_H_
#define VTR_TOOLS_ZARNUTIL_DISK_REPORT_H_

#include "tools/zarnutil/commands.h"

namespace vtr {

// Prints the disk (a block device of the whole disk, or an image): its
// block size and count, whether its MBR carries the Zarn signature, both
// GPT copies checked by their CRCs, every entry (position, name, first and
// last block, size, unique GUID, which one is "Data"), the usable blocks no
// entry holds, and the file system mounted from the "Data" entry with its
// size. As JSON with --json. 0, or 1 when the disk cannot be read.
int RunDisk(const ZarnutilInvocation& call);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_DISK_REPORT_H_
