// A disk image or block device opened by zarnutil, with its Zarn geometry,
// and the reading and writing of its two header copies.
#ifndef VTR_TOOLS_ZARNUTIL_ZARN_IMAGE_H_
#define VTR_TOOLS_ZARNUTIL_ZARN_IMAGE_H_

#include <array>
#include <cstdint>
#include <optional>
#include <string>

#include "platform/unique_fd.h"
#include "storage/zarn_geometry.h"
#include "storage/zarn_layout.h"

namespace vtr {

using ZarnHeaderBuffer = std::array<uint8_t, kZarnHeaderSize>;

struct ZarnImage {
  std::string path;
  UniqueFd fd;
  uint32_t imageBlockSize = 0;  // what a regular file is read in
  ZarnMediaProperties props;
};

// Opens path (for writing too when writable) and computes its geometry. On
// failure prints why on standard error, sets *exitStatus (kExitNoInput: the
// file cannot be opened; kExitBadInput: it is not a medium the library takes,
// or one too small for a header: empty, or with chunks no larger than a
// block, so that chunk 0 cannot hold two header copies) and returns nothing.
std::optional<ZarnImage> OpenZarnImage(const std::string& path, bool writable, uint32_t imageBlockSize,
                                       int* exitStatus);

// Reads a valid header copy (main, then backup) into header; false after the
// library's messages.
bool AcquireHeader(const ZarnImage& image, ZarnHeaderBuffer* header);

// Whether the main copy's place holds a Zarn header of a known type, valid
// or with a wrong CRC (no messages: create asks before it overwrites).
bool HasHeaderCopy(const ZarnImage& image);

// Where the backup copy lies: the last block of chunk 0.
uint64_t BackupHeaderOffset(const ZarnImage& image);

// Writes header, padded to a block with zeros, at offset (0 for the main copy,
// BackupHeaderOffset for the backup) and syncs the medium. Nothing is written
// past the medium's end, so a file never changes size. False after a message
// on standard error.
bool WriteHeaderCopy(const ZarnImage& image, const ZarnHeaderBuffer& header, uint64_t offset);

// WriteHeaderCopy of both copies, the main copy first.
bool WriteHeaderCopies(const ZarnImage& image, const ZarnHeaderBuffer& header);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_ZARN_IMAGE_H_
