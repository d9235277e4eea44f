// HelperService: the helper's message service: its one listener, the
// handlers of the listener's and each connection's events, and the rules by
// which the service ends (run() answers the process's exit status):
//
//   listener cannot be created            1 ("Could not create XPC listener.")
//   termination imminent (SIGTERM)        0
//   listener invalid                      0
//   any other listener error              1, after cancelling the listener
//   a client that disconnects             the responder forgets its connection
//
// A peer whose executable lacks the entitlement is not trusted: its frames
// are validated and dropped undecoded (the responder still logs why it gets
// no reply), and the lines it causes are rate-limited per uid; the entitled
// client's are not.
//
// Everything runs on the thread that calls run(), inside the listener's loop.
#ifndef VTR_VITD_HELPER_SERVICE_H_
#define VTR_VITD_HELPER_SERVICE_H_

#include <memory>
#include <string>

#include "platform/unique_fd.h"
#include "xpc/listener.h"

namespace vtr {

// Where the service listens (inside the sandbox root when there is one),
// unless systemd passed a socket.
inline constexpr char kServiceSocketPath[] = "/run/com.orvane.vitrelldhelper.sock";

class HelperService {
 public:
  // procDirectory is /proc, opened before any chroot; socketPath where to
  // listen when systemd passed no socket.
  explicit HelperService(UniqueFd procDirectory, std::string socketPath = kServiceSocketPath);

  // Creates the listener and installs its handlers; returns 0. A second call
  // finds it made and returns 0 at once. Returns 1 after "Could not create
  // XPC listener." when it cannot be made.
  int createXPCListener();

  // Serves until an event ends the service; its exit status.
  int run();

 private:
  void handleListenerEvent(const ListenerEvent& event);
  // Ends run() with status once the current event is handled.
  void finish(int status);

  std::shared_ptr<const UniqueFd> proc_;
  std::string socketPath_;
  std::unique_ptr<Listener> listener_;
  int exitStatus_ = 0;
};

}  // namespace vtr

#endif  // VTR_VITD_HELPER_SERVICE_H_
