// WriterLease: proof that no process can write a file while the helper
// works on it, without copying it.
//
// A read lease (fcntl F_SETLEASE F_RDLCK) is granted only while no one holds
// the file open for writing, and a shared writable mapping keeps such an
// open file alive, so granting it proves there is no writer. While it is
// held, an open for writing or a truncation by anyone else waits for the
// lease to be broken (by its release, or after the kernel's lease-break
// time), having passed its permission check already; stillAlone() sees such
// a waiter. So: take the lease, check and change the file, ask stillAlone()
// before releasing, and undo what a waiting writer must not get.
//
// Needs CAP_LEASE for a file of another owner. The break's signal is
// SIGURG, which the helper ignores (its default), never SIGIO, whose default
// would end the helper.
#ifndef VTR_PLATFORM_WRITER_LEASE_H_
#define VTR_PLATFORM_WRITER_LEASE_H_

namespace vtr {

class WriterLease {
 public:
  // Takes a read lease on fd, open read-only (fd stays the caller's and
  // must outlive the lease). When it cannot be had (a writer exists, the
  // file system or this process may not lease: errno set), the object is
  // not held().
  explicit WriterLease(int fd);
  // Releases the lease: a writer that waited goes on.
  ~WriterLease();
  WriterLease(const WriterLease&) = delete;
  WriterLease& operator=(const WriterLease&) = delete;

  bool held() const { return fd_ >= 0; }
  // Whether the lease is still held, no writer has come to wait on it and
  // no one holds write access to the file.
  bool stillAlone() const;
  // Whether the lease is still held and no writer has come to wait on it
  // (one that took write access but has not come yet is not seen): enough
  // before a change that stillAlone() checks again before the release, as
  // such a writer then waits on the lease.
  bool unbroken() const;

 private:
  int fd_ = -1;
};

}  // namespace vtr

#endif  // VTR_PLATFORM_WRITER_LEASE_H_
