#include "platform/writer_lease.h"

#include <fcntl.h>
#include <signal.h>

namespace vtr {

WriterLease::WriterLease(int fd) {
  if (::fcntl(fd, F_SETSIG, SIGURG) != 0) return;
  if (::fcntl(fd, F_SETLEASE, F_RDLCK) != 0) return;
  fd_ = fd;
}

WriterLease::~WriterLease() {
  if (fd_ >= 0) ::fcntl(fd_, F_SETLEASE, F_UNLCK);
}

bool WriterLease::stillAlone() const {
  // A lease being broken reads as the type it is going to: unlocked. A
  // writer that took its write access but has not come to break the lease
  // yet is seen by taking the lease again: refused while anyone holds
  // write access (EAGAIN).
  return unbroken() && ::fcntl(fd_, F_SETLEASE, F_RDLCK) == 0;
}

bool WriterLease::unbroken() const { return fd_ >= 0 && ::fcntl(fd_, F_GETLEASE) == F_RDLCK; }

}  // namespace vtr
