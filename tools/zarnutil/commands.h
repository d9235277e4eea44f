// The sub-commands of zarnutil. Each works on one disk image or block device
// and returns the process exit status, one of the tools' common ones
// (tools/common/tool_conventions.h), after a message on standard error (the
// library's own where it gives one) when it fails.
#ifndef VTR_TOOLS_ZARNUTIL_COMMANDS_H_
#define VTR_TOOLS_ZARNUTIL_COMMANDS_H_

#include <cstdint>
#include <set>
#include <string>

#include "platform/block_geometry.h"

namespace vtr {

struct ZarnutilInvocation {
  uint32_t imageBlockSize = kDefaultImageBlockSize;  // --block-size
  std::string image;
  std::set<std::string> flags;  // the command's own options given, e.g. "--json"
  bool has(const char* flag) const { return flags.count(flag) != 0; }
};

// Writes a fresh header (both copies) for the medium's geometry.
int RunCreate(const ZarnutilInvocation& call);
// Prints the acquired header as text, or as JSON with --json.
int RunShow(const ZarnutilInvocation& call);
// Exit 0 when the acquired header is consistent with the medium.
int RunCheck(const ZarnutilInvocation& call);
// Repairs the acquired header and writes both copies; with --strict a fault
// fails and nothing is written.
int RunRepair(const ZarnutilInvocation& call);
// Prints the exported partitions and their extents, as JSON with --json.
int RunExport(const ZarnutilInvocation& call);
// Draws the chunk map.
int RunMap(const ZarnutilInvocation& call);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_COMMANDS_H_
