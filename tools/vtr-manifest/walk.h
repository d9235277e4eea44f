// Running the manifest builder for the tool's commands, with the progress
// bar on a terminal.
#ifndef VTR_TOOLS_VTR_MANIFEST_WALK_H_
#define VTR_TOOLS_VTR_MANIFEST_WALK_H_

#include "model/manifest.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/console.h"

namespace vtr::manifest_tool {

// Fills a new manifest from options, handing each record to handler; the
// fill's answer. When console draws progress, the builder's progress goes
// to its bar.
bool RunWalk(const WalkOptions& options, const VTRManifest::Handler& handler, Console& console);

}  // namespace vtr::manifest_tool

#endif  // VTR_TOOLS_VTR_MANIFEST_WALK_H_
