#include "tools/common/tool_conventions.h"

namespace vtr::tools {

void PrintVersion(const char* tool, FILE* out) { std::fprintf(out, "%s (vitd) %s\n", tool, VTR_VERSION); }

}  // namespace vtr::tools
