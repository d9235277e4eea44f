// Byte sinks for writers that stream their output (property lists, copies):
// a buffered file descriptor and a growing memory buffer. Not thread-safe.
#ifndef VTR_PLATFORM_OUTPUT_STREAM_H_
#define VTR_PLATFORM_OUTPUT_STREAM_H_

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <vector>

#include "platform/result.h"

namespace vtr {

class OutputStream {
 public:
  virtual ~OutputStream() = default;
  // Appends length bytes. After a failure the stream stays failed and every
  // later call returns the first error.
  virtual Status write(const void* bytes, size_t length) = 0;
  // Bytes accepted so far (the offset the next byte will have).
  virtual uint64_t position() const = 0;
  // Pushes buffered bytes to the underlying sink.
  virtual Status flush() = 0;
};

// Writes to a file descriptor the caller keeps open, through a buffer.
class FdOutputStream final : public OutputStream {
 public:
  explicit FdOutputStream(int fd, size_t bufferSize = 1 << 20);
  ~FdOutputStream() override = default;
  FdOutputStream(const FdOutputStream&) = delete;
  FdOutputStream& operator=(const FdOutputStream&) = delete;

  Status write(const void* bytes, size_t length) override;
  uint64_t position() const override { return position_; }
  Status flush() override;

 private:
  int fd_;
  std::vector<uint8_t> buffer_;
  size_t used_ = 0;
  uint64_t position_ = 0;
  Status failure_;
};

// Collects the bytes in memory.
class MemoryOutputStream final : public OutputStream {
 public:
  Status write(const void* bytes, size_t length) override;
  uint64_t position() const override { return bytes_.size(); }
  Status flush() override { return Status::Ok(); }

  const std::vector<uint8_t>& bytes() const { return bytes_; }
  std::vector<uint8_t> take() { return std::move(bytes_); }

 private:
  std::vector<uint8_t> bytes_;
};

// Writes all of length bytes to fd, retrying short writes and EINTR.
Status WriteFully(int fd, const void* bytes, size_t length);
// The same at offset (pwrite), or at the file's offset when offset is -1.
Status WriteFullyAt(int fd, const void* bytes, size_t length, off_t offset);

}  // namespace vtr

#endif  // VTR_PLATFORM_OUTPUT_STREAM_H_
