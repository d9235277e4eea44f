// PeerIdentity: who is at the other end of an accepted connection, captured
// once at accept and checked again for every message.
//
// At accept the helper records the peer's pid, uid and gid (SO_PEERCRED), a
// pidfd of the peer (SO_PEERPIDFD; on kernels without it pidfd_open(pid);
// on kernels without pidfds none), a directory fd of /proc/PID, the
// (device, inode) of the executable the process runs and its start time.
// The /proc/PID directory fd stays bound to that one process: once the
// process is gone, nothing can be opened through it, even if its pid is
// reused. The pidfd, where there is one, proves at accept that the directory
// opened by number is the peer's own.
//
// /proc is reached only through a directory fd opened before the helper
// confines itself to its root, never by an absolute path later.
//
// A PeerIdentity is move-only (it owns descriptors) and is used on one
// thread at a time.
#ifndef VTR_XPC_PEER_IDENTITY_H_
#define VTR_XPC_PEER_IDENTITY_H_

#include <sys/types.h>

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/result.h"
#include "platform/unique_fd.h"

namespace vtr {

// Opens the /proc directory (path given for tests) for later openat() calls.
Result<UniqueFd> OpenProcDirectory(const std::string& path = "/proc");

class PeerIdentity {
 public:
  // Captures the peer of the connected Unix socket socketFd, reading /proc
  // through procDirFd (both borrowed for the call only). An Error only when
  // the socket has no peer credentials. A peer that cannot be pinned down
  // (gone before accept, invisible in this pid namespace) yields an identity
  // whose every check fails.
  static Result<PeerIdentity> Capture(int socketFd, int procDirFd);

  PeerIdentity(PeerIdentity&&) = default;
  PeerIdentity& operator=(PeerIdentity&&) = default;

  pid_t pid() const { return pid_; }
  uid_t uid() const { return uid_; }
  gid_t gid() const { return gid_; }
  // True when the process and its executable were recorded at accept.
  bool pinned() const { return processDir_.valid(); }

  // Checks that the peer is still the process that connected (pidfd live,
  // same start time, reached through the /proc directory bound to it) and
  // still runs the executable it ran at accept, and opens that executable
  // for reading. An Error (ESRCH) when the process is gone or was never
  // pinned, and when it now runs another executable.
  Result<UniqueFd> openExecutable() const;

 private:
  PeerIdentity() = default;
  // Records the process directory, executable and start time; false (with
  // nothing recorded) when the process cannot be pinned down.
  bool pin(int procDirFd);
  bool processAlive() const;

  pid_t pid_ = 0;
  uid_t uid_ = 0;
  gid_t gid_ = 0;
  UniqueFd pidfd_;
  UniqueFd processDir_;
  dev_t executableDevice_ = 0;
  ino_t executableInode_ = 0;
  uint64_t startTime_ = 0;
};

// The start time (clock ticks after boot, field 22 of the stat file) of the
// process whose /proc directory is processDirFd; an Error when it cannot be
// read. Exposed for tests.
Result<uint64_t> ReadProcessStartTime(int processDirFd);

// The start time from the text of a stat file; an Error when malformed.
// The command name in it is the process's own choice and may hold spaces
// and parentheses, so fields are counted from the last ')'.
Result<uint64_t> ParseProcessStartTime(std::string_view statText);

}  // namespace vtr

#endif  // VTR_XPC_PEER_IDENTITY_H_
