#include "tests/vitd_helper/helper_sandbox.h"

#include <fcntl.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <sstream>
#include <thread>

#include <gtest/gtest.h>

#include "platform/make_directories.h"
#include "tests/support/test_support.h"
#include "xpc/client.h"

namespace vtr::testing {
namespace {

int StatusOf(int raw) { return WIFEXITED(raw) ? WEXITSTATUS(raw) : -1; }

}  // namespace

std::string HelperExecutable() { return std::string(VTR_BINARY_DIR) + "/bin/vitd_helper"; }
std::string VitdctlExecutable() { return std::string(VTR_BINARY_DIR) + "/bin/vitdctl"; }
std::string UnentitledVitdctlExecutable() { return std::string(VTR_BINARY_DIR) + "/tests/vitdctl_unentitled"; }
std::string StringEntitledVitdctlExecutable() { return std::string(VTR_BINARY_DIR) + "/tests/vitdctl_string_entitled"; }

HelperSandbox::HelperSandbox() {
  // A short path: the socket path must fit in 108 bytes.
  char pattern[] = "/tmp/vh.XXXXXX";
  if (::mkdtemp(pattern) == nullptr) ADD_FAILURE() << "mkdtemp failed";
  root_ = pattern;
  ::chmod(root_.c_str(), 0755);
  for (const char* dir : {"/etc", "/run", "/private/var/root/Library/Preferences",
                          "/private/var/mobile/Library/Preferences", "/private/var/logs"}) {
    EXPECT_TRUE(MakeDirectories(root_ + dir).ok()) << dir;
  }
  ::symlink("private/var", (root_ + "/var").c_str());
  WriteFile(root_ + "/etc/passwd",
            "root:x:0:0:root:/var/root:/bin/sh\nmobile:x:501:501:Mobile User:/var/mobile:/bin/sh\n");
  WriteFile(root_ + "/etc/group", "root:x:0:\nmobile:x:501:\n");
  logPath_ = root_ + ".log";
}

HelperSandbox::~HelperSandbox() {
  if (pid_ > 0) {
    ::kill(pid_, SIGKILL);
    ::waitpid(pid_, nullptr, 0);
  }
  RemoveTree(root_);
  ::unlink(logPath_.c_str());
}

bool HelperSandbox::start(bool ownPidNamespace) {
  const std::string helper = HelperExecutable();
  const std::string root = root_;
  // A socket left by an earlier helper would look like this one's.
  ::unlink(socketPath().c_str());
  const int logFd = ::open(logPath_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  // clone without a stack behaves as fork; the new namespace is the
  // child's alone, so this process's later children are not in it.
  pid_ = ownPidNamespace ? static_cast<pid_t>(::syscall(SYS_clone, CLONE_NEWPID | SIGCHLD, nullptr, nullptr, nullptr,
                                                        nullptr))
                         : ::fork();
  if (pid_ == 0) {
    // In a namespace of its own the helper needs a /proc that shows it:
    // peers are known by their process ids there.
    if (ownPidNamespace && (::unshare(CLONE_NEWNS) != 0 || ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
                            ::mount("proc", "/proc", "proc", MS_NOSUID | MS_NODEV | MS_NOEXEC, nullptr) != 0)) {
      ::_exit(126);
    }
    if (failing_ && !failing_->install()) ::_exit(125);
    ::dup2(logFd, STDERR_FILENO);
    const int devnull = ::open("/dev/null", O_RDWR);
    ::dup2(devnull, STDIN_FILENO);
    ::dup2(devnull, STDOUT_FILENO);
    // LeakSanitizer reads /proc at exit, which the chrooted helper cannot
    // reach; the sanitizer build would otherwise fail every clean exit.
    const char* asan = std::getenv("ASAN_OPTIONS");
    const std::string options = std::string(asan ? asan : "") + (asan && *asan ? ":" : "") + "detect_leaks=0";
    ::setenv("ASAN_OPTIONS", options.c_str(), 1);
    ::execl(helper.c_str(), helper.c_str(), "--root", root.c_str(), "--stderr", static_cast<char*>(nullptr));
    ::_exit(127);
  }
  ::close(logFd);
  // The socket file appears at bind, a moment before the helper listens:
  // ready means a connection is accepted.
  for (int i = 0; i < 200; ++i) {
    if (XpcClient::Connect(socketPath()).ok()) return true;
    if (!running()) return false;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return false;
}

std::vector<XpcObject> HelperSandbox::request(const XpcObject& request, size_t expected,
                                              std::chrono::milliseconds quiet) {
  std::vector<XpcObject> messages;
  Result<XpcClient> client = XpcClient::Connect(socketPath());
  if (!client.ok()) {
    ADD_FAILURE() << "connect: " << client.error().description();
    return messages;
  }
  if (Status s = client->send(request); !s.ok()) {
    ADD_FAILURE() << "send: " << s.error().description();
    return messages;
  }
  size_t responses = 0;
  while (responses < expected) {
    Result<XpcObject> message = client->receive(quiet);
    if (!message.ok()) break;
    if (message->find("Response") != nullptr) ++responses;
    messages.push_back(std::move(message).value());
  }
  return messages;
}

std::optional<bool> Answer(HelperSandbox& sandbox, const std::string& key, XpcObject parameter,
                           std::chrono::milliseconds quiet) {
  for (const XpcObject& reply : sandbox.request(XpcObject::Dictionary({{key, std::move(parameter)}}), 1, quiet)) {
    if (const XpcObject* response = reply.find("Response")) return response->boolValue();
  }
  return std::nullopt;
}

HelperSandbox::RunResult HelperSandbox::run(const std::string& executable,
                                            const std::vector<std::string>& args) const {
  int out[2];
  if (::pipe2(out, O_CLOEXEC) != 0) return {};
  // Standard error goes to a memory file, read once the client has ended.
  UniqueFd errors(::memfd_create("client-stderr", MFD_CLOEXEC));
  const pid_t pid = ::fork();
  if (pid == 0) {
    ::dup2(out[1], STDOUT_FILENO);
    if (errors) ::dup2(errors.get(), STDERR_FILENO);
    std::vector<char*> argv;
    argv.push_back(const_cast<char*>(executable.c_str()));
    for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
    argv.push_back(nullptr);
    ::execv(executable.c_str(), argv.data());
    ::_exit(127);
  }
  ::close(out[1]);
  RunResult result;
  char buf[4096];
  ssize_t n;
  while ((n = ::read(out[0], buf, sizeof buf)) > 0) result.output.append(buf, static_cast<size_t>(n));
  ::close(out[0]);
  int raw = 0;
  ::waitpid(pid, &raw, 0);
  result.status = StatusOf(raw);
  ::lseek(errors.get(), 0, SEEK_SET);
  while (errors && (n = ::read(errors.get(), buf, sizeof buf)) > 0) result.errors.append(buf, static_cast<size_t>(n));
  return result;
}

bool HelperSandbox::running() {
  if (pid_ <= 0) return false;
  int raw = 0;
  if (::waitpid(pid_, &raw, WNOHANG) == 0) return true;
  reaped(raw);
  return false;
}

int HelperSandbox::waitForExit(std::chrono::milliseconds timeout) {
  if (pid_ <= 0) return exitStatus_;
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (std::chrono::steady_clock::now() < deadline) {
    int raw = 0;
    const pid_t r = ::waitpid(pid_, &raw, WNOHANG);
    if (r == pid_) {
      reaped(raw);
      return exitStatus_;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return -1;
}

void HelperSandbox::reaped(int rawStatus) {
  pid_ = -1;
  exitStatus_ = StatusOf(rawStatus);
  endingSignal_ = WIFSIGNALED(rawStatus) ? WTERMSIG(rawStatus) : 0;
}

int HelperSandbox::terminate() {
  if (pid_ <= 0) return exitStatus_;
  ::kill(pid_, SIGTERM);
  return waitForExit(std::chrono::seconds(10));
}

std::string HelperSandbox::log() const { return ReadFile(logPath_); }

std::string HelperSandbox::dayLogPath() const {
  const time_t now = ::time(nullptr);
  struct tm local;
  ::localtime_r(&now, &local);
  char name[64];
  std::snprintf(name, sizeof name, "/private/var/logs/vitd/vitd_helper-%4d%02d%02d.log", local.tm_year + 1900,
                local.tm_mon + 1, local.tm_mday);
  return host(name);
}

bool HelperSandbox::logged(const std::string& line) const {
  std::stringstream lines(log());
  std::string l;
  while (std::getline(lines, l)) {
    if (l == line) return true;
  }
  return false;
}

}  // namespace vtr::testing
