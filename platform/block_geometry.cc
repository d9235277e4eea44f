#include "platform/block_geometry.h"

#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>

namespace vtr {
namespace {

enum class MediumKind { kBlockDevice, kImageFile };

Result<MediumKind> KindOf(int fd) {
  struct stat st;
  if (::fstat(fd, &st) != 0) return Error::FromErrno("fstat");
  if (S_ISBLK(st.st_mode)) return MediumKind::kBlockDevice;
  if (S_ISREG(st.st_mode)) return MediumKind::kImageFile;
  return Error(ENOTTY, "not a block device or disk image");
}

Status CheckImageBlockSize(uint32_t imageBlockSize) {
  if (imageBlockSize == 0 || imageBlockSize > kMaxImageBlockSize) {
    return Error(EINVAL, "image block size out of range");
  }
  return Status::Ok();
}

}  // namespace

Result<uint32_t> BlockSizeOf(int fd, uint32_t imageBlockSize) {
  Result<MediumKind> kind = KindOf(fd);
  if (!kind.ok()) return kind.error();
  if (*kind == MediumKind::kImageFile) {
    if (Status s = CheckImageBlockSize(imageBlockSize); !s.ok()) return s.error();
    return imageBlockSize;
  }
  int size = 0;
  if (::ioctl(fd, BLKSSZGET, &size) != 0) return Error::FromErrno("BLKSSZGET");
  if (size <= 0) return Error(EINVAL, "BLKSSZGET");
  return static_cast<uint32_t>(size);
}

Result<uint64_t> BlockCountOf(int fd, uint32_t imageBlockSize) {
  Result<uint32_t> blockSize = BlockSizeOf(fd, imageBlockSize);
  if (!blockSize.ok()) return blockSize.error();
  Result<MediumKind> kind = KindOf(fd);
  if (!kind.ok()) return kind.error();
  uint64_t bytes = 0;
  if (*kind == MediumKind::kImageFile) {
    struct stat st;
    if (::fstat(fd, &st) != 0) return Error::FromErrno("fstat");
    bytes = static_cast<uint64_t>(st.st_size);
  } else if (::ioctl(fd, BLKGETSIZE64, &bytes) != 0) {
    return Error::FromErrno("BLKGETSIZE64");
  }
  return bytes / *blockSize;
}

}  // namespace vtr
