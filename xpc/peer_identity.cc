#include "xpc/peer_identity.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <string>

#include "platform/format.h"

// Older kernel headers lack these; the kernel answers ENOPROTOOPT / ENOSYS
// where it lacks them too.
#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif
#ifndef SYS_pidfd_open
#define SYS_pidfd_open 434
#endif
#ifndef SYS_pidfd_send_signal
#define SYS_pidfd_send_signal 424
#endif

namespace vtr {
namespace {

// A stat line is a few hundred bytes; anything longer is not one.
constexpr size_t kMaxStatBytes = 4096;
// Field 22 (starttime) is the 20th field after the command name's ')'.
constexpr int kStartTimeFieldAfterName = 20;

UniqueFd PidfdFromSocket(int socketFd) {
  int pidfd = -1;
  socklen_t length = sizeof pidfd;
  if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &length) != 0 || pidfd < 0) return UniqueFd();
  ::fcntl(pidfd, F_SETFD, FD_CLOEXEC);
  return UniqueFd(pidfd);
}

UniqueFd PidfdFromPid(pid_t pid) {
  long pidfd = ::syscall(SYS_pidfd_open, pid, 0);
  return UniqueFd(pidfd < 0 ? -1 : static_cast<int>(pidfd));
}

Error Gone(pid_t pid) { return Error(ESRCH, Format("the peer process %d has exited", pid)); }

}  // namespace

Result<UniqueFd> OpenProcDirectory(const std::string& path) {
  int fd = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (fd < 0) return Error::FromErrno("open " + path);
  return UniqueFd(fd);
}

Result<uint64_t> ParseProcessStartTime(std::string_view text) {
  size_t close = text.rfind(')');
  if (close == std::string_view::npos) return Error::Invalid("no command name in the stat text");
  std::string_view rest = text.substr(close + 1);
  for (int field = 0; field < kStartTimeFieldAfterName; ++field) {
    size_t start = rest.find_first_not_of(' ');
    if (start == std::string_view::npos) return Error::Invalid("too few fields in the stat text");
    rest = rest.substr(start);
    size_t end = rest.find(' ');
    std::string_view value = rest.substr(0, end);
    if (field == kStartTimeFieldAfterName - 1) {
      uint64_t startTime = 0;
      auto [ptr, ec] = std::from_chars(value.data(), value.data() + value.size(), startTime);
      if (ec != std::errc() || ptr != value.data() + value.size() || value.empty()) {
        return Error::Invalid("malformed start time in the stat text");
      }
      return startTime;
    }
    if (end == std::string_view::npos) return Error::Invalid("too few fields in the stat text");
    rest = rest.substr(end);
  }
  return Error::Invalid("too few fields in the stat text");
}

Result<uint64_t> ReadProcessStartTime(int processDirFd) {
  UniqueFd fd(::openat(processDirFd, "stat", O_RDONLY | O_CLOEXEC));
  if (!fd) return Error::FromErrno("open stat");
  char buffer[kMaxStatBytes];
  size_t used = 0;
  while (used < sizeof buffer) {
    ssize_t n = ::read(fd.get(), buffer + used, sizeof buffer - used);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return Error::FromErrno("read stat");
    if (n == 0) break;
    used += static_cast<size_t>(n);
  }
  return ParseProcessStartTime(std::string_view(buffer, used));
}

Result<PeerIdentity> PeerIdentity::Capture(int socketFd, int procDirFd) {
  struct ucred credentials = {};
  socklen_t length = sizeof credentials;
  if (::getsockopt(socketFd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
    return Error::FromErrno("SO_PEERCRED");
  }
  PeerIdentity identity;
  identity.pid_ = credentials.pid;
  identity.uid_ = credentials.uid;
  identity.gid_ = credentials.gid;
  // pid 0: the peer lives in a pid namespace this one cannot see.
  if (identity.pid_ <= 0) return identity;

  // The socket's pidfd is exact; without SO_PEERPIDFD one is looked up by
  // pid at accept; without pidfds the start time alone pins the process.
  identity.pidfd_ = PidfdFromSocket(socketFd);
  if (!identity.pidfd_) identity.pidfd_ = PidfdFromPid(identity.pid_);
  identity.pin(procDirFd);
  return identity;
}

bool PeerIdentity::pin(int procDirFd) {
  std::string name = std::to_string(pid_);
  UniqueFd dir(::openat(procDirFd, name.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dir) return false;
  struct stat executable;
  if (::fstatat(dir.get(), "exe", &executable, 0) != 0) return false;
  Result<uint64_t> startTime = ReadProcessStartTime(dir.get());
  if (!startTime) return false;
  // Checked after the directory was opened: while the pidfd's process lives
  // its pid cannot have been handed to another, so the directory is its own.
  if (pidfd_ && !processAlive()) return false;
  processDir_ = std::move(dir);
  executableDevice_ = executable.st_dev;
  executableInode_ = executable.st_ino;
  startTime_ = *startTime;
  return true;
}

bool PeerIdentity::processAlive() const {
  if (!pidfd_) return true;
  // Signal 0 checks existence only; EPERM would still mean it exists.
  return ::syscall(SYS_pidfd_send_signal, pidfd_.get(), 0, nullptr, 0) == 0 || errno == EPERM;
}

Result<UniqueFd> PeerIdentity::openExecutable() const {
  if (!pinned()) return Error(ESRCH, Format("the peer process %d could not be identified when it connected", pid_));
  if (!processAlive()) return Gone(pid_);
  UniqueFd executable(::openat(processDir_.get(), "exe", O_RDONLY | O_CLOEXEC));
  if (!executable) return errno == EACCES ? Error::FromErrno("open the peer's executable") : Gone(pid_);
  struct stat st;
  if (::fstat(executable.get(), &st) != 0) return Error::FromErrno("fstat the peer's executable");
  if (st.st_dev != executableDevice_ || st.st_ino != executableInode_) {
    return Error(ESRCH, Format("the peer process %d now runs another executable", pid_));
  }
  Result<uint64_t> startTime = ReadProcessStartTime(processDir_.get());
  if (!startTime || *startTime != startTime_ || !processAlive()) return Gone(pid_);
  return executable;
}

}  // namespace vtr
