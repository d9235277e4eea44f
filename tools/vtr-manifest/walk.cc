#include "tools/vtr-manifest/walk.h"

#include "model/progress_updater.h"

namespace vtr::manifest_tool {

bool RunWalk(const WalkOptions& options, const VTRManifest::Handler& handler, Console& console) {
  VTRManifest manifest;
  if (options.jobs) manifest.setRecordThreads(*options.jobs);
  VTRProgressUpdater updater;
  if (console.drawsProgress()) {
    updater.setSender([&console](int64_t percent) { console.showProgress(percent); });
    manifest.setProgressUpdater(&updater);
  }
  const bool filled = manifest.enumerateAndCollectMetaData(options.tree, options.relativeTo.value_or(options.tree),
                                                           options.skip, options.inclusive, handler);
  console.finish();
  return filled;
}

}  // namespace vtr::manifest_tool
