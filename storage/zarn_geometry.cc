#include "storage/zarn_geometry.h"

#include <bit>

#include "storage/zarn_diagnostics.h"

namespace vtr {

int zarnInitMediaGeometry(ZarnMediaProperties* props, uint64_t mediaSize, uint32_t blockSize) {
  if (props == nullptr) {
    ZarnPrint("zarn: NULL media properties\n");
    return -1;
  }
  props->mediaSize = mediaSize;
  props->blockSize = blockSize;
  if (mediaSize > kZarnMaxMediaSize) {
    ZarnPrint("zarn: media too large\n");
    return -1;
  }
  if (blockSize < kZarnMinBlockSize) {
    ZarnPrint("zarn: media block size too small\n");
    return -1;
  }
  if (blockSize > kZarnMaxBlockSize) {
    ZarnPrint("zarn: media block size too large\n");
    return -1;
  }
  props->blockShift = 31 - static_cast<uint32_t>(std::countl_zero(blockSize));
  // The smallest power of two for which 1024 chunks cover the medium. The
  // value is taken in 32 bits as the volume manager does (an empty medium
  // therefore gets 4 GiB chunks and no chunk at all).
  const auto scaled = static_cast<uint32_t>((mediaSize - 1) >> 10);
  props->chunkShift = 32 - static_cast<uint32_t>(std::countl_zero(scaled));
  props->chunkSize = uint64_t{1} << props->chunkShift;
  if (props->chunkSize < blockSize) ZarnPrint("zarn: media too small\n");
  props->chunkCount = static_cast<uint32_t>(mediaSize >> props->chunkShift);
  props->usableSize = uint64_t{props->chunkCount - 8} << props->chunkShift;
  return 0;
}

}  // namespace vtr
