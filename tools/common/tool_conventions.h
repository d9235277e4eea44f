// What vitdctl, vtr-manifest and zarnutil share: their exit statuses, which
// mean the same cause in each, and --version.
#ifndef VTR_TOOLS_COMMON_TOOL_CONVENTIONS_H_
#define VTR_TOOLS_COMMON_TOOL_CONVENTIONS_H_

#include <cstdio>

namespace vtr::tools {

// Exit statuses (the sysexits.h numbers for the causes that have one).
enum ExitStatus : int {
  kExitOk = 0,           // done; the answer is yes
  kExitNo = 1,           // the answer is no: a response false, a fault found, differences
  kExitUsage = 64,       // bad command line
  kExitBadInput = 65,    // an input that is not what it must be (not a manifest, no header, bad JSON)
  kExitNoInput = 66,     // an input that does not exist or cannot be opened
  kExitUnavailable = 69, // the helper cannot be reached
  kExitIoError = 74,     // reading or writing failed midway
  kExitNoAnswer = 75,    // the helper did not answer completely (timeout, connection closed)
};

// "TOOL (vitd) VERSION" on out, for --version.
void PrintVersion(const char* tool, FILE* out = stdout);

}  // namespace vtr::tools

#endif  // VTR_TOOLS_COMMON_TOOL_CONVENTIONS_H_
