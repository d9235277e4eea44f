#include "tools/vitdctl/status.h"

#include <fcntl.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <ctime>
#include <map>
#include <optional>
#include <vector>

#include "platform/unique_fd.h"
#include "tools/common/tool_conventions.h"

extern char** environ;

namespace vtr::vitdctl {
namespace {

using namespace vtr::tools;

// What a program printed on standard output (its first 64 KiB), or nullopt
// when it could not be run or did not exit 0.
std::optional<std::string> OutputOf(const std::vector<std::string>& argv) {
  int out[2];
  if (::pipe2(out, O_CLOEXEC) != 0) return std::nullopt;
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, out[1], STDOUT_FILENO);
  posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
  std::vector<char*> args;
  for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
  args.push_back(nullptr);
  pid_t pid = -1;
  const int spawned = ::posix_spawnp(&pid, args[0], &actions, nullptr, args.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  ::close(out[1]);
  std::string text;
  char buffer[4096];
  ssize_t n;
  while (spawned == 0 && text.size() < 65536 && (n = ::read(out[0], buffer, sizeof buffer)) > 0) {
    text.append(buffer, static_cast<size_t>(n));
  }
  ::close(out[0]);
  int raw = 0;
  if (spawned != 0 || ::waitpid(pid, &raw, 0) != pid || !WIFEXITED(raw) || WEXITSTATUS(raw) != 0) return std::nullopt;
  return text;
}

// "KEY=value" lines of `systemctl show` for one unit.
std::map<std::string, std::string> UnitProperties(const std::string& unit) {
  std::map<std::string, std::string> properties;
  std::optional<std::string> text =
      OutputOf({"systemctl", "show", "--property=ActiveState,SubState,MainPID,Listen", unit});
  if (!text) return properties;
  size_t start = 0;
  while (start < text->size()) {
    size_t end = text->find('\n', start);
    if (end == std::string::npos) end = text->size();
    const std::string line = text->substr(start, end - start);
    if (const size_t eq = line.find('='); eq != std::string::npos) properties[line.substr(0, eq)] = line.substr(eq + 1);
    start = end + 1;
  }
  return properties;
}

// A connected socket to path, or an invalid fd with errno set.
UniqueFd Connect(const std::string& path) {
  struct sockaddr_un address = {};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) {
    errno = ENAMETOOLONG;
    return UniqueFd();
  }
  std::memcpy(address.sun_path, path.data(), path.size());
  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!fd) return fd;
  if (::connect(fd.get(), reinterpret_cast<const struct sockaddr*>(&address), sizeof address) != 0) return UniqueFd();
  return fd;
}

// The first line the executable prints for --version, or empty.
std::string VersionOf(const std::string& executable) {
  std::optional<std::string> text = OutputOf({executable, "--version"});
  if (!text) return "";
  return text->substr(0, text->find('\n'));
}

// The running helper's version, else the installed one's (said so).
std::string HelperVersion(pid_t pid) {
  if (pid > 0) {
    const std::string running = VersionOf("/proc/" + std::to_string(pid) + "/exe");
    if (!running.empty()) return running + " (the running helper)";
  }
  const std::string installed = VersionOf(VITD_HELPER_EXECUTABLE);
  if (!installed.empty()) return installed + " (installed at " VITD_HELPER_EXECUTABLE ")";
  return "unknown (cannot run " VITD_HELPER_EXECUTABLE " --version)";
}

std::string TodaysDayFile(const std::string& root) {
  const time_t now = ::time(nullptr);
  struct tm local;
  ::localtime_r(&now, &local);
  char name[64];
  std::snprintf(name, sizeof name, "vitd_helper-%4d%02d%02d.log", local.tm_year + 1900, local.tm_mon + 1,
                local.tm_mday);
  return root + "/private/var/logs/vitd/" + name;
}

bool BootedWithSystemd() {
  struct stat st;
  return ::lstat("/run/systemd/system", &st) == 0 && S_ISDIR(st.st_mode);
}

}  // namespace

std::string ConnectFailure(const std::string& socketPath) {
  UniqueFd fd = Connect(socketPath);
  return fd ? std::string() : std::string(std::strerror(errno));
}

int PrintHelperStatus(const StatusQuery& query, FILE* out) {
  bool socketUp = false;
  pid_t helperPid = 0;
  std::fprintf(out, "socket:  %s\n", query.socketPath.c_str());
  if (query.systemHelper && BootedWithSystemd()) {
    std::map<std::string, std::string> socket = UnitProperties("vitd_helper.socket");
    std::map<std::string, std::string> service = UnitProperties("vitd_helper.service");
    socketUp = socket["ActiveState"] == "active";
    helperPid = static_cast<pid_t>(std::atol(service["MainPID"].c_str()));
    std::fprintf(out, "  vitd_helper.socket: %s (%s)\n", socket["ActiveState"].c_str(), socket["SubState"].c_str());
    std::fprintf(out, "helper:  vitd_helper.service %s (%s)%s\n", service["ActiveState"].c_str(),
                 service["SubState"].c_str(),
                 helperPid > 0 ? (", pid " + std::to_string(helperPid)).c_str()
                               : "; systemd starts it on the first request");
    if (!socketUp) std::fprintf(out, "  start the socket with: systemctl start vitd_helper.socket\n");
  } else {
    UniqueFd fd = Connect(query.socketPath);
    socketUp = static_cast<bool>(fd);
    if (!socketUp) {
      std::fprintf(out, "  down: %s\n", std::strerror(errno));
    } else {
      std::fprintf(out, "  accepting connections\n");
      struct ucred peer = {};
      socklen_t length = sizeof peer;
      if (::getsockopt(fd.get(), SOL_SOCKET, SO_PEERCRED, &peer, &length) == 0) helperPid = peer.pid;
    }
    std::fprintf(out, "helper:  %s\n",
                 socketUp ? ("up, pid " + std::to_string(helperPid) + " listening").c_str() : "not running");
    if (!socketUp && !query.root.empty()) {
      std::fprintf(out, "  start it with: %s --root %s --stderr\n", VITD_HELPER_EXECUTABLE, query.root.c_str());
    }
  }
  std::fprintf(out, "version: %s\n", HelperVersion(helperPid).c_str());
  std::fprintf(out, "logs:    %s (the helper's day file)\n", TodaysDayFile(query.root).c_str());
  if (query.root.empty()) {
    std::fprintf(out, "         journalctl -t vitd_helper (why a command answered false: add -p err)\n");
  } else {
    std::fprintf(out, "         the helper's standard error when it runs with --stderr, else the system log\n");
  }
  return socketUp ? kExitOk : kExitUnavailable;
}

}  // namespace vtr::vitdctl
