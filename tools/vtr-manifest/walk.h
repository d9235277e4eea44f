// Running the manifest builder for the tool's commands, with the progress
// bar on a terminal.
//
// The tool names items by their canonical paths: the tree is resolved once
// (links, ".", "..", a trailing "/") and every key is the item's path with
// the root cut off its front, so a tree gives the same keys whatever spelling
// it was named in, and no two items share a key.
#ifndef VTR_TOOLS_VTR_MANIFEST_WALK_H_
#define VTR_TOOLS_VTR_MANIFEST_WALK_H_

#include <string>
#include <vector>

#include "model/manifest.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/console.h"

namespace vtr::manifest_tool {

// Makes options canonical and checks them before anything is walked or
// written: the tree must exist and be a directory (a manifest describes a
// tree) and becomes its real absolute path; --relative-to likewise, and must
// be the tree or a folder above it; each --skip (relative ones are taken
// below the tree, or from the current folder when only that names something
// in the tree) becomes the absolute path it names, links above its last
// component resolved, and must lie inside the tree. On a fault it says why
// on the console and returns the exit status (kExitNoInput for a missing
// tree, kExitBadInput for a file, kExitUsage for the options); else kExitOk.
int PrepareWalkOptions(WalkOptions& options, Console& console);

// path as an absolute path with the links above its last component
// resolved (the last component itself is not followed); when its folder does
// not exist, path made absolute as text.
std::string CanonicalItemPath(const std::string& path);

// What a fill made of the tree.
struct WalkOutcome {
  bool filled = false;  // the builder's answer
  // Items that belong in the manifest but could not be described, with why.
  std::vector<std::pair<std::string, Error>> omitted;
};

// Fills a new manifest from options (prepared), handing each record to
// handler, but for a regular file whose content cannot be read, which is
// counted as omitted. When console draws progress, the builder's progress goes to its
// bar.
WalkOutcome RunWalk(const WalkOptions& options, const VTRManifest::Handler& handler, Console& console);

// Says on the console, in the tool's words, why each omitted item is not
// described, and returns the exit status for the walk: kExitOk when all was
// described, kExitBadInput when only names that are not UTF-8 were left out,
// kExitIoError otherwise (something could not be read, or the fill failed).
int ReportWalkOutcome(const WalkOutcome& outcome, Console& console);

}  // namespace vtr::manifest_tool

#endif  // VTR_TOOLS_VTR_MANIFEST_WALK_H_
