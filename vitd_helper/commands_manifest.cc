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
  // A missing type or identifier (a null is never carried over) is nil: the
  // whole device. Container types are compared as strings, so one that is
  // present but no string names no container, and neither does such an
  // identifier: the request fails rather than reach the whole device, even
  // when the other of the two is missing.
  const Value type = parameter.get("ContentType");
  const Value identifier = parameter.get("Identifier");
  const auto presentButNoString = [](const Value& value) { return !value.isNil() && value.string() == nullptr; };
  if (presentButNoString(type) || presentButNoString(identifier)) {
    VTRLogError("Couldn't load manifest dict for %@/%@", type, identifier);
    return false;
  }
  const auto optionalString = [](const Value& value) -> std::optional<std::string> {
    const std::string* s = value.string();
    return s ? std::optional<std::string>(*s) : std::nullopt;
  };
  return VTRHOperations::sharedInstance().restoreAttributesUnder(
      StringEntry(parameter, "StagingRootPath"), StringEntry(parameter, "ManifestPath"), optionalString(type),
      optionalString(identifier));
}

bool VTRHMessageResponder::moveStagingToFinal(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder moveStagingToFinal:]", parameter);
  const std::string* path = parameter.string();
  return VTRHOperations::sharedInstance().moveStagingToFinal(path ? *path : std::string());
}

}  // namespace vtr
