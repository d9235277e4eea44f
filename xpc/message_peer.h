// MessagePeer: the client end of a conversation as the helper's command core
// sees it: who it is (its task, for the entitlement check) and where replies
// go. A Connection is one; a test supplies its own, so that requests are
// handled and their replies read without a socket.
#ifndef VTR_XPC_MESSAGE_PEER_H_
#define VTR_XPC_MESSAGE_PEER_H_

#include "platform/result.h"
#include "xpc/sec_task.h"
#include "xpc/xpc_object.h"

namespace vtr {

class MessagePeer {
 public:
  virtual ~MessagePeer() = default;
  // The peer's task, checked anew (SecTask::CreateWithPeer for a connection);
  // an Error when the process behind it is gone or changed.
  virtual Result<SecTask> copyTask() const = 0;
  // Sends one message (a dictionary); an Error when it cannot go out.
  virtual Status send(const XpcObject& message) = 0;
};

}  // namespace vtr

#endif  // VTR_XPC_MESSAGE_PEER_H_
