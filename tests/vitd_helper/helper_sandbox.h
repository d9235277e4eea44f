// A running vitd_helper confined to a fresh sandbox root, for end-to-end
// tests over its socket. The root holds the accounts (root, mobile = 501)
// and the folders the helper expects (/private/var with /var linking to it,
// /run for the socket). Needs root (the helper chroots).
#ifndef VTR_TESTS_VITD_HELPER_HELPER_SANDBOX_H_
#define VTR_TESTS_VITD_HELPER_HELPER_SANDBOX_H_

#include <sys/types.h>

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "tests/support/failing_syscall.h"
#include "xpc/xpc_object.h"

namespace vtr::testing {

inline constexpr uid_t kMobileUid = 501;
inline constexpr gid_t kMobileGid = 501;

class HelperSandbox {
 public:
  // Makes the root; the helper is not started yet.
  HelperSandbox();
  // Kills the helper if it still runs and removes the root.
  ~HelperSandbox();
  HelperSandbox(const HelperSandbox&) = delete;
  HelperSandbox& operator=(const HelperSandbox&) = delete;

  // Starts the helper with --root and --stderr and waits for its socket.
  // False when it did not come up within a few seconds. With
  // ownPidNamespace the helper is the first process (PID 1) of a PID
  // namespace of its own, where a reboot ends only that namespace.
  bool start(bool ownPidNamespace = false);
  // Makes the system calls numbers fail with error in the helper started
  // next (a seccomp filter installed before it executes): a fault a real
  // disk does not offer on demand.
  void failSyscalls(const std::vector<long>& numbers, int error) { failing_.emplace(numbers, error); }

  // The host path of a path inside the root ("/private/var/x" ->
  // "<root>/private/var/x").
  std::string host(const std::string& inside) const { return root_ + inside; }
  const std::string& root() const { return root_; }
  std::string socketPath() const { return root_ + "/run/com.orvane.vitrelldhelper.sock"; }

  // Sends request from this process (which carries the entitlement) and
  // collects what comes back until `expected` "Response" messages have
  // arrived or nothing came for `quiet`.
  std::vector<XpcObject> request(const XpcObject& request, size_t expected,
                                 std::chrono::milliseconds quiet = std::chrono::milliseconds(3000));

  // Runs a client executable with arguments (e.g. a vitdctl variant with
  // "--root <root> --timeout 1 prepareWorkContainer /x"); returns its exit
  // status, its standard output and its standard error.
  struct RunResult {
    int status = -1;
    std::string output;
    std::string errors;
  };
  RunResult run(const std::string& executable, const std::vector<std::string>& args) const;

  // Sends SIGTERM and waits for the helper; its exit status (or -1 when it
  // was killed by a signal or did not end in time).
  int terminate();
  // The signal that ended the helper once it was reaped by a signal; 0
  // otherwise.
  int endingSignal() const { return endingSignal_; }
  // Waits up to timeout for the helper to exit by itself; its status or -1.
  int waitForExit(std::chrono::milliseconds timeout);
  bool running();
  // The helper's process id while it runs.
  pid_t pid() const { return pid_; }
  // The host path of today's log file (named by the local date).
  std::string dayLogPath() const;

  // Everything the helper logged so far (its standard error).
  std::string log() const;
  // True when some line of the log equals line.
  bool logged(const std::string& line) const;

 private:
  // Records how the helper ended once waitpid gave rawStatus.
  void reaped(int rawStatus);

  std::string root_;
  std::string logPath_;
  std::optional<FailingSyscalls> failing_;
  pid_t pid_ = -1;
  int exitStatus_ = -1;  // once the helper was reaped
  int endingSignal_ = 0;
};

// The one "Response" to {key: parameter} sent to sandbox, or nullopt when
// none came before a silence of quiet.
std::optional<bool> Answer(HelperSandbox& sandbox, const std::string& key, XpcObject parameter,
                           std::chrono::milliseconds quiet = std::chrono::milliseconds(3000));

// The vitd_helper and vitdctl executables of this build, and vitdctl built
// without an entitlement and with a string-valued one.
std::string HelperExecutable();
std::string VitdctlExecutable();
std::string UnentitledVitdctlExecutable();
std::string StringEntitledVitdctlExecutable();

}  // namespace vtr::testing

#endif  // VTR_TESTS_VITD_HELPER_HELPER_SANDBOX_H_
