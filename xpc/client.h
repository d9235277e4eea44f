// XpcClient: the client side of the message service, for vitdctl and the
// tests. It connects to the helper's socket, sends messages and receives the
// frames the helper sends, with the same codec and the same rules as the
// helper. Blocking, with timeouts; one thread at a time.
#ifndef VTR_XPC_CLIENT_H_
#define VTR_XPC_CLIENT_H_

#include <chrono>
#include <optional>
#include <string>

#include "platform/result.h"
#include "platform/unique_fd.h"
#include "xpc/frame_assembler.h"
#include "xpc/xpc_object.h"

namespace vtr {

class XpcClient {
 public:
  // Connects to the Unix stream socket at path. An Error when the path does
  // not fit or nothing listens there.
  static Result<XpcClient> Connect(const std::string& path);

  // Uses an already connected socket (taken over).
  explicit XpcClient(UniqueFd socket);
  XpcClient(XpcClient&&) = default;
  XpcClient& operator=(XpcClient&&) = default;

  // Sends message (a dictionary) as one frame, waiting at most timeout for
  // the helper to make room. An Error when it cannot be encoded or written.
  Status send(const XpcObject& message, std::chrono::milliseconds timeout = std::chrono::seconds(5));

  // The next message, waiting at most timeout for it. An Error with
  // ETIMEDOUT when none came in time (the client stays usable), with
  // ECONNRESET when the helper closed the connection, with EPROTO for a
  // frame that breaks the protocol, and with EMSGSIZE for a frame over
  // kMaxFrameBodyBytes or one whose objects would take more than
  // MaxDecodeCost (four times its size): such a frame is never decoded, so
  // whatever the peer sends, a message costs at most that. After EPROTO or
  // EMSGSIZE the client is spent: every later receive gives the same Error.
  Result<XpcObject> receive(std::chrono::milliseconds timeout);

  int fd() const { return socket_.get(); }

 private:
  Result<XpcObject> receiveFrame(std::chrono::milliseconds timeout);

  UniqueFd socket_;
  FrameAssembler assembler_;
  // Bytes read but not yet fed to the assembler: pending_ from pendingUsed_.
  XpcBytes pending_;
  size_t pendingUsed_ = 0;
  // Why the stream cannot be read on: the first protocol or size error.
  std::optional<Error> spent_;
};

}  // namespace vtr

#endif  // VTR_XPC_CLIENT_H_
