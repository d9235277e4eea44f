#include "platform/read_fully.h"

#include <unistd.h>

namespace vtr {

Result<std::string> ReadFully(int fd, size_t limit) {
  std::string text;
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
