#include "platform/item_io.h"

#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

namespace vtr {

UniqueFd OpenAt(int dirFd, const std::string& name, int flags, mode_t mode) {
  return UniqueFd(::openat(dirFd, name.c_str(), flags, mode));
}

UniqueFd OpenForReadingQuietly(int dirFd, const std::string& name) {
  UniqueFd fd(::openat(dirFd, name.c_str(), kReadItemFlags | O_NOATIME));
  if (!fd && errno == EPERM) fd.reset(::openat(dirFd, name.c_str(), kReadItemFlags));
  return fd;
}

bool StatAt(int dirFd, const std::string& name, struct stat* st) {
  return ::fstatat(dirFd, name.c_str(), st, AT_SYMLINK_NOFOLLOW) == 0;
}

bool StatOf(int fd, struct stat* st) { return ::fstat(fd, st) == 0; }

bool ReadOnce(int fd, uint64_t size, std::span<uint8_t> buffer,
              const std::function<bool(std::span<const uint8_t>)>& consume, PageCache cache) {
  const bool drop = cache == PageCache::kDropBehind;
  if (drop) ::posix_fadvise(fd, 0, 0, POSIX_FADV_SEQUENTIAL);
  uint64_t offset = 0;
  while (offset < size) {
    const size_t want = static_cast<size_t>(std::min<uint64_t>(size - offset, buffer.size()));
    const ssize_t n = ::pread(fd, buffer.data(), want, static_cast<off_t>(offset));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return false;
    if (n == 0) return true;
    if (!consume(buffer.first(static_cast<size_t>(n)))) return false;
    if (drop) ::posix_fadvise(fd, static_cast<off_t>(offset), n, POSIX_FADV_DONTNEED);
    offset += static_cast<uint64_t>(n);
  }
  return true;
}

bool WriteAllAt(int fd, std::span<const uint8_t> bytes, uint64_t offset) {
  while (!bytes.empty()) {
    const ssize_t n = ::pwrite(fd, bytes.data(), bytes.size(), static_cast<off_t>(offset));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return false;
    if (n == 0) {
      errno = EIO;
      return false;
    }
    bytes = bytes.subspan(static_cast<size_t>(n));
    offset += static_cast<uint64_t>(n);
  }
  return true;
}

ssize_t ListExtendedAttributesOf(int fd, char* list, size_t size) { return ::flistxattr(fd, list, size); }

ssize_t GetExtendedAttributeOf(int fd, const std::string& key, void* value, size_t size) {
  return ::fgetxattr(fd, key.c_str(), value, size);
}

bool ProbeWritable(int folderFd, const char* name) {
  UniqueFd fd(::openat(folderFd, name, O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC, 0644));
  if (!fd) return false;
  const bool written = ::write(fd.get(), "a", 1) == 1;
  fd.reset();
  ::unlinkat(folderFd, name, 0);
  return written;
}

int SetExtendedAttributeOf(int fd, const std::string& key, const void* value, size_t size) {
  return ::fsetxattr(fd, key.c_str(), value, size, 0);
}

int RemoveExtendedAttributeOf(int fd, const std::string& key) { return ::fremovexattr(fd, key.c_str()); }

int SetExtendedAttributeOfPath(const std::string& path, const std::string& key, const void* value, size_t size) {
  return ::lsetxattr(path.c_str(), key.c_str(), value, size, 0);
}

UniqueFd OpenLinkItself(int dirFd, const std::string& name) {
  return UniqueFd(::openat(dirFd, name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
}

bool ChangeOwnerOfLink(int linkFd, uid_t uid, gid_t gid) {
  return ::fchownat(linkFd, "", uid, gid, AT_EMPTY_PATH | AT_SYMLINK_NOFOLLOW) == 0;
}

uid_t ThisUser() { return ::geteuid(); }

}  // namespace vtr
