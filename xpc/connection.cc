#include "xpc/connection.h"

#include <sys/socket.h>

#include <cerrno>
#include <utility>

#include "xpc/listener.h"
#include "xpc/socket_io.h"
#include "xpc/wire_codec.h"

namespace vtr {

Connection::Connection(Listener* owner, uint64_t token, UniqueFd socket, PeerIdentity peer,
                       std::chrono::milliseconds sendTimeout)
    : owner_(owner), token_(token), socket_(std::move(socket)), peer_(std::move(peer)), sendTimeout_(sendTimeout) {}

Connection::~Connection() = default;

void Connection::setEventHandler(EventHandler handler) { handler_ = std::move(handler); }

Status Connection::send(const XpcObject& message) {
  if (!valid()) return Error(ENOTCONN, "the connection is closed");
  Result<XpcBytes> frame = EncodeFrame(message);
  if (!frame) return frame.error();
  Status sent = SendAll(socket_.get(), *frame, sendTimeout_);
  if (!sent) close("send failed: " + sent.error().description());
  return sent;
}

void Connection::cancel() {
  if (valid()) close("cancelled");
}

void Connection::readReady(std::span<uint8_t> scratch) {
  ssize_t n = ::recv(socket_.get(), scratch.data(), scratch.size(), MSG_DONTWAIT);
  if (n < 0) {
    if (errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) {
      close("read failed: " + Error::FromErrno("recv").description());
    }
    return;
  }
  if (n == 0) {
    close(assembler_.midFrame() ? "closed by the peer in the middle of a frame" : "closed by the peer");
    return;
  }
  // Keeps this connection alive through handlers that drop their reference.
  std::shared_ptr<Connection> self = shared_from_this();
  std::span<const uint8_t> rest = scratch.first(static_cast<size_t>(n));
  while (!rest.empty() && valid()) {
    Result<size_t> used = assembler_.consume(rest);
    if (!used) {
      close("protocol error: " + used.error().message());
      return;
    }
    rest = rest.subspan(*used);
    if (!assembler_.frameComplete()) {
      reportBuffered();
      continue;
    }
    XpcBytes body = assembler_.takeFrame();
    reportBuffered();
    Result<XpcObject> message = DecodeMessage(body);
    body = XpcBytes();
    if (!message) {
      close("protocol error: " + message.error().message());
      return;
    }
    if (handler_) {
      // A copy: the handler may replace itself while it runs.
      EventHandler handler = handler_;
      handler(ConnectionEvent{ConnectionEvent::Kind::kMessage, std::move(*message), {}});
    }
  }
}

void Connection::close(std::string reason) {
  if (!valid()) return;
  invalidReason_ = std::move(reason);
  if (owner_) owner_->retire(shared_from_this());
  socket_.reset();
  assembler_ = FrameAssembler();
  reportBuffered();
}

void Connection::deliverInvalid() {
  EventHandler handler = std::move(handler_);
  handler_ = nullptr;
  if (handler) handler(ConnectionEvent{ConnectionEvent::Kind::kInvalid, XpcObject(), invalidReason_});
}

void Connection::detach() {
  owner_ = nullptr;
  handler_ = nullptr;
  socket_.reset();
}

void Connection::reportBuffered() {
  size_t now = assembler_.bufferedBytes();
  if (owner_ && now != reportedBuffered_) {
    size_t before = std::exchange(reportedBuffered_, now);
    owner_->bufferedChanged(before, now);
  }
}

}  // namespace vtr
