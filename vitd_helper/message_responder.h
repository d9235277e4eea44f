// VTRHMessageResponder: turns a client's request into privileged work.
//
// For each request the listener hands over, the responder checks that the
// sending process holds the helper's entitlement, converts the request to a
// Value dictionary and treats every key as the name of one of its commands,
// invoked with that key's value; each command's result becomes a "Response"
// message (true or false). Keys are walked in the converted dictionary's
// (sorted) order; a key that names no command ends the walk without a reply
// for it or any later key. The responder also sends progress reports for
// long commands, always on the connection that delivered the latest request.
//
// Threads: used only from the listener's loop thread, one request at a time.
#ifndef VTR_VITD_HELPER_MESSAGE_RESPONDER_H_
#define VTR_VITD_HELPER_MESSAGE_RESPONDER_H_

#include <cstdint>
#include <memory>
#include <string>

#include "platform/value.h"
#include "xpc/message_peer.h"
#include "xpc/xpc_object.h"

namespace vtr {

// The entitlement a client needs, with the boolean value true.
inline constexpr char kVitrelldEntitlement[] = "com.orvane.private.vitrell.vitrelld";

class VTRHMessageResponder {
 public:
  static VTRHMessageResponder& sharedInstance();

  // Only a boolean true grants access; a string or a number does not.
  static bool GrantsEntitlement(const Value& value) { return value.boolean().value_or(false); }

  // The peer of the latest request (a connection, or a test's own); null
  // once that client is gone. The responder never keeps it alive (the
  // reference is weak).
  std::shared_ptr<MessagePeer> connection() const { return connection_.lock(); }
  void setConnection(std::weak_ptr<MessagePeer> connection) { connection_ = std::move(connection); }

  // True when the process behind the current connection holds the entitlement
  // "com.orvane.private.vitrell.vitrelld" with the boolean value true.
  // Otherwise false after one log line saying why.
  bool hasEntitlementVitrelld();

  // Handles one request dictionary (see above). Sends nothing to a client
  // without the entitlement. The command's lines are not rate-limited as the
  // peer's: an entitled client's work logs what it must.
  void handleXPCMessage(const XpcObject& request);

  // The messages, sent on the current connection; dropped when there is
  // none. None is a reply bound to a request.
  void sendPassResponse();                  // {"Response": true}
  void sendFailResponse();                  // {"Response": false}
  void sendProgress(int64_t percent);       // {"Progress": percent}

  // The commands. Each takes the request key's value and returns the result
  // that becomes the "Response"; each first logs
  // "Entering %s with parameter: %@" with its method name.
  bool migratePreferencesFile(const Value& parameter);
  bool prepareLogContainer(const Value& parameter);
  bool prepareWorkContainer(const Value& parameter);
  bool removeWorkContainer(const Value& parameter);
  bool createDeviceManifest(const Value& parameter);
  bool createHardLink(const Value& parameter);
  bool restoreAttributes(const Value& parameter);
  bool moveStagingToFinal(const Value& parameter);
  bool writeNvram(const Value& parameter);
  bool deleteNvram(const Value& parameter);
  // Answers only when the reboot cannot be made.
  bool reboot(const Value& parameter);
  // Never answers: the process ends.
  bool quitHelper(const Value& parameter);
  bool shrinkDataPartition(const Value& parameter);
  bool expandDataPartition(const Value& parameter);

 private:
  void send(const char* key, XpcObject value);

  std::weak_ptr<MessagePeer> connection_;
};

}  // namespace vtr

#endif  // VTR_VITD_HELPER_MESSAGE_RESPONDER_H_
