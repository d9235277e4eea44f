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
// Prints the acquired header as text (the chunk map with --chunks), or as
// JSON with --json.
int RunShow(const ZarnutilInvocation& call);
// Reports both header copies; exit 0 only when both are sound and the same,
// kExitNo when either is not, kExitBadInput when neither is valid.
int RunCheck(const ZarnutilInvocation& call);
// Restores a copy that is not sound from the sound one; with no sound copy,
// repairs the valid one by the library's rules and writes both copies,
// unless the repair deletes or cuts short partitions and --force is not
// given (kExitNo, nothing written). --strict: the library's first fault
// fails the repair. --dry-run: says what it would do, writes nothing.
int RunRepair(const ZarnutilInvocation& call);
// Prints the exported partitions and their extents, as JSON with --json.
int RunExport(const ZarnutilInvocation& call);
// Draws the chunk map.
int RunMap(const ZarnutilInvocation& call);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_COMMANDS_H_
