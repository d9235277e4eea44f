// The manifest and staging commands.
#include "model/log.h"
#include "vitd_helper/message_responder.h"
#include "vitd_helper/operations.h"

namespace vtr {
namespace {

// The string under key of a dictionary parameter; empty when it is missing
// or not a string (an empty path names nothing, as a missing one does).
std::string StringEntry(const Value& parameter, std::string_view key) {
  const std::string* s = parameter.get(key).string();
  return s ? *s : std::string();
}

}  // namespace

bool VTRHMessageResponder::createDeviceManifest(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder createDeviceManifest:]", parameter);
  // A missing "Inclusive" reads as NO.
  return VTRHOperations::sharedInstance().createDeviceManifest(StringEntry(parameter, "Path"),
                                                               parameter.get("Inclusive").boolValue());
}

bool VTRHMessageResponder::createHardLink(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder createHardLink:]", parameter);
  return VTRHOperations::sharedInstance().createHardLinks(StringEntry(parameter, "FilePath"),
                                                          StringEntry(parameter, "StagingPath"));
}

bool VTRHMessageResponder::restoreAttributes(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder restoreAttributes:]", parameter);
  // A missing type or identifier (or one that is no string) is nil: the
  // whole device.
  const auto optionalString = [&parameter](std::string_view key) -> std::optional<std::string> {
    const std::string* s = parameter.get(key).string();
    return s ? std::optional<std::string>(*s) : std::nullopt;
  };
  return VTRHOperations::sharedInstance().restoreAttributesUnder(
      StringEntry(parameter, "StagingRootPath"), StringEntry(parameter, "ManifestPath"), optionalString("ContentType"),
      optionalString("Identifier"));
}

bool VTRHMessageResponder::moveStagingToFinal(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder moveStagingToFinal:]", parameter);
  const std::string* path = parameter.string();
  return VTRHOperations::sharedInstance().moveStagingToFinal(path ? *path : std::string());
}

}  // namespace vtr
