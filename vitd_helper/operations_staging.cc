// Staging: hard-linking content into a staging area and moving the finished
// staging directory to its final place.
#include <fcntl.h>
#include <sys/stat.h>

#include "model/log.h"
#include "platform/file_manager.h"
#include "platform/file_tree.h"
#include "platform/open_beneath.h"
#include "vitd_helper/failure_journal.h"
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
  const std::string& finalName = final->name();
  // A removal that fails leaves the old content in the way; the move below
  // then fails and says so.
  struct stat st;
  if (::fstatat(finalParent->get(), finalName.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0) {
    (void)RemoveItemAt(finalParent->get(), finalName, final->path);
  }
  Status moved = MoveItemAt(parent->get(), staging->name(), finalParent->get(), finalName, stagingPath, final->path);
  // The staging folder is the client's: what it held when it was moved must
  // be the directory checked above, not something swapped in since. A
  // rename moves an entry, not a descriptor, so it is checked after and put
  // back when it is not.
  if (moved.ok() &&
      (::fstatat(finalParent->get(), finalName.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISDIR(st.st_mode))) {
    (void)MoveItemAt(finalParent->get(), finalName, parent->get(), staging->name(), final->path, stagingPath);
    moved = Error(EAGAIN, stagingPath + " changed while it was moved");
  }
  if (!moved.ok()) {
    VTRLogError("Could not move %@ to %@ with error - %@", stagingPath, paths_.finalLocation,
                moved.error().description());
    return false;
  }
  return true;
}

}  // namespace vtr
