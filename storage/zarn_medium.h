// The medium the Zarn library reads headers from: its block geometry and
// positioned reads. FdZarnMedium is the real one (a block device or a disk
// image open as a descriptor); tests give the library media that fail where
// they choose.
#ifndef VTR_STORAGE_ZARN_MEDIUM_H_
#define VTR_STORAGE_ZARN_MEDIUM_H_

#include <sys/types.h>

#include <cstddef>
#include <cstdint>

#include "platform/block_geometry.h"
#include "platform/result.h"

namespace vtr {

class ZarnMedium {
 public:
  virtual ~ZarnMedium() = default;
  // The medium's block size in bytes.
  virtual Result<uint32_t> blockSize() const = 0;
  // The number of whole blocks on the medium.
  virtual Result<uint64_t> blockCount() const = 0;
  // Reads up to length bytes at offset into buffer: the count read (short
  // at the end of the medium), or -1.
  virtual ssize_t readAt(uint8_t* buffer, size_t length, uint64_t offset) const = 0;
};

// The medium open as fd, which the caller keeps open while this is used: a
// block device, or a regular file holding a disk image read in blocks of
// imageBlockSize (see BlockSizeOf). Reads retry on EINTR. Thread-safe.
class FdZarnMedium final : public ZarnMedium {
 public:
  explicit FdZarnMedium(int fd, uint32_t imageBlockSize = kDefaultImageBlockSize)
      : fd_(fd), imageBlockSize_(imageBlockSize) {}

  Result<uint32_t> blockSize() const override { return BlockSizeOf(fd_, imageBlockSize_); }
  Result<uint64_t> blockCount() const override { return BlockCountOf(fd_, imageBlockSize_); }
  ssize_t readAt(uint8_t* buffer, size_t length, uint64_t offset) const override;

 private:
  int fd_;
  uint32_t imageBlockSize_;
};

}  // namespace vtr

#endif  // VTR_STORAGE_ZARN_MEDIUM_H_
