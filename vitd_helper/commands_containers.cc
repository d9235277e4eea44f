// The preferences and container commands.
#include "model/log.h"
#include "platform/paths.h"
#include "vitd_helper/message_responder.h"
#include "vitd_helper/operations.h"

namespace vtr {
namespace {

// The path a command was given; empty when the parameter is not a string
// (an empty path names nothing, as a missing one does).
std::string PathParameter(const Value& parameter) {
  const std::string* path = parameter.string();
  return path ? *path : std::string();
}

}  // namespace

bool VTRHMessageResponder::migratePreferencesFile(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder migratePreferencesFile:]", parameter);
  return VTRHOperations::sharedInstance().migratePreferencesFile();
}

bool VTRHMessageResponder::prepareLogContainer(const Value& parameter) {
  static constexpr char kMethod[] = "-[VTRHMessageResponder prepareLogContainer:]";
  VTRLog("Entering %s with parameter: %@", kMethod, parameter);
  const std::string path = PathParameter(parameter);
  // A plain prefix test, not a path-component one: "/var/logsX" passes too.
  if (!HasPrefix(path, "/private/var/logs") && !HasPrefix(path, "/var/logs")) {
    VTRLogError("%s: creating logs under %@ is not allowed.", kMethod, parameter);
    return false;
  }
  return VTRHOperations::sharedInstance().prepareLogContainer(path);
}

bool VTRHMessageResponder::prepareWorkContainer(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder prepareWorkContainer:]", parameter);
  return VTRHOperations::sharedInstance().prepareDirectory(PathParameter(parameter), true);
}

bool VTRHMessageResponder::removeWorkContainer(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder removeWorkContainer:]", parameter);
  return VTRHOperations::sharedInstance().removeDirectory(PathParameter(parameter));
}

}  // namespace vtr
