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

// Checks options before anything is walked or written: the tree exists and
// is a directory (a manifest describes a tree), --relative-to names the tree
// or a folder above it, and each --skip a path inside the tree. On a fault it
// says why on the console and returns the exit status (kExitNoInput for a
// missing tree, kExitBadInput for a file, kExitUsage for the options); else
// kExitOk.
int CheckWalkOptions(const WalkOptions& options, Console& console);

}  // namespace vtr::manifest_tool

#endif  // VTR_TOOLS_VTR_MANIFEST_WALK_H_
