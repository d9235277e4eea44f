#include "vitd_helper/message_responder.h"

#include "model/log.h"
#include "model/xpc_dict_conv.h"
#include "vitd_helper/command_table.h"
#include "xpc/sec_task.h"

namespace vtr {
namespace {

constexpr char kHasEntitlementMethod[] = "-[VTRHMessageResponder hasEntitlementVitrelld]";
constexpr char kResponderClass[] = "VTRHMessageResponder";

}  // namespace

VTRHMessageResponder& VTRHMessageResponder::sharedInstance() {
  static VTRHMessageResponder* const instance = new VTRHMessageResponder();
  return *instance;
}

bool VTRHMessageResponder::hasEntitlementVitrelld() {
  std::shared_ptr<MessagePeer> current = connection();
  Result<SecTask> task = current ? current->copyTask() : Result<SecTask>(Error(ESRCH, ""));
  if (!task.ok()) {
    VTRLogError("%s: Cannot create SecTask from audit token", kHasEntitlementMethod);
    return false;
  }
  const Value value = task->copyValueForEntitlement(kVitrelldEntitlement);
  if (value.isNil()) {
    VTRLogError("%s: No data received.", kHasEntitlementMethod);
    return false;
  }
  std::optional<bool> granted = value.boolean();
  if (!granted) {
    VTRLogError("%s: format not correct: %@", kHasEntitlementMethod, value);
    return false;
  }
  return *granted;
}

void VTRHMessageResponder::handleXPCMessage(const XpcObject& request) {
  if (!hasEntitlementVitrelld()) {
    VTRLogError("The client does not have proper entitlement");
    return;
  }
  ScopedLogPeer entitled(std::nullopt);
  const Value converted = XPCDictionaryConversion::dictionaryWithXPCDictionary(request);
  const Dictionary* commands = converted.dictionary();
  if (commands == nullptr) return;
  for (const auto& [key, parameter] : *commands) {
    // An empty key names no method at all.
    if (key.empty()) {
      VTRLogError("selector is nil for %@", key);
      return;
    }
    const Command* command = FindCommand(key);
    if (command == nullptr) {
      VTRLogError("%@ does not respond to %@.", kResponderClass, key);
      return;
    }
    const uint64_t failuresBefore = VTRLogModel::failuresLoggedOnThisThread();
    if ((this->*command->method)(parameter)) {
      sendPassResponse();
    } else {
      // The journal names the command of every false answer; the lines
      // before it say why (a step that said nothing is named as such).
      if (VTRLogModel::failuresLoggedOnThisThread() == failuresBefore) {
        VTRJournalError("%@ answered NO for %@ (no step logged why)", key, parameter);
      } else {
        VTRJournalError("%@ answered NO for %@", key, parameter);
      }
      sendFailResponse();
    }
  }
}

void VTRHMessageResponder::send(const char* key, XpcObject value) {
  std::shared_ptr<MessagePeer> current = connection();
  if (!current) return;  // the client is gone: the message is dropped
  (void)current->send(XpcObject::Dictionary({{key, std::move(value)}}));
}

void VTRHMessageResponder::sendPassResponse() { send("Response", XpcObject::Bool(true)); }
void VTRHMessageResponder::sendFailResponse() { send("Response", XpcObject::Bool(false)); }
void VTRHMessageResponder::sendProgress(int64_t percent) { send("Progress", XpcObject::Int64(percent)); }

}  // namespace vtr
