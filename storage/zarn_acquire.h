// Reading the Zarn header of a medium: the main copy at byte 0, and when that
// is unreadable or invalid, the backup copy in the last block of chunk 0.
#ifndef VTR_STORAGE_ZARN_ACQUIRE_H_
#define VTR_STORAGE_ZARN_ACQUIRE_H_

#include <cstdint>

#include "platform/block_geometry.h"
#include "storage/zarn_geometry.h"
#include "storage/zarn_medium.h"

namespace vtr {

// Reads a valid header copy from the medium into header (4096 bytes). props
// must already hold the medium's geometry; the copies are read in the
// medium's own blocks. Returns 0 when a copy validates (the backup is then
// not read). Otherwise -1 with messages on standard error: the block size or
// count cannot be had, a copy cannot be read whole, and a final verdict (a
// corrupt copy seen; else a copy of unknown kind read; else nothing read).
// header then holds the last copy read. The medium is only read.
int zarnAcquireHeader(const ZarnMedium& medium, const ZarnMediaProperties* props, uint8_t* header);

// The same for the medium open as fd: a block device, or a regular file
// holding a disk image read in blocks of imageBlockSize. Any other kind of
// descriptor fails with "zarn: block size acquisition error".
int zarnAcquireHeader(int fd, const ZarnMediaProperties* props, uint8_t* header,
                      uint32_t imageBlockSize = kDefaultImageBlockSize);

}  // namespace vtr

#endif  // VTR_STORAGE_ZARN_ACQUIRE_H_
