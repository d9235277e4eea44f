#include "platform/file_tree.h"

#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdint>
#include <cstring>
#include <memory>

#include "platform/directory_listing.h"
#include "platform/file_manager.h"
#include "platform/output_stream.h"
#include "platform/paths.h"
#include "platform/remove_item.h"

// fchmodat2 (Linux 6.6) has the same number on every architecture; the C
// library's headers may predate it.
#ifndef SYS_fchmodat2
#define SYS_fchmodat2 452
#endif
// So have the extended-attribute calls relative to a directory (Linux 6.13).
#ifndef SYS_getxattrat
#define SYS_getxattrat 464
#endif
#ifndef SYS_setxattrat
#define SYS_setxattrat 463
#endif
#ifndef SYS_listxattrat
#define SYS_listxattrat 465
#endif

namespace vtr {
namespace {

constexpr size_t kCopyBufferBytes = size_t{256} << 10;
// The kernel's own bounds on extended attributes.
constexpr size_t kMaxXattrListBytes = 65536;
constexpr size_t kMaxXattrValueBytes = 65536;

// One side of a replication: an entry of an open directory.
struct Node {
  int dir;
  const std::string& name;
  const std::string& path;
};

Result<struct statx> StatNode(int dir, const char* name, int flags, const std::string& path) {
  struct statx stx;
  if (::statx(dir, name, flags | AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS, &stx) != 0) return Error::FromErrno(path);
  return stx;
}

// The argument block of getxattrat, as the kernel defines it (the C
// library's headers may predate it).
struct XattrArgs {
  uint64_t value;  // user address of the buffer
  uint32_t size;
  uint32_t flags;
};
static_assert(sizeof(XattrArgs) == 16, "getxattrat takes the first version of its arguments");

// Set once a kernel without the *xattrat calls has answered ENOSYS, so that
// it is not asked again for every item.
std::atomic<bool> xattrAtMissing{false};

bool IsPermissionDenied(int error) { return error == EPERM || error == EACCES; }

// The destination may not be able to hold some extended attributes (another
// file system, a namespace only root may write); those are passed over.
bool IsUnsupportedXattr(int error) { return error == ENOTSUP || IsPermissionDenied(error) || error == EINVAL; }

Status CopyExtendedAttributes(int from, int to, const std::string& srcPath, const std::string& dstPath) {
  const ssize_t listSize = ::flistxattr(from, nullptr, 0);
  if (listSize < 0) return errno == ENOTSUP ? Status::Ok() : Status(Error::FromErrno(srcPath));
  if (listSize == 0) return Status::Ok();
  if (static_cast<size_t>(listSize) > kMaxXattrListBytes) return Error(E2BIG, srcPath);
  std::vector<char> names(static_cast<size_t>(listSize));
  const ssize_t listed = ::flistxattr(from, names.data(), names.size());
  if (listed < 0) return Error::FromErrno(srcPath);
  std::vector<char> value(kMaxXattrValueBytes);
  for (size_t offset = 0; offset < static_cast<size_t>(listed);) {
    const char* name = names.data() + offset;
    const size_t length = ::strnlen(name, static_cast<size_t>(listed) - offset);
    offset += length + 1;
    if (length == 0 || offset > static_cast<size_t>(listed)) continue;  // not NUL-terminated: not a name
    const ssize_t size = ::fgetxattr(from, name, value.data(), value.size());
    if (size < 0 && errno == ENODATA) continue;  // removed since it was listed
    if (size < 0) return Error::FromErrno(srcPath);
    if (::fsetxattr(to, name, value.data(), static_cast<size_t>(size), 0) != 0 && !IsUnsupportedXattr(errno)) {
      return Error::FromErrno(dstPath);
    }
  }
  return Status::Ok();
}

// Extended attributes, owner, mode and times of an open file or directory.
Status CopyMetadata(int from, int to, const struct statx& st, const std::string& srcPath,
                    const std::string& dstPath) {
  Status xattrs = CopyExtendedAttributes(from, to, srcPath, dstPath);
  if (!xattrs.ok()) return xattrs;
  // Owner before mode: a change of owner clears the set-id bits.
  if (::fchown(to, st.stx_uid, st.stx_gid) != 0 && !IsPermissionDenied(errno)) return Error::FromErrno(dstPath);
  if (::fchmod(to, st.stx_mode & 07777) != 0) return Error::FromErrno(dstPath);
  const struct timespec times[2] = {{st.stx_atime.tv_sec, st.stx_atime.tv_nsec},
                                    {st.stx_mtime.tv_sec, st.stx_mtime.tv_nsec}};
  if (::futimens(to, times) != 0) return Error::FromErrno(dstPath);
  return Status::Ok();
}

// Owner and times of an item that cannot be opened (a link, a special file).
Status CopyMetadataAt(const Node& dst, const struct statx& st) {
  if (::fchownat(dst.dir, dst.name.c_str(), st.stx_uid, st.stx_gid, AT_SYMLINK_NOFOLLOW) != 0 &&
      !IsPermissionDenied(errno)) {
    return Error::FromErrno(dst.path);
  }
  const struct timespec times[2] = {{st.stx_atime.tv_sec, st.stx_atime.tv_nsec},
                                    {st.stx_mtime.tv_sec, st.stx_mtime.tv_nsec}};
  if (::utimensat(dst.dir, dst.name.c_str(), times, AT_SYMLINK_NOFOLLOW) != 0) return Error::FromErrno(dst.path);
  return Status::Ok();
}

// Copies [begin, end) of from to the same offsets of to: copy_file_range
// where the kernel can, read and write where it cannot.
Status CopyRange(int from, int to, off_t begin, off_t end, const std::string& srcPath, const std::string& dstPath) {
  off_t in = begin, out = begin;
  while (in < end) {
    const size_t want = static_cast<size_t>(std::min<off_t>(end - in, static_cast<off_t>(kCopyBufferBytes)));
    const ssize_t n = ::copy_file_range(from, &in, to, &out, want, 0);
    if (n > 0) continue;
    if (n == 0) return Status::Ok();  // the file shrank: what is left is copied as it is now
    if (errno == EINTR) continue;
    if (errno == EXDEV || errno == EINVAL || errno == ENOSYS || errno == EOPNOTSUPP) break;
    return Error::FromErrno(errno == ENOSPC || errno == EDQUOT ? dstPath : srcPath);
  }
  std::unique_ptr<char[]> buffer(new char[kCopyBufferBytes]);
  while (in < end) {
    const size_t want = static_cast<size_t>(std::min<off_t>(end - in, static_cast<off_t>(kCopyBufferBytes)));
    const ssize_t n = ::pread(from, buffer.get(), want, in);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return Error::FromErrno(srcPath);
    if (n == 0) return Status::Ok();
    if (Status s = WriteFullyAt(to, buffer.get(), static_cast<size_t>(n), in); !s.ok()) return Error(s.error().code(), dstPath);
    in += n;
  }
  return Status::Ok();
}

// Copies the first size bytes of from (its size when it was opened: the copy
// never reads past it, however the file grows) to to, keeping holes holes:
// only the data regions SEEK_DATA finds are copied, and the length is set
// at the end. A file system without SEEK_DATA is copied whole.
Status CopyData(int from, int to, off_t size, const std::string& srcPath, const std::string& dstPath) {
  off_t at = 0;
  while (at < size) {
    const off_t data = ::lseek(from, at, SEEK_DATA);
    if (data < 0 && errno == ENXIO) break;  // only a hole is left
    if (data < 0) {
      if (Status s = CopyRange(from, to, at, size, srcPath, dstPath); !s.ok()) return s;
      break;
    }
    if (data >= size) break;
    off_t hole = ::lseek(from, data, SEEK_HOLE);
    if (hole < 0 || hole > size) hole = size;
    if (Status s = CopyRange(from, to, data, hole, srcPath, dstPath); !s.ok()) return s;
    at = hole;
  }
  if (::ftruncate(to, size) != 0) return Error::FromErrno(dstPath);
  return Status::Ok();
}

Status ReplicateNode(const Node& src, const Node& dst, Replication mode, int depth, bool* created);

Status ReplicateDirectory(const Node& src, const Node& dst, Replication mode, int depth, bool* created) {
  if (depth >= kMaxTreeDepth) return Error(ELOOP, src.path);
  UniqueFd from(::openat(src.dir, src.name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!from) return Error::FromErrno(src.path);
  Result<struct statx> st = StatNode(from.get(), "", AT_EMPTY_PATH, src.path);
  if (!st.ok()) return st.error();
  // Closed to others until it is complete; the source's mode comes last.
  if (::mkdirat(dst.dir, dst.name.c_str(), 0700) != 0) return Error::FromErrno(dst.path);
  *created = true;
  UniqueFd to(::openat(dst.dir, dst.name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!to) return Error::FromErrno(dst.path);
  // The destination's parent may be writable by others: make sure the
  // directory opened is still the one just made, not one swapped in.
  Result<struct statx> made = StatNode(to.get(), "", AT_EMPTY_PATH, dst.path);
  if (!made.ok()) return made.error();
  if (made->stx_uid != ::geteuid() || (made->stx_mode & 077) != 0) {
    return Error(EAGAIN, dst.path + " was replaced while it was made");
  }
  Result<std::vector<std::string>> names = DirectoryEntryNames(from.get(), src.path);
  if (!names.ok()) return names.error();
  for (const std::string& name : *names) {
    const std::string srcPath = src.path + "/" + name;
    const std::string dstPath = dst.path + "/" + name;
    bool childCreated = false;
    Status s = ReplicateNode(Node{from.get(), name, srcPath}, Node{to.get(), name, dstPath}, mode, depth + 1,
                             &childCreated);
    if (!s.ok()) return s;
  }
  return CopyMetadata(from.get(), to.get(), *st, src.path, dst.path);
}

Status CopyFile(const Node& src, const Node& dst, bool* created) {
  // O_NONBLOCK: should a fifo have been swapped in, the open does not hang.
  UniqueFd from(::openat(src.dir, src.name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (!from) return Error::FromErrno(src.path);
  Result<struct statx> st = StatNode(from.get(), "", AT_EMPTY_PATH, src.path);
  if (!st.ok()) return st.error();
  if (!S_ISREG(st->stx_mode)) return Error(EAGAIN, src.path + " changed while it was copied");
  UniqueFd to(::openat(dst.dir, dst.name.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (!to) return Error::FromErrno(dst.path);
  *created = true;
  Status data = CopyData(from.get(), to.get(), static_cast<off_t>(st->stx_size), src.path, dst.path);
  if (!data.ok()) return data;
  return CopyMetadata(from.get(), to.get(), *st, src.path, dst.path);
}

Status RecreateSymbolicLink(const Node& src, const Node& dst, const struct statx& st, bool* created) {
  char target[PATH_MAX];
  const ssize_t n = ::readlinkat(src.dir, src.name.c_str(), target, sizeof target - 1);
  if (n < 0) return Error::FromErrno(src.path);
  target[n] = '\0';
  if (::symlinkat(target, dst.dir, dst.name.c_str()) != 0) return Error::FromErrno(dst.path);
  *created = true;
  return CopyMetadataAt(dst, st);
}

Status CopySpecialFile(const Node& dst, const struct statx& st, bool* created) {
  const dev_t device = ::makedev(st.stx_rdev_major, st.stx_rdev_minor);
  if (::mknodat(dst.dir, dst.name.c_str(), (st.stx_mode & S_IFMT) | 0600, device) != 0) {
    return Error::FromErrno(dst.path);
  }
  *created = true;
  Status metadata = CopyMetadataAt(dst, st);
  if (!metadata.ok()) return metadata;
  return ChangeModeAt(dst.dir, dst.name, st.stx_mode & 07777, dst.path);
}

Status ReplicateNode(const Node& src, const Node& dst, Replication mode, int depth, bool* created) {
  Result<struct statx> st = StatNode(src.dir, src.name.c_str(), 0, src.path);
  if (!st.ok()) return st.error();
  if (S_ISDIR(st->stx_mode)) return ReplicateDirectory(src, dst, mode, depth, created);
  if (S_ISLNK(st->stx_mode)) return RecreateSymbolicLink(src, dst, *st, created);
  if (mode == Replication::kHardLink) {
    if (::linkat(src.dir, src.name.c_str(), dst.dir, dst.name.c_str(), 0) != 0) return Error::FromErrno(dst.path);
    *created = true;
    return Status::Ok();
  }
  if (S_ISREG(st->stx_mode)) return CopyFile(src, dst, created);
  return CopySpecialFile(dst, *st, created);
}

Result<uint64_t> AllocatedBytes(int dir, const std::string& name, const std::string& path, int depth) {
  Result<struct statx> st = StatNode(dir, name.c_str(), 0, path);
  if (!st.ok()) return st.error();
  uint64_t total = st->stx_blocks * 512;
  if (!S_ISDIR(st->stx_mode)) return total;
  if (depth >= kMaxTreeDepth) return Error(ELOOP, path);
  UniqueFd fd(::openat(dir, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return Error::FromErrno(path);
  Result<std::vector<std::string>> names = DirectoryEntryNames(fd.get(), path);
  if (!names.ok()) return names.error();
  for (const std::string& child : *names) {
    Result<uint64_t> bytes = AllocatedBytes(fd.get(), child, path + "/" + child, depth + 1);
    if (!bytes.ok()) return bytes;
    total += *bytes;
  }
  return total;
}

}  // namespace

Result<uint64_t> AllocatedBytesOfTree(int dirFd, const std::string& name, const std::string& pathForErrors) {
  return AllocatedBytes(dirFd, name, pathForErrors, 0);
}

Result<ParentAndName> OpenParent(const std::string& path) {
  std::string trimmed = path;
  while (trimmed.size() > 1 && trimmed.back() == '/') trimmed.pop_back();
  PathParts parts = SplitLastComponent(trimmed);
  if (parts.name.empty() || parts.name == "." || parts.name == ".." || trimmed == "/") return Error(EINVAL, path);
  UniqueFd parent(::open(parts.parent.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!parent) return Error::FromErrno(parts.parent);
  return ParentAndName{std::move(parent), std::move(parts.name)};
}

Result<std::vector<std::string>> DirectoryEntryNames(int dirFd, const std::string& pathForErrors) {
  Result<std::vector<DirectoryEntry>> entries = ReadDirectory(dirFd, pathForErrors);
  if (!entries.ok()) return entries.error();
  std::vector<std::string> names;
  names.reserve(entries->size());
  for (DirectoryEntry& entry : *entries) names.push_back(std::move(entry.name));
  return names;
}

Status ChangeModeAt(int dirFd, const std::string& name, mode_t mode, const std::string& pathForErrors) {
  if (::syscall(SYS_fchmodat2, dirFd, name.c_str(), mode, AT_SYMLINK_NOFOLLOW) == 0) return Status::Ok();
  if (errno != ENOSYS) return Error::FromErrno(pathForErrors);
  if (::fchmodat(dirFd, name.c_str(), mode, AT_SYMLINK_NOFOLLOW) == 0) return Status::Ok();
  return Error::FromErrno(pathForErrors);
}

ssize_t ListExtendedAttributesAt(int dirFd, const std::string& name, char* list, size_t size,
                                 const std::string* fallbackPath) {
  if (!xattrAtMissing.load(std::memory_order_relaxed)) {
    const long n = ::syscall(SYS_listxattrat, dirFd, name.c_str(), AT_SYMLINK_NOFOLLOW, list, size);
    if (n >= 0 || errno != ENOSYS) return n;
    xattrAtMissing.store(true, std::memory_order_relaxed);
  }
  if (fallbackPath == nullptr) {
    errno = ENOSYS;
    return -1;
  }
  return ::llistxattr(fallbackPath->c_str(), list, size);
}

ssize_t GetExtendedAttributeAt(int dirFd, const std::string& name, const std::string& key, void* value,
                               size_t size, const std::string* fallbackPath) {
  if (!xattrAtMissing.load(std::memory_order_relaxed)) {
    // The kernel takes the size as 32 bits; values are bounded far below.
    XattrArgs args{reinterpret_cast<uintptr_t>(value), static_cast<uint32_t>(std::min<size_t>(size, UINT32_MAX)), 0};
    const long n = ::syscall(SYS_getxattrat, dirFd, name.c_str(), AT_SYMLINK_NOFOLLOW, key.c_str(), &args,
                             sizeof args);
    if (n >= 0 || errno != ENOSYS) return n;
    xattrAtMissing.store(true, std::memory_order_relaxed);
  }
  if (fallbackPath == nullptr) {
    errno = ENOSYS;
    return -1;
  }
  return ::lgetxattr(fallbackPath->c_str(), key.c_str(), value, size);
}

int SetExtendedAttributeOfLink(int linkFd, int dirFd, const std::string& name, const std::string& key,
                               const void* value, size_t size) {
  // The descriptor's /proc entry leads to the link opened and stops there
  // (setxattrat takes no O_PATH descriptor, and kernels before 6.13 lack
  // it): the attribute lands on that inode on every kernel.
  const std::string throughDescriptor = "/proc/self/fd/" + std::to_string(linkFd);
  const int set = ::setxattr(throughDescriptor.c_str(), key.c_str(), value, size, 0);
  if (set == 0 || errno != ENOENT) return set;
  // No /proc (a chroot without it): the entry by name, not followed.
  if (size > UINT32_MAX || xattrAtMissing.load(std::memory_order_relaxed)) {
    errno = size > UINT32_MAX ? E2BIG : ENOSYS;
    return -1;
  }
  XattrArgs args{reinterpret_cast<uintptr_t>(value), static_cast<uint32_t>(size), 0};
  const long n =
      ::syscall(SYS_setxattrat, dirFd, name.c_str(), AT_SYMLINK_NOFOLLOW, key.c_str(), &args, sizeof args);
  if (n < 0 && errno == ENOSYS) xattrAtMissing.store(true, std::memory_order_relaxed);
  return static_cast<int>(n);
}

Status ReplicateItem(int srcDir, const std::string& srcName, int dstDir, const std::string& dstName,
                     Replication mode, const std::string& srcPath, const std::string& dstPath) {
  bool created = false;
  Status s = ReplicateNode(Node{srcDir, srcName, srcPath}, Node{dstDir, dstName, dstPath}, mode, 0, &created);
  if (!s.ok() && created) (void)RemoveItemAt(dstDir, dstName, dstPath);
  return s;
}

}  // namespace vtr
