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
// failure prints why on standard error (the library's message when the
// geometry is refused), sets *exitStatus (the file cannot be opened, or it is
// not a medium the library takes) and returns nothing.
std::optional<ZarnImage> OpenZarnImage(const std::string& path, bool writable, uint32_t imageBlockSize,
                                       int* exitStatus);

// Reads a valid header copy (main, then backup) into header; false after the
// library's messages.
bool AcquireHeader(const ZarnImage& image, ZarnHeaderBuffer* header);

// Whether the main copy's place holds a Zarn header of a known type, valid
// or with a wrong CRC (no messages: create asks before it overwrites).
bool HasHeaderCopy(const ZarnImage& image);

// Writes header, padded to a block with zeros, as the main copy at byte 0 and
// the backup copy in the last block of chunk 0, and syncs the medium. False
// after a message on standard error.
bool WriteHeaderCopies(const ZarnImage& image, const ZarnHeaderBuffer& header);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_ZARN_IMAGE_H_
