#include "xpc/connection.h"

#include <sys/socket.h>

#include <cerrno>
#include <utility>

#include "xpc/listener.h"
#include "xpc/wire_codec.h"

namespace vtr {
namespace {

constexpr char kStoppedReading[] = "dropped: it stopped reading";

}  // namespace

Connection::Connection(Listener* owner, uint64_t token, UniqueFd socket, PeerIdentity peer, bool trusted,
                       std::chrono::milliseconds sendTimeout)
    : owner_(owner), token_(token), socket_(std::move(socket)), peer_(std::move(peer)), trusted_(trusted),
      sendTimeout_(sendTimeout), assembler_(trusted) {}

Connection::~Connection() = default;

void Connection::setEventHandler(EventHandler handler) { handler_ = std::move(handler); }

Status Connection::send(const XpcObject& message) {
  if (!valid()) return Error(ENOTCONN, "the connection is closed");
  Result<XpcBytes> frame = EncodeFrame(message);
  if (!frame) return frame.error();
  if (outgoing_.size() - outgoingSent_ + frame->size() > kMaxQueuedBytes) {
    close("dropped: it stopped reading (its unread output passed the limit)");
    return Error(ETIMEDOUT, "the peer stopped reading");
  }
  if (outgoingSent_ == outgoing_.size()) lastProgress_ = Clock::now();
  outgoing_.insert(outgoing_.end(), frame->begin(), frame->end());
  flushOrDropStalled();
  if (!valid()) {
    return invalidReason_ == kStoppedReading ? Error(ETIMEDOUT, "the peer stopped reading")
                                             : Error(ENOTCONN, invalidReason_);
  }
  return Status::Ok();
}

void Connection::flushOrDropStalled() {
  flush();
  if (!valid()) return;
  if (std::optional<Clock::time_point> deadline = sendDeadline(); deadline && Clock::now() >= *deadline) {
    close(kStoppedReading);
  }
}

void Connection::flush() {
  const bool waiting = outgoingSent_ < outgoing_.size();
  while (outgoingSent_ < outgoing_.size() && valid()) {
    const ssize_t n = ::send(socket_.get(), outgoing_.data() + outgoingSent_, outgoing_.size() - outgoingSent_,
                             MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n > 0) {
      outgoingSent_ += static_cast<size_t>(n);
      lastProgress_ = Clock::now();
      continue;
    }
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && (errno == EAGAIN || errno == EWOULDBLOCK)) break;
    close("send failed: " + Error::FromErrno("send").description());
    return;
  }
  if (outgoingSent_ == outgoing_.size()) {
    outgoing_.clear();
    outgoingSent_ = 0;
  }
  const bool waitingNow = outgoingSent_ < outgoing_.size();
  if (owner_ && valid() && waiting != waitingNow) owner_->wantWrite(*this, waitingNow);
}

void Connection::writeReady() { flush(); }

std::optional<Connection::Clock::time_point> Connection::sendDeadline() const {
  if (outgoingSent_ == outgoing_.size()) return std::nullopt;
  return lastProgress_ + sendTimeout_;
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
    const uint64_t cost = assembler_.decodeCost();
    XpcBytes body = assembler_.takeFrame();
    reportBuffered();
    ConnectionEvent event{ConnectionEvent::Kind::kDroppedMessage, XpcObject(), {}};
    if (trusted_) {
      if (cost > MaxDecodeCost(static_cast<uint32_t>(body.size()))) {
        close("protocol error: a message whose objects would take more than four times its size");
        return;
      }
      Result<XpcObject> message = DecodeMessage(body);
      body = XpcBytes();
      if (!message) {
        close("protocol error: " + message.error().message());
        return;
      }
      event = ConnectionEvent{ConnectionEvent::Kind::kMessage, std::move(*message), {}};
    }
    if (handler_) {
      // A copy: the handler may replace itself while it runs.
      EventHandler handler = handler_;
      handler(event);
    }
  }
}

void Connection::close(std::string reason) {
  if (!valid()) return;
  invalidReason_ = std::move(reason);
  if (owner_) owner_->retire(shared_from_this());
  socket_.reset();
  assembler_ = FrameAssembler(trusted_);
  outgoing_ = XpcBytes();
  outgoingSent_ = 0;
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
