#include "storage/zarn_medium.h"

#include <unistd.h>

#include <cerrno>
#include <limits>

namespace vtr {

ssize_t FdZarnMedium::readAt(uint8_t* buffer, size_t length, uint64_t offset) const {
  if (offset > static_cast<uint64_t>(std::numeric_limits<off_t>::max())) return -1;
  ssize_t n;
  do {
    n = ::pread(fd_, buffer, length, static_cast<off_t>(offset));
  } while (n < 0 && errno == EINTR);
  return n;
}

}  // namespace vtr
