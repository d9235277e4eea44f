// The device manifest: the metadata of a tree (or of the whole device)
// recorded into a fixed binary property-list file.
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <memory>

#include "model/log.h"
#include "model/manifest.h"
#include "model/manifest_file.h"
#include "model/progress_updater.h"
#include "platform/file_tree.h"
#include "platform/open_beneath.h"
#include "platform/paths.h"
#include "vitd_helper/failure_journal.h"
#include "vitd_helper/operations.h"

namespace vtr {
bool VTRHOperations::createDeviceManifest(const std::string& path, bool inclusive) {
  VTRLog("Will create device manifest...");
  // Plain string equality: "/private//var" or "/private/var/mobile" scan as
  // ordinary trees.
  const std::vector<std::string>& roots = paths_.wholeDeviceRoots;
  const bool wholeDevice = std::find(roots.begin(), roots.end(), path) != roots.end();
  const std::string scanRoot = wholeDevice ? paths_.wholeDeviceScanRoot : path;
  Result<CheckedPath> checked = wholeDevice ? ClientPathResolver::CheckFixed(scanRoot)
                                            : resolver_.check(scanRoot, ClientUse::kScan);
  Result<UniqueFd> parent = checked.ok() ? resolver_.openParent(*checked) : Result<UniqueFd>(checked.error());
  if (!parent.ok()) {
    LogRefusal(path, parent.error());
    return false;
  }
  const TreeLocation location{std::make_shared<const UniqueFd>(std::move(*parent)), checked->name()};

  VTRManifest manifest;
  manifest.setTreeLocation(location);
  std::string relativeTo;
  std::vector<std::string> skip;
  if (wholeDevice) {
    relativeTo = paths_.wholeDeviceRelativeTo;
    skip = paths_.wholeDeviceSkipped;
    manifest.setProgressUpdater(&VTRProgressUpdater::sharedInstance());
  } else {
    relativeTo = path;
    if (Result<UniqueFd> tree = OpenEntryNoFollow(location.parent->get(), location.name, O_RDONLY | O_DIRECTORY, path);
        tree.ok()) {
      skip = VTRManifest::immediateHiddenFilesIn(tree->get(), path);
    }
  }
  // What the client may not read is never recorded.
  for (std::string& closed : resolver_.closedTreesWithin(*checked, scanRoot)) skip.push_back(std::move(closed));

  // The records stream into the file as the scan makes them. When the file
  // cannot be made (its directory is missing) the scan still runs and
  // answers; only the file is missing, as it would be had the write failed.
  // Its folder is opened without following links: it may be the client's.
  Result<std::unique_ptr<ManifestFileWriter>> output = Error(ENOENT, paths_.deviceManifest);
  if (Result<CheckedPath> file = ClientPathResolver::CheckFixed(paths_.deviceManifest); file.ok()) {
    if (Result<UniqueFd> folder = resolver_.openParent(*file); folder.ok()) {
      output = ManifestFileWriter::CreateIn(std::move(*folder), file->path);
    }
  }
  if (output.ok() && !(*output)->temporaryPath().empty()) skip.push_back((*output)->temporaryPath());
  const VTRManifest::Handler discard = [](const VTRFileMetadata&, const std::string&) { return true; };
  const bool scanned = manifest.enumerateAndCollectMetaData(scanRoot, relativeTo, skip, inclusive,
                                                            output.ok() ? (*output)->handler() : discard);
  if (!scanned) {
    VTRLogError("Cannot create device manifest - 1");
    JournalFailure("Cannot record the tree", path, Error::Invalid("the scan stopped (the lines above say where)"));
    return false;  // the temporary file goes; an earlier manifest stays
  }
  // The answer stays true without the file; the journal says it is missing.
  Status committed = output.ok() ? (*output)->commit() : Status(output.error());
  if (!committed.ok()) JournalFailure("The device manifest was not written:", paths_.deviceManifest, committed.error());
  VTRLog("Device manifest created (for %@)", path);
  return true;
}

void VTRHOperations::removeUnfinishedManifest() {
  Result<CheckedPath> file = ClientPathResolver::CheckFixed(paths_.deviceManifest);
  Result<UniqueFd> folder = file.ok() ? resolver_.openParent(*file) : Result<UniqueFd>(file.error());
  if (!folder.ok()) return;
  Result<std::vector<std::string>> names = DirectoryEntryNames(folder->get(), file->path);
  if (!names.ok()) return;
  // The name a manifest's file bears between its sync and its rename (see
  // AtomicFile): ".DeviceManifest.plist." and six characters.
  const std::string prefix = "." + file->name() + ".";
  for (const std::string& name : *names) {
    if (!HasPrefix(name, prefix) || name.size() != prefix.size() + 6) continue;
    const std::string path = AppendPathComponent(SplitLastComponent(file->path).parent, name);
    VTRLog("Removing %@, the file of a device manifest that was not finished", path);
    if (::unlinkat(folder->get(), name.c_str(), 0) != 0) {
      VTRLogError("Could not remove %@: %@", path, Error::FromErrno(path).description());
    }
  }
}

}  // namespace vtr
