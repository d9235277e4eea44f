#include "platform/directory_listing.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <cstring>
#include <memory>

#include "platform/unique_fd.h"

namespace vtr {
namespace {

constexpr size_t kListingBufferBytes = 64 * 1024;

bool IsDotOrDotDot(const char* name) {
  return name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'));
}

}  // namespace

Result<std::vector<DirectoryEntry>> ReadDirectory(int dirFd, const std::string& pathForErrors) {
  UniqueFd fd(::openat(dirFd, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!fd) return Error::FromErrno(pathForErrors);
  std::vector<DirectoryEntry> entries;
  std::unique_ptr<char[]> buffer(new char[kListingBufferBytes]);
  for (;;) {
    const ssize_t n = ::getdents64(fd.get(), buffer.get(), kListingBufferBytes);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return Error::FromErrno(pathForErrors);
    if (n == 0) break;
    // The kernel fills whole records; each one's length is still checked
    // against what it returned before the record is read.
    for (ssize_t offset = 0; offset < n;) {
      const auto* record = reinterpret_cast<const struct dirent64*>(buffer.get() + offset);
      const size_t headerBytes = offsetof(struct dirent64, d_name);
      if (static_cast<size_t>(n - offset) < headerBytes || record->d_reclen < headerBytes ||
          record->d_reclen > n - offset) {
        return Error(EIO, pathForErrors);
      }
      const size_t nameBytes = ::strnlen(record->d_name, record->d_reclen - headerBytes);
      if (nameBytes == record->d_reclen - headerBytes) return Error(EIO, pathForErrors);  // no terminator
      if (!IsDotOrDotDot(record->d_name)) {
        entries.push_back(DirectoryEntry{std::string(record->d_name, nameBytes), record->d_type});
      }
      offset += record->d_reclen;
    }
  }
  std::sort(entries.begin(), entries.end(),
            [](const DirectoryEntry& a, const DirectoryEntry& b) { return a.name < b.name; });
  return entries;
}

}  // namespace vtr
