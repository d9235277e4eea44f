// Online resizing of a mounted file system, by its type: btrfs shrinks and
// grows (BTRFS_IOC_RESIZE), ext4 (EXT4_IOC_RESIZE_FS) and xfs
// (XFS_IOC_FSGROWFSDATA) only grow while mounted; any other type cannot be
// resized here.
#ifndef VTR_STORAGE_FILE_SYSTEM_RESIZE_H_
#define VTR_STORAGE_FILE_SYSTEM_RESIZE_H_

#include <cstdint>
#include <string>

#include "platform/result.h"

namespace vtr {

// The type name of the file system mounted at mountPoint ("btrfs", "ext4",
// "xfs", or "other"), and the bytes it spans on its device (btrfs: the
// device's size as the file system uses it; ext4: the superblock's block
// count read from sourceDevice, or statfs's smaller count without it; xfs:
// its data blocks).
struct MountedFileSystem {
  std::string type;
  uint64_t bytes = 0;
};
Result<MountedFileSystem> DescribeMountedFileSystem(const std::string& mountPoint,
                                                   const std::string& sourceDevice = "");

// Makes the file system mounted at mountPoint newBytes long (rounded down
// to its block size). EOPNOTSUPP, with a message saying so, for a shrink
// the type cannot do while mounted and for a type that cannot be resized;
// the request's errno when the kernel refuses.
Status ResizeMountedFileSystem(const std::string& mountPoint, uint64_t newBytes);

}  // namespace vtr

#endif  // VTR_STORAGE_FILE_SYSTEM_RESIZE_H_
