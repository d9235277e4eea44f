// vtr-manifest create: the manifest of a tree, written as the helper writes
// the device manifest.
#include "model/manifest_file.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/walk.h"

namespace vtr::manifest_tool {

int RunCreate(const CreateOptions& options, Console& console) {
  if (int checked = CheckWalkOptions(options.walk, console); checked != kExitOk) return checked;
  Result<std::unique_ptr<ManifestFileWriter>> writer = ManifestFileWriter::Create(options.output);
  if (!writer.ok()) {
    console.print("vtr-manifest: cannot create " + options.output + ": " + writer.error().description());
    return kExitIoError;
  }
  // As the helper does for the device manifest: a tree that holds the output
  // does not describe it half written.
  WalkOptions walk = options.walk;
  if (!(*writer)->temporaryPath().empty()) walk.skip.push_back((*writer)->temporaryPath());
  if (!RunWalk(walk, (*writer)->handler(), console)) {
    console.print("vtr-manifest: the manifest could not be made; " + options.output + " is left as it was");
    return kExitIoError;
  }
  if (Status committed = (*writer)->commit(); !committed.ok()) {
    console.print("vtr-manifest: cannot write " + options.output + ": " + committed.error().description());
    return kExitIoError;
  }
  return kExitOk;
}

}  // namespace vtr::manifest_tool
