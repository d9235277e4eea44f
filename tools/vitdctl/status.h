// `vitdctl status`: whether the helper's socket and the helper are up, the
// helper's version and where its logs are, without sending a request.
//
// For the system's helper, systemd is asked (`systemctl show`) about
// vitd_helper.socket and vitd_helper.service, so that asking does not start
// the helper through its socket. For a helper under --root or at --socket
// PATH, the socket is probed with a connection, and the process listening on
// it is known by the connection's peer credentials. The version is what the
// helper's executable prints for --version: the running process's own
// (/proc/PID/exe) when it can be read, else the installed executable's,
// labelled as such.
#ifndef VTR_TOOLS_VITDCTL_STATUS_H_
#define VTR_TOOLS_VITDCTL_STATUS_H_

#include <cstdio>
#include <string>

namespace vtr::vitdctl {

struct StatusQuery {
  std::string socketPath;
  std::string root;           // --root DIR, or empty
  bool systemHelper = false;  // neither --root nor --socket: systemd's units
};

// Prints the report to out; kExitOk when the socket accepts connections (or
// systemd listens on it), kExitUnavailable otherwise.
int PrintHelperStatus(const StatusQuery& query, FILE* out);

// Why a connection to socketPath fails, in the system's words
// ("No such file or directory"), from a connection attempt of its own; empty
// when it succeeds now.
std::string ConnectFailure(const std::string& socketPath);

}  // namespace vtr::vitdctl

#endif  // VTR_TOOLS_VITDCTL_STATUS_H_
