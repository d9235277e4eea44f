// Staging: hard-linking content into a staging area and moving the finished
// staging directory to its final place.
#include "model/log.h"
#include "platform/file_manager.h"
#include "vitd_helper/operations.h"

namespace vtr {
namespace {

constexpr char kFinalLocation[] = "/var/backup";

}  // namespace

bool VTRHOperations::createHardLinks(const std::string& source, const std::string& stagingPath) {
  Status linked = LinkItem(source, stagingPath);
  if (!linked.ok()) {
    VTRLog("Could not link %@ to %@ with error -%@.", source, stagingPath, linked.error().description());
    return false;
  }
  return true;
}

bool VTRHOperations::moveStagingToFinal(const std::string& stagingPath) {
  VTRLog("Move the whole thing together.");
  bool isDirectory = false;
  if (!FileExists(stagingPath, &isDirectory) || !isDirectory) {
    VTRLog("Staging path %@ looks wrong.", stagingPath);
    return false;
  }
  // A removal that fails leaves the old content in the way; the move below
  // then fails and says so.
  if (FileExists(kFinalLocation)) (void)RemoveItem(kFinalLocation);
  Status moved = MoveItem(stagingPath, kFinalLocation);
  if (!moved.ok()) {
    VTRLog("Could not move %@ to %@ with error - %@", stagingPath, kFinalLocation, moved.error().description());
    return false;
  }
  return true;
}

}  // namespace vtr
