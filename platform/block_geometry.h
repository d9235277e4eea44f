// The block geometry of an open medium: a block device (its logical block
// size and its size), or a regular file holding a disk image, which has no
// blocks of its own and is read in blocks of a size the caller chooses.
// Stateless; safe from any thread.
#ifndef VTR_PLATFORM_BLOCK_GEOMETRY_H_
#define VTR_PLATFORM_BLOCK_GEOMETRY_H_

#include <cstdint>

#include "platform/result.h"

namespace vtr {

// Block size given to a disk image when the caller names none.
inline constexpr uint32_t kDefaultImageBlockSize = 4096;
// Largest block size accepted for an image: callers allocate a block.
inline constexpr uint32_t kMaxImageBlockSize = 1 << 20;

// Block size of the medium open as fd: BLKSSZGET for a block device,
// imageBlockSize for a regular file (EINVAL when it is 0 or above
// kMaxImageBlockSize). Any other kind of descriptor fails with ENOTTY, as the
// block-device request itself would.
Result<uint32_t> BlockSizeOf(int fd, uint32_t imageBlockSize = kDefaultImageBlockSize);

// Number of whole blocks of BlockSizeOf(fd, imageBlockSize) on the medium:
// BLKGETSIZE64 for a block device, the file's size for a regular file (a
// partial last block is not counted). Fails as BlockSizeOf does.
Result<uint64_t> BlockCountOf(int fd, uint32_t imageBlockSize = kDefaultImageBlockSize);

}  // namespace vtr

#endif  // VTR_PLATFORM_BLOCK_GEOMETRY_H_
