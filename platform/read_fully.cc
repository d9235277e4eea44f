#include "platform/read_fully.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>

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

}  // namespace vtr
