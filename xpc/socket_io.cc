#include "xpc/socket_io.h"

#include <poll.h>
#include <sys/socket.h>

#include <cerrno>

namespace vtr {
namespace {

using Clock = std::chrono::steady_clock;

// Polls fd for events until deadline. 1 ready, 0 timed out, -1 error (errno).
int PollUntil(int fd, short events, Clock::time_point deadline) {
  for (;;) {
    auto left = std::chrono::ceil<std::chrono::milliseconds>(deadline - Clock::now());
    if (left.count() < 0) left = std::chrono::milliseconds(0);
    struct pollfd pfd = {fd, events, 0};
    int n = ::poll(&pfd, 1, static_cast<int>(left.count()));
    if (n >= 0 || errno != EINTR) return n;
  }
}

}  // namespace

Status SendAll(int fd, std::span<const uint8_t> bytes, std::chrono::milliseconds timeout) {
  Clock::time_point deadline = Clock::now() + timeout;
  while (!bytes.empty()) {
    ssize_t n = ::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n > 0) {
      bytes = bytes.subspan(static_cast<size_t>(n));
      continue;
    }
    if (n < 0 && errno == EINTR) continue;
    if (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK) return Error::FromErrno("send");
    int ready = PollUntil(fd, POLLOUT, deadline);
    if (ready < 0) return Error::FromErrno("poll");
    if (ready == 0) return Error(ETIMEDOUT, "the peer stopped reading");
  }
  return Status::Ok();
}

bool WaitReadable(int fd, std::chrono::milliseconds timeout) {
  return PollUntil(fd, POLLIN, Clock::now() + timeout) > 0;
}

}  // namespace vtr
