#include "tools/vtr-manifest/walk.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <string_view>

#include "model/progress_updater.h"

namespace vtr::manifest_tool {
namespace {

// path without its trailing slashes ("/" stays).
std::string_view Trimmed(std::string_view path) {
  while (path.size() > 1 && path.back() == '/') path.remove_suffix(1);
  return path;
}

// Whether path is folder or lies below it, by the text of both.
bool Within(std::string_view path, std::string_view folder) {
  path = Trimmed(path);
  folder = Trimmed(folder);
  if (folder == "/") return path.starts_with('/');
  return path == folder || (path.starts_with(folder) && path[folder.size()] == '/');
}

}  // namespace

int CheckWalkOptions(const WalkOptions& options, Console& console) {
  struct stat st;
  if (::stat(options.tree.c_str(), &st) != 0) {
    console.print("vtr-manifest: " + options.tree + ": " + std::strerror(errno));
    return errno == ENOENT || errno == ENOTDIR ? kExitNoInput : kExitBadInput;
  }
  if (!S_ISDIR(st.st_mode)) {
    console.print("vtr-manifest: " + options.tree + " is not a directory: a manifest describes a tree");
    return kExitBadInput;
  }
  if (options.relativeTo && !Within(options.tree, *options.relativeTo)) {
    console.print("vtr-manifest: --relative-to " + *options.relativeTo + " must be " + options.tree +
                  " or a folder above it: the keys are the paths below it");
    return kExitUsage;
  }
  for (const std::string& skip : options.skip) {
    if (!Within(skip, options.tree) || Trimmed(skip) == Trimmed(options.tree)) {
      console.print("vtr-manifest: --skip " + skip + " does not lie inside " + options.tree);
      return kExitUsage;
    }
  }
  return kExitOk;
}

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
