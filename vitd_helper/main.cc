// vitd_helper: the demo-mode privileged helper daemon.
#include <fcntl.h>
#include <getopt.h>

#include <cstdio>
#include <cstring>
#include <ctime>
#include <string>

#include "model/log.h"
#include "model/progress_updater.h"
#include "vitd_helper/client_areas.h"
#include "vitd_helper/message_responder.h"
#include "vitd_helper/operations.h"
#include "vitd_helper/partition_resize.h"
#include "vitd_helper/sandbox.h"
#include "vitd_helper/service.h"
#include "xpc/listener.h"
#include "xpc/peer_identity.h"

namespace {

constexpr char kUsage[] =
    "Usage: vitd_helper [--root DIR] [--stderr]\n"
    "       vitd_helper --help | --version\n"
    "\n"
    "The demo-mode privileged helper. Serves the demo-mode daemon on the Unix\n"
    "socket /run/com.orvane.vitrelldhelper.sock (or the socket systemd passes),\n"
    "and only clients whose executable carries its entitlement.\n"
    "\n"
    "  --root DIR   confine the helper to DIR (chroot): the socket, the log files\n"
    "               and every path a client sends resolve inside DIR; the\n"
    "               accounts come from DIR/etc/passwd and DIR/etc/group; firmware\n"
    "               variables live in DIR/sys/firmware/efi/efivars, and \"reboot:\"\n"
    "               restarts only a PID namespace the helper is the first process of\n"
    "  --stderr     send the system-log copy of each message to standard error\n"
    "               instead of syslog\n"
    "  --help       show this text\n"
    "  --version    show the version\n"
    "\n"
    "Exit status: 0 ended on request or by SIGTERM, 1 cannot serve (the system\n"
    "log says why), 64 usage error.\n";

// Exit status of a bad command line (sysexits' EX_USAGE).
constexpr int kExitUsage = 64;

struct Options {
  std::string root;
  bool toStderr = false;
};

// Parses the command line; exits on --help and on a usage error.
Options ParseOptions(int argc, char** argv) {
  static const struct option kLongOptions[] = {
      {"root", required_argument, nullptr, 'r'},
      {"stderr", no_argument, nullptr, 's'},
      {"help", no_argument, nullptr, 'h'},
      {"version", no_argument, nullptr, 'V'},
      {nullptr, 0, nullptr, 0},
  };
  Options options;
  int c;
  while ((c = getopt_long(argc, argv, "", kLongOptions, nullptr)) != -1) {
    switch (c) {
      case 'r':
        options.root = optarg;
        break;
      case 's':
        options.toStderr = true;
        break;
      case 'h':
        std::fputs(kUsage, stdout);
        std::exit(0);
      case 'V':
        std::printf("vitd_helper (vitd) %s\n", VTR_VERSION);
        std::exit(0);
      default:
        std::fputs(kUsage, stderr);
        std::exit(kExitUsage);
    }
  }
  if (optind != argc) {
    std::fprintf(stderr, "vitd_helper: unexpected argument '%s'\n", argv[optind]);
    std::fputs(kUsage, stderr);
    std::exit(kExitUsage);
  }
  return options;
}

}  // namespace

int main(int argc, char** argv) {
  using namespace vtr;
  const Options options = ParseOptions(argc, argv);

  // The system log is opened before any chroot, so that it keeps working.
  VTRLogModel& logModel = VTRLogModel::sharedInstance();
  if (options.toStderr) logModel.setSystemLog(MakeStderrLog());

  // The local time zone is read now: inside a sandbox root /etc/localtime
  // may be missing, and the day's log file is named by the local date.
  ::tzset();
  Result<UniqueFd> proc = options.root.empty() ? OpenProcDirectory("/proc") : EnterSandboxRoot(options.root);
  if (!proc.ok()) {
    std::fprintf(stderr, "vitd_helper: cannot set up %s: %s\n", options.root.empty() ? "/proc" : options.root.c_str(),
                 proc.error().description().c_str());
    return 1;
  }

  // Where client paths may lie; a file anyone but root could have written
  // is no basis to serve on.
  Result<ClientAreas> areas = ClientAreas::Load(VTRHOperations::sharedInstance().resolver().root());
  if (!areas.ok()) {
    VTRLogError("Refusing to start: %@", areas.error().message());
    std::fprintf(stderr, "vitd_helper: refusing to start: %s\n", areas.error().message().c_str());
    return 1;
  }
  VTRHOperations::sharedInstance().setClientAreas(std::move(areas).value());
  // In a sandbox root "reboot:" may end only the helper's own PID namespace.
  if (options.root.empty()) VTRHOperations::sharedInstance().setRebootScope(VTRHOperations::RebootScope::kMachine);

  VTRLog("%s started", argv[0]);
  (void)logModel.enableLogToFilesUnder("/private/var/logs/vitd", "vitd_helper", 5);
  // A helper already serving on this root may have work under way, which
  // is not to be taken for interrupted work; this one then stops at its
  // socket.
  if (!Listener::AnotherServerListens(kServiceSocketPath)) VTRHOperations::sharedInstance().finishInterruptedWork();

  VTRProgressUpdater::sharedInstance().setSender(
      [](int64_t percent) { VTRHMessageResponder::sharedInstance().sendProgress(percent); });

  // The data-partition commands read the mount table through /proc too.
  DataPartitionDisk disk;
  disk.procDirectory = std::make_shared<const UniqueFd>(::fcntl(proc->get(), F_DUPFD_CLOEXEC, 0));
  SetDataPartitionDisk(std::move(disk));

  HelperService service(std::move(proc).value());
  return service.run();
}
