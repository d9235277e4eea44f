#include "xpc/client.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>
#include <span>

#include "platform/format.h"
#include "xpc/message_validator.h"
#include "xpc/socket_io.h"
#include "xpc/wire_codec.h"

namespace vtr {

Result<XpcClient> XpcClient::Connect(const std::string& path) {
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  if (path.empty() || path.size() >= sizeof address.sun_path) {
    return Error(ENAMETOOLONG, Format("socket path of %zu bytes does not fit", path.size()));
  }
  std::memcpy(address.sun_path, path.data(), path.size());
  UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!socket) return Error::FromErrno("socket");
  int connected;
  do {
    connected = ::connect(socket.get(), reinterpret_cast<const struct sockaddr*>(&address), sizeof address);
  } while (connected != 0 && errno == EINTR);
  if (connected != 0) return Error::FromErrno("connect " + path);
  return XpcClient(std::move(socket));
}

XpcClient::XpcClient(UniqueFd socket) : socket_(std::move(socket)) {}

Status XpcClient::send(const XpcObject& message, std::chrono::milliseconds timeout) {
  Result<XpcBytes> frame = EncodeFrame(message);
  if (!frame) return frame.error();
  return SendAll(socket_.get(), *frame, timeout);
}

Result<XpcObject> XpcClient::receive(std::chrono::milliseconds timeout) {
  if (spent_) return *spent_;
  Result<XpcObject> message = receiveFrame(timeout);
  if (!message.ok() && (message.error().code() == EPROTO || message.error().code() == EMSGSIZE)) {
    spent_ = message.error();
  }
  return message;
}

Result<XpcObject> XpcClient::receiveFrame(std::chrono::milliseconds timeout) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  uint8_t buffer[64 * 1024];
  for (;;) {
    // Feed what is left over from earlier reads before reading more.
    while (pendingUsed_ < pending_.size() && !assembler_.frameComplete()) {
      Result<size_t> used = assembler_.consume(std::span(pending_).subspan(pendingUsed_));
      if (!used) return Error(used.error().code() == EMSGSIZE ? EMSGSIZE : EPROTO, used.error().message());
      pendingUsed_ += *used;
    }
    if (pendingUsed_ == pending_.size()) {
      pending_.clear();
      pendingUsed_ = 0;
    }
    if (assembler_.frameComplete()) {
      // What the validator summed while the bytes came in, checked before a
      // single object is built.
      const uint64_t cost = assembler_.decodeCost();
      XpcBytes body = assembler_.takeFrame();
      if (cost > MaxDecodeCost(static_cast<uint32_t>(body.size()))) {
        return Error(EMSGSIZE, "a message whose objects would take more than four times its size");
      }
      Result<XpcObject> message = DecodeMessage(body);
      if (!message) return Error(EPROTO, message.error().message());
      return message;
    }
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - std::chrono::steady_clock::now());
    if (left.count() < 0 || !WaitReadable(socket_.get(), left)) return Error(ETIMEDOUT, "no message in time");
    ssize_t n = ::recv(socket_.get(), buffer, sizeof buffer, MSG_DONTWAIT);
    if (n < 0 && (errno == EAGAIN || errno == EINTR)) continue;
    if (n < 0) return Error::FromErrno("recv");
    if (n == 0) return Error(ECONNRESET, "the connection was closed");
    pending_.insert(pending_.end(), buffer, buffer + n);
  }
}

}  // namespace vtr
