// The helper's message service: the one listener of the process, the
// handlers of its events and of each connection's events, and the rules by
// which the process exits.
//
//   listener cannot be created            exit 1 ("Could not create XPC listener.")
//   termination imminent (SIGTERM)        exit 0
//   listener invalid                      exit 0
//   any other listener error              exit 1, after cancelling the listener
//   a client that disconnects             the responder forgets its connection
//
// Everything runs on the main thread, inside the listener's loop.
#ifndef VTR_VITD_HELPER_SERVICE_H_
#define VTR_VITD_HELPER_SERVICE_H_

#include <string>

#include "platform/unique_fd.h"

namespace vtr {

// Where the service listens (inside the sandbox root when there is one),
// unless systemd passed a socket.
inline constexpr char kServiceSocketPath[] = "/run/com.orvane.vitrelldhelper.sock";

// Creates the listener and installs its handlers; returns 0. A second call
// finds it made and returns 0 at once. Exits with status 1 when the listener
// cannot be created. procDirectory is /proc, opened before any chroot.
int CreateXPCListener(UniqueFd procDirectory);

// Serves for ever (the handlers end the process).
[[noreturn]] void RunService();

}  // namespace vtr

#endif  // VTR_VITD_HELPER_SERVICE_H_
