// Socket writes with a deadline, shared by the helper's connections and the
// client side. Thread-compatible: one writer per socket at a time.
#ifndef VTR_XPC_SOCKET_IO_H_
#define VTR_XPC_SOCKET_IO_H_

#include <chrono>
#include <cstdint>
#include <span>

#include "platform/result.h"

namespace vtr {

// Writes all of bytes to the stream socket fd (blocking or non-blocking),
// waiting for room as needed but no longer than timeout in total. Never
// raises SIGPIPE. An Error with ETIMEDOUT when the peer stops reading, or
// the send error (EPIPE, ECONNRESET, ...) when it went away; part of the
// bytes may have been written then.
Status SendAll(int fd, std::span<const uint8_t> bytes, std::chrono::milliseconds timeout);

// Waits until fd is readable (or has hung up) for at most timeout. True when
// it is; false on timeout. Interrupted waits resume with the time left.
bool WaitReadable(int fd, std::chrono::milliseconds timeout);

}  // namespace vtr

#endif  // VTR_XPC_SOCKET_IO_H_
