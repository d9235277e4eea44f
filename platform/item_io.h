// How the model reaches the items of a tree and its own files: opening
// without following links, status, content read once, extended attributes of
// an open item, a writability probe. Each call is one system call (or two,
// for a fallback) that leaves errno as the kernel set it, so that callers
// keep their own messages and decisions.
#ifndef VTR_PLATFORM_ITEM_IO_H_
#define VTR_PLATFORM_ITEM_IO_H_

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <functional>
#include <span>
#include <string>

#include "platform/unique_fd.h"

namespace vtr {

// An item opened for reading: never through a link, never blocking on a
// fifo, never becoming the controlling terminal.
inline constexpr int kReadItemFlags = O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC;
// A directory opened to be listed or walked, not through a link.
inline constexpr int kDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

// openat(dirFd, name, flags, mode); dirFd AT_FDCWD opens a path. An invalid
// descriptor, errno set, on failure.
UniqueFd OpenAt(int dirFd, const std::string& name, int flags, mode_t mode = 0);

// Opens name for reading (kReadItemFlags) without updating its access time
// where the kernel allows it (to the owner or root), plainly otherwise:
// taking a manifest of a device should not rewrite every file's atime.
UniqueFd OpenForReadingQuietly(int dirFd, const std::string& name);

// The status of name in dirFd, a link described itself (dirFd AT_FDCWD: a
// path); false, errno set, when it cannot be had.
bool StatAt(int dirFd, const std::string& name, struct stat* st);
// The status of an open file; false, errno set, on failure.
bool StatOf(int fd, struct stat* st);

// What a read does with the pages it brought into the cache.
enum class PageCache {
  kDropBehind,  // a scan of a whole device does not evict what the device was doing
  kKeep,        // content about to be used (a restore's files)
};

// Reads the first size bytes of fd (fewer when it ends first) in pieces of
// buffer's size, handing each to consume, and with kDropBehind drops the
// pages read from the cache again. EINTR is retried. False on a read error
// or when consume returns false.
bool ReadOnce(int fd, uint64_t size, std::span<uint8_t> buffer,
              const std::function<bool(std::span<const uint8_t>)>& consume,
              PageCache cache = PageCache::kDropBehind);

// Writes all of bytes to fd at offset (pwrite, EINTR retried); false,
// errno set, on failure.
bool WriteAllAt(int fd, std::span<const uint8_t> bytes, uint64_t offset);

// flistxattr / fgetxattr of an open item.
ssize_t ListExtendedAttributesOf(int fd, char* list, size_t size);
ssize_t GetExtendedAttributeOf(int fd, const std::string& key, void* value, size_t size);

// fsetxattr of an open item, and lsetxattr of the item at path itself (a
// link is not followed); 0, or -1 with errno.
int SetExtendedAttributeOf(int fd, const std::string& key, const void* value, size_t size);
// fremovexattr of an open item; 0, or -1 with errno.
int RemoveExtendedAttributeOf(int fd, const std::string& key);
int SetExtendedAttributeOfPath(const std::string& path, const std::string& key, const void* value, size_t size);

// Opens the symbolic link name in dirFd itself (O_PATH, never followed),
// so that what is done to it stays on that link whatever is swapped in
// under its name; invalid, errno set, when it cannot be opened. The caller
// checks that it is a link (StatOf).
UniqueFd OpenLinkItself(int dirFd, const std::string& name);

// Gives the link open as linkFd (OpenLinkItself) to uid and gid; false,
// errno set, on failure.
bool ChangeOwnerOfLink(int linkFd, uid_t uid, gid_t gid);

// The effective user of this process, the owner of what it creates.
uid_t ThisUser();

// Whether a file name can be created and written in folder: writes one
// byte to it and removes it again.
bool ProbeWritable(int folderFd, const char* name);

}  // namespace vtr

#endif  // VTR_PLATFORM_ITEM_IO_H_
