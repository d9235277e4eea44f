#include "storage/zarn_acquire.h"

#include <algorithm>
#include <optional>
#include <vector>

#include "storage/zarn_diagnostics.h"
#include "storage/zarn_header.h"
#include "storage/zarn_layout.h"

namespace vtr {
namespace {

// Where the backup copy lies: the last block of chunk 0. A chunk smaller than
// a block has no such place, and the backup then reads as unreadable.
std::optional<uint64_t> BackupOffset(const ZarnMediaProperties& props) {
  if (props.chunkSize < props.blockSize) return std::nullopt;
  return props.chunkSize - props.blockSize;
}

}  // namespace

int zarnAcquireHeader(const ZarnMedium& medium, const ZarnMediaProperties* props, uint8_t* header) {
  Result<uint32_t> blockSize = medium.blockSize();
  if (!blockSize.ok()) {
    ZarnPrint("zarn: block size acquisition error\n");
    return -1;
  }
  if (!medium.blockCount().ok()) {
    ZarnPrint("zarn: block count acquisition error\n");
    return -1;
  }
  if (!ZarnArgumentsPresent(props, header)) return -1;
  // One device block; never smaller than a header, so that copying the
  // header out of a small block reads zeros rather than past the buffer.
  std::vector<uint8_t> block(std::max<size_t>(*blockSize, kZarnHeaderSize), 0);
  struct Copy {
    const char* name;
    std::optional<uint64_t> offset;
  };
  const Copy copies[] = {{"main", 0}, {"backup", BackupOffset(*props)}};

  bool sawCorrupt = false;
  bool sawHeader = false;
  for (const Copy& copy : copies) {
    if (!copy.offset || medium.readAt(block.data(), *blockSize, *copy.offset) != static_cast<ssize_t>(*blockSize)) {
      std::fprintf(stderr, "zarn: failed to read %s header\n", copy.name);
      continue;
    }
    std::copy_n(block.begin(), kZarnHeaderSize, header);
    const int validity = zarnValidateHeader(header);
    if (validity == 0) return 0;
    if (validity == -1) sawCorrupt = true;
    sawHeader = true;
  }
  if (sawCorrupt) {
    ZarnPrint("zarn: media header corrupt\n");
  } else if (sawHeader) {
    ZarnPrint("zarn: media header not found or not supported\n");
  } else {
    ZarnPrint("zarn: could not read media header\n");
  }
  return -1;
}

int zarnAcquireHeader(int fd, const ZarnMediaProperties* props, uint8_t* header, uint32_t imageBlockSize) {
  return zarnAcquireHeader(FdZarnMedium(fd, imageBlockSize), props, header);
}

}  // namespace vtr
