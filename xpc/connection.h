// Connection: one accepted client of the helper's listener.
//
// The listener owns every live connection and hands each to its handlers as
// a shared_ptr; whoever merely needs to reach the current client (the
// message responder) keeps a weak_ptr. A connection delivers, through the
// event handler set on it, one message event per dictionary received, in
// order, and finally exactly one invalid event: when the peer closes, breaks
// the protocol (the reason says which rule), stops reading while the helper
// writes to it, is cancelled, or is dropped to keep the listener's limits.
// After the invalid event the connection lets go of its handler, so a
// handler may capture its own connection without leaking it.
//
// Threads: a connection belongs to the thread running its listener's loop;
// every call must be made there (in practice from inside an event handler).
#ifndef VTR_XPC_CONNECTION_H_
#define VTR_XPC_CONNECTION_H_

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>

#include "platform/result.h"
#include "platform/unique_fd.h"
#include "xpc/frame_assembler.h"
#include "xpc/message_peer.h"
#include "xpc/peer_identity.h"
#include "xpc/xpc_object.h"

namespace vtr {

class Listener;

struct ConnectionEvent {
  // kDroppedMessage: a valid frame from an untrusted peer, not decoded.
  enum class Kind { kMessage, kDroppedMessage, kInvalid };
  Kind kind;
  // kMessage: the dictionary received (null for kDroppedMessage).
  XpcObject message;
  // kInvalid: why the connection ended, e.g. "closed by the peer" or
  // "protocol error: unknown tag 0x0b at offset 5".
  std::string reason;
};

class Connection : public MessagePeer, public std::enable_shared_from_this<Connection> {
 public:
  using EventHandler = std::function<void(const ConnectionEvent&)>;

  ~Connection() override;
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  // Sets the handler for this connection's events. Set it from the
  // listener's connection event: messages that arrive while no handler is
  // set are dropped.
  void setEventHandler(EventHandler handler);

  // Output a peer may leave unread before it is dropped.
  static constexpr size_t kMaxQueuedBytes = size_t{1} << 20;

  // Writes message (a dictionary) as one frame: what the socket takes now,
  // the rest queued (see above). An Error when the message cannot be encoded
  // (the connection stays), and when the connection is closed, the write
  // fails, or the peer has stopped reading; in the latter cases the
  // connection is closed and its invalid event follows once the current
  // handler has returned.
  Status send(const XpcObject& message) override;

  // SecTask::CreateWithPeer of the peer.
  Result<SecTask> copyTask() const override { return SecTask::CreateWithPeer(peer_); }

  // Closes the connection; its invalid event ("cancelled") follows once the
  // current handler has returned. Harmless when already closed.
  void cancel();

  // False once the connection is closed (its invalid event may still be due).
  bool valid() const { return socket_.valid(); }

  // The peer as captured at accept.
  const PeerIdentity& peer() const { return peer_; }
  // Whether the listener trusted the peer at accept (its frames are decoded).
  bool trusted() const { return trusted_; }

 private:
  friend class Listener;

  using Clock = std::chrono::steady_clock;

  Connection(Listener* owner, uint64_t token, UniqueFd socket, PeerIdentity peer, bool trusted,
             std::chrono::milliseconds sendTimeout);

  // Reads what the socket has (one read into scratch) and delivers the
  // messages completed by it; closes on end of stream or protocol error.
  void readReady(std::span<uint8_t> scratch);
  // Closes the socket and has the owner queue the invalid event.
  void close(std::string reason);
  // Delivers the invalid event and drops the handler.
  void deliverInvalid();
  // Closes without any event (the listener is going away).
  void detach();
  // Writes what the queue holds, as far as the socket takes it now.
  void flush();
  // Flushes, then drops the connection ("stopped reading") when its output
  // has still not moved for the send timeout. A stall is judged only on what
  // a write attempted now achieves: while a long command held the loop, a
  // peer that kept reading made room that no write has used yet, and the
  // time the queue waited for the loop is not the peer's.
  void flushOrDropStalled();
  // The socket can take more: flush, and stop asking once the queue is empty.
  void writeReady();
  // When a waiting queue must have moved (the send timeout after the last
  // write that made progress, or after it began to wait), or nullopt when
  // nothing waits.
  std::optional<Clock::time_point> sendDeadline() const;
  // Tells the owner how the bytes held for the frame in progress changed.
  void reportBuffered();
  size_t bufferedBytes() const { return assembler_.bufferedBytes(); }

  Listener* owner_;
  uint64_t token_;
  UniqueFd socket_;
  PeerIdentity peer_;
  bool trusted_;
  std::chrono::milliseconds sendTimeout_;
  FrameAssembler assembler_;
  XpcBytes outgoing_;
  size_t outgoingSent_ = 0;  // bytes at the front of outgoing_ already written
  Clock::time_point lastProgress_;
  size_t reportedBuffered_ = 0;
  EventHandler handler_;
  std::string invalidReason_;
};

}  // namespace vtr

#endif  // VTR_XPC_CONNECTION_H_
