#include "platform/read_fully.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>

#include "platform/unique_fd.h"

namespace vtr {

Result<std::string> ReadFully(int fd, size_t limit) {
  std::string text;
  // The rest of a regular file fits in one allocation made up front (a byte
  // more, to see the end), so a large file never costs twice its size in a
  // buffer being regrown.
  struct stat st;
  const off_t offset = ::lseek(fd, 0, SEEK_CUR);
  if (::fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && offset >= 0 && st.st_size >= offset) {
    text.reserve(std::min(static_cast<size_t>(st.st_size - offset), limit) + 1);
  }
  char chunk[65536];
  for (;;) {
    const ssize_t n = ::read(fd, chunk, sizeof chunk);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return Error::FromErrno("read");
    if (n == 0) return text;
    if (text.size() + static_cast<size_t>(n) > limit) return Error(EFBIG, "more than the limit");
    text.append(chunk, static_cast<size_t>(n));
  }
}

Result<std::string> ReadRegularFile(int fd, size_t limit) {
  struct stat st;
  if (::fstat(fd, &st) != 0) return Error::FromErrno("fstat");
  if (!S_ISREG(st.st_mode)) return Error(EINVAL, "not a regular file");
  if (static_cast<uint64_t>(st.st_size) > limit) return Error(EFBIG, "more than the limit");
  std::string bytes(static_cast<size_t>(st.st_size), '\0');
  size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = ::pread(fd, bytes.data() + done, bytes.size() - done, static_cast<off_t>(done));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return Error::FromErrno("read");
    if (n == 0) break;
    done += static_cast<size_t>(n);
  }
  bytes.resize(done);
  return bytes;
}

Result<std::string> ReadFileNamed(const std::string& path, size_t limit) {
  if (path == "-") return ReadFully(STDIN_FILENO, limit);
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  if (!fd) return Error::FromErrno(path);
  struct stat st;
  if (::fstat(fd.get(), &st) != 0) return Error::FromErrno(path);
  if (!S_ISREG(st.st_mode) && !S_ISFIFO(st.st_mode)) return Error::Invalid(path + " is not a regular file");
  // Opened without blocking (a fifo nobody writes to would hang the open);
  // read blocking.
  ::fcntl(fd.get(), F_SETFL, ::fcntl(fd.get(), F_GETFL) & ~O_NONBLOCK);
  Result<std::string> bytes = ReadFully(fd.get(), limit);
  if (!bytes.ok()) return Error(bytes.error().code(), path + ": " + bytes.error().message());
  return bytes;
}

}  // namespace vtr
