// One exchange with the helper: send a request, print every message that
// comes back, and tell how it went.
#ifndef VTR_TOOLS_VITDCTL_SESSION_H_
#define VTR_TOOLS_VITDCTL_SESSION_H_

#include <chrono>
#include <cstdio>
#include <string>

#include "client/vitd_client.h"
#include "tools/common/tool_conventions.h"

namespace vtr::vitdctl {

// Exit statuses of vitdctl, the tools' common ones: every "Response" true
// (kExitOk), one false (kExitNo), a timeout or closed connection before every
// response came (kExitNoAnswer), nothing listening (kExitUnavailable), a bad
// command line (kExitUsage) or request file (kExitBadInput, kExitNoInput).
using namespace vtr::tools;

struct SessionOptions {
  std::string socketPath;
  // How long to wait for the next message (each message restarts the wait).
  std::chrono::milliseconds timeout{60000};
  // Draw "Progress" as a bar on this terminal instead of printing JSON lines.
  bool progressBar = false;
  // The request ends the helper: the connection closing before a reply is
  // its success (a reply still counts as the helper gives it).
  bool closeIsSuccess = false;
  // Start each line with the command it answers ("prepareWorkContainer: "):
  // the helper answers a request's keys in their order, one "Response" each.
  bool label = false;
  // Said after a false answer: where the helper wrote why.
  std::string whereReasonsAre;
  // Said after a failed connection, after the system's reason: how to start
  // the helper.
  std::string howToStart;
};

// Sends request (a dictionary) and prints each message received as one line
// of JSON to out ({"Response":true}, {"Progress":42}, {"Data":"<base64>"}),
// until one "Response" per key of the request has come, the helper closes
// the connection, or the timeout passes. Diagnostics go to standard error;
// when the helper stays silent they say what usually causes that.
int RunSession(const SessionOptions& options, const vitd_value& request, FILE* out);

}  // namespace vtr::vitdctl

#endif  // VTR_TOOLS_VITDCTL_SESSION_H_
