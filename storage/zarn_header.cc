#include "storage/zarn_header.h"

#include <uuid/uuid.h>
#include <zlib.h>

#include <algorithm>

#include "storage/zarn_diagnostics.h"

namespace vtr {
namespace {

ZarnUuid FreshUuid() {
  ZarnUuid id;
  uuid_generate(id.data());
  return id;
}

// uuid_compare of the header's type with the CRC-protected kind; 0 when equal.
int CompareWithCrcKind(const uint8_t* header) {
  return uuid_compare(header + kZarnTypeOffset, kZarnTypeWithCrc.data());
}

}  // namespace

int zarnCreateHeaderWithFlags(const ZarnMediaProperties* props, uint8_t* header, uint64_t flags) {
  if (!ZarnArgumentsPresent(props, header)) return -1;
  std::fill_n(header, kZarnHeaderSize, uint8_t{0});
  ZarnHeaderEditor h(header);
  h.setType(kZarnTypeWithCrc);
  h.setMediaIdentity(FreshUuid());
  h.setMediaSize(props->mediaSize);
  h.setFlags(flags);
  h.setChunk(0, kZarnChunkReserved);
  h.setPartitionCount(1);

  ZarnEntryEditor partition = h.entry(0);
  const uint64_t begin = 2 * uint64_t{props->blockSize} + 16384;
  partition.setType(kZarnHfsPlusType);
  partition.setIdentity(FreshUuid());
  partition.setBegin(begin);
  partition.setEnd(begin + props->usableSize);
  partition.setAsciiName("Zarn");

  // Partition 0 takes the chunks right after chunk 0, in order; the rest of
  // the medium is free.
  const uint64_t needed = (props->usableSize + props->chunkSize - 1) >> props->chunkShift;
  const uint32_t chunks = std::min(props->chunkCount, kZarnChunkMapSlots);
  for (uint32_t s = 1; s < chunks; ++s) {
    h.setChunk(s, s <= needed ? static_cast<uint16_t>(s - 1) : kZarnChunkFree);
  }
  // Slots beyond the medium; for a medium of 0 or 1 chunk this overwrites
  // slot 0 too, as the volume manager does.
  for (uint32_t s = props->chunkCount; s < kZarnChunkMapSlots; ++s) h.setChunk(s, kZarnChunkInvalid);
  return 0;
}

int zarnCreateHeader(const ZarnMediaProperties* props, uint8_t* header) {
  return zarnCreateHeaderWithFlags(props, header, 0);
}

int zarnSetHeaderCRC(uint8_t* header) {
  if (int difference = CompareWithCrcKind(header); difference != 0) return difference;
  ZarnHeaderEditor h(header);
  h.setCrc(0);
  const auto crc = static_cast<uint32_t>(crc32(0, header, kZarnHeaderSize));
  h.setCrc(crc);
  return static_cast<int>(crc);
}

int zarnValidateHeader(uint8_t* header) {
  ZarnHeaderView h(header);
  if (h.hasType(kZarnTypeWithCrc)) {
    const uint32_t stored = h.crc();
    return static_cast<uint32_t>(zarnSetHeaderCRC(header)) == stored ? 0 : -1;
  }
  if (h.hasType(kZarnTypeWithoutCrc)) return 0;
  return -2;
}

}  // namespace vtr
