// The firmware-variable and power commands.
#include "model/log.h"
#include "vitd_helper/message_responder.h"
#include "vitd_helper/operations.h"

namespace vtr {
namespace {

// The string a value holds, or nothing when it is missing or of another kind.
std::optional<std::string> OptionalString(const Value& value) {
  const std::string* s = value.string();
  return s ? std::optional<std::string>(*s) : std::nullopt;
}

}  // namespace

bool VTRHMessageResponder::writeNvram(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder writeNvram:]", parameter);
  return VTRHOperations::sharedInstance().writeNVRam(OptionalString(parameter.get("Name")),
                                                     OptionalString(parameter.get("Value")));
}

bool VTRHMessageResponder::deleteNvram(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder deleteNvram:]", parameter);
  return VTRHOperations::sharedInstance().deleteNvram(OptionalString(parameter));
}

bool VTRHMessageResponder::reboot(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder reboot:]", parameter);
  return VTRHOperations::sharedInstance().reboot();
}

bool VTRHMessageResponder::quitHelper(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder quitHelper:]", parameter);
  VTRHOperations::sharedInstance().quitHelper();
}

}  // namespace vtr
