#include "platform/output_stream.h"

#include <unistd.h>

#include <cstring>

namespace vtr {

Status WriteFully(int fd, const void* bytes, size_t length) { return WriteFullyAt(fd, bytes, length, -1); }

Status WriteFullyAt(int fd, const void* bytes, size_t length, off_t offset) {
  const auto* p = static_cast<const uint8_t*>(bytes);
  while (length > 0) {
    const ssize_t n = offset < 0 ? ::write(fd, p, length) : ::pwrite(fd, p, length, offset);
    if (n < 0) {
      if (errno == EINTR) continue;
      return Error::FromErrno("write");
    }
    p += n;
    length -= static_cast<size_t>(n);
    if (offset >= 0) offset += n;
  }
  return Status::Ok();
}

FdOutputStream::FdOutputStream(int fd, size_t bufferSize) : fd_(fd), buffer_(bufferSize) {}

Status FdOutputStream::write(const void* bytes, size_t length) {
  if (!failure_.ok()) return failure_;
  const auto* p = static_cast<const uint8_t*>(bytes);
  position_ += length;
  if (used_ + length <= buffer_.size()) {
    std::memcpy(buffer_.data() + used_, p, length);
    used_ += length;
    return Status::Ok();
  }
  if (Status s = flush(); !s.ok()) return s;
  if (length >= buffer_.size()) {
    failure_ = WriteFully(fd_, p, length);
    return failure_;
  }
  std::memcpy(buffer_.data(), p, length);
  used_ = length;
  return Status::Ok();
}

Status FdOutputStream::flush() {
  if (!failure_.ok()) return failure_;
  if (used_ > 0) {
    failure_ = WriteFully(fd_, buffer_.data(), used_);
    used_ = 0;
  }
  return failure_;
}

Status MemoryOutputStream::write(const void* bytes, size_t length) {
  const auto* p = static_cast<const uint8_t*>(bytes);
  bytes_.insert(bytes_.end(), p, p + length);
  return Status::Ok();
}

}  // namespace vtr
