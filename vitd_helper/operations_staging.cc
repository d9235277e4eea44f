// Staging: hard-linking content into a staging area and moving the finished
// staging directory to its final place.
#include <fcntl.h>
#include <sys/stat.h>

#include "model/log.h"
#include "platform/file_manager.h"
#include "platform/file_tree.h"
#include "platform/open_beneath.h"
#include "vitd_helper/failure_journal.h"
#include "vitd_helper/final_location.h"
#include "vitd_helper/operations.h"

namespace vtr {

bool VTRHOperations::createHardLinks(const std::string& source, const std::string& stagingPath) {
  std::optional<CheckedPath> from = checkClientPath(source, ClientUse::kChange);
  if (!from) return false;
  std::optional<CheckedPath> to = checkClientPath(stagingPath, ClientUse::kChange);
  if (!to) return false;
  // A copy of a tree inside itself would link its own new entries again.
  if (PathIsWithin(to->path, from->path)) {
    LogRefusal(stagingPath, Error(EINVAL, "inside the tree it would link"));
    return false;
  }
  Result<UniqueFd> fromParent = resolver_.openParent(*from);
  Result<UniqueFd> toParent = fromParent.ok() ? resolver_.openParent(*to) : Result<UniqueFd>(fromParent.error());
  Status linked = toParent.ok() ? ReplicateItem(fromParent->get(), from->name(), toParent->get(), to->name(),
                                                Replication::kHardLink, source, stagingPath)
                                : Status(toParent.error());
  if (!linked.ok()) {
    VTRLogError("Could not link %@ to %@ with error -%@.", source, stagingPath, linked.error().description());
    return false;
  }
  return true;
}

bool VTRHOperations::moveStagingToFinal(const std::string& stagingPath) {
  VTRLog("Move the whole thing together.");
  std::optional<CheckedPath> staging = checkClientPath(stagingPath, ClientUse::kChange);
  if (!staging) return false;
  Result<CheckedPath> final = ClientPathResolver::CheckFixed(paths_.finalLocation);
  if (!final.ok()) {
    JournalFailure("Cannot use the final location", paths_.finalLocation, final.error());
    return false;
  }
  if (PathIsWithin(final->path, staging->path) || PathIsWithin(staging->path, final->path)) {
    LogRefusal(stagingPath, Error(EINVAL, "holds or lies in " + final->path));
    return false;
  }
  // Only a real directory is moved: no link, and not through one.
  Result<UniqueFd> parent = resolver_.openParent(*staging);
  Result<UniqueFd> directory =
      parent.ok() ? OpenEntryNoFollow(parent->get(), staging->name(), O_RDONLY | O_DIRECTORY, stagingPath)
                  : Result<UniqueFd>(parent.error());
  struct stat staged;
  if (!directory.ok() || ::fstat(directory->get(), &staged) != 0) {
    JournalFailure("Cannot open the staging directory", stagingPath,
                   directory.ok() ? Error::FromErrno(stagingPath) : directory.error());
    VTRLogError("Staging path %@ looks wrong.", stagingPath);
    return false;
  }
  Result<UniqueFd> finalParent = resolver_.openParent(*final);
  if (!finalParent.ok()) {
    VTRLogError("Could not move %@ to %@ with error - %@", stagingPath, paths_.finalLocation,
                finalParent.error().description());
    return false;
  }
  FinalLocation location(std::move(*finalParent), final->path, resolver_);
  location.finishInterruptedMove();  // what a move that failed before left
  Status moved = location.receive(parent->get(), staging->name(), staged, staging->path);
  if (moved.ok() && !location.putReadyInPlace().ok()) {
    // The staging folder is taken already: without the old content (which
    // goes in any case) the new needs one rename and no record.
    location.discard();
    moved = location.putReadyInPlace();
  }
  if (!moved.ok()) {
    // The old content is discarded whatever happens to the new.
    location.discard();
    VTRLogError("Could not move %@ to %@ with error - %@", stagingPath, paths_.finalLocation,
                moved.error().description());
    return false;
  }
  return true;
}

void VTRHOperations::finishInterruptedMove() {
  Result<CheckedPath> final = ClientPathResolver::CheckFixed(paths_.finalLocation);
  Result<UniqueFd> finalParent = final.ok() ? resolver_.openParent(*final) : Result<UniqueFd>(final.error());
  if (!finalParent.ok()) return;  // no folder for it: nothing was ever moved there
  FinalLocation(std::move(*finalParent), final->path, resolver_).finishInterruptedMove();
}

}  // namespace vtr
