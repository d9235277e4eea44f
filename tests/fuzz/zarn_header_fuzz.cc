// Feeds arbitrary 4096-byte headers to the volume-manager library: validate,
// check, repair (strict and lenient), chunk lookups and export. Nothing a
// header holds may make a function touch memory outside its buffers.
//
// Input: one control byte, eight bytes choosing the medium's size, then the
// header. Control bit 0 lays the header bytes over a fresh header (XOR) so
// that mutations stay near valid ones; bit 1 restamps the CRC so validation
// and export go past the CRC test; bits 2-3 choose the block size.
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <vector>

#include "platform/unique_fd.h"
#include "platform/little_endian.h"
#include "storage/zarn_check.h"
#include "storage/zarn_chunk.h"
#include "storage/zarn_export.h"
#include "storage/zarn_header.h"

namespace {

using vtr::kZarnHeaderSize;
using Header = std::array<uint8_t, kZarnHeaderSize>;

constexpr uint32_t kBlockSizes[] = {4096, 8192, 16384, 12288};

// The library prints a line per fault, which at fuzzing speed would flood
// the log. Only the library writes through the stderr stream: libFuzzer keeps
// its own copy of the original stream and the sanitizers write to the
// descriptor, so their reports still come through.
void SilenceLibraryMessages() {
  FILE* devNull = std::fopen("/dev/null", "w");
  if (devNull == nullptr) return;
  std::setvbuf(devNull, nullptr, _IOFBF, 1 << 16);
  stderr = devNull;
}

// The medium as a sparse in-memory file holding the header at byte 0.
int ExportFromMemoryFile(const Header& header, uint64_t mediaSize, uint32_t blockSize) {
  vtr::UniqueFd fd(::memfd_create("zarn_fuzz", MFD_CLOEXEC));
  if (!fd || ::ftruncate(fd.get(), static_cast<off_t>(mediaSize)) != 0) return -1;
  if (::pwrite(fd.get(), header.data(), header.size(), 0) != static_cast<ssize_t>(header.size())) return -1;
  std::array<uint8_t, 16> identity;
  std::vector<vtr::ZarnExportedPartition> list;
  const int result = vtr::Zarn_ExportMediaInfo(fd.get(), identity.data(), &list, blockSize);
  for (const vtr::ZarnExportedPartition& p : list) {
    if (p.extents.empty() || p.extents.size() > vtr::kZarnChunkMapSlots) __builtin_trap();
  }
  return result;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  SilenceLibraryMessages();
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 9) return 0;
  const uint8_t control = data[0];
  const uint32_t blockSize = kBlockSizes[(control >> 2) & 3];
  // Up to 2^42 + a little, so the refusal is reached too; at least a header.
  const uint64_t mediaSize = std::max<uint64_t>(vtr::LoadU64(data + 1) & ((uint64_t{1} << 43) - 1), 65536);
  data += 9;
  size -= 9;

  vtr::ZarnMediaProperties props;
  if (vtr::zarnInitMediaGeometry(&props, mediaSize, blockSize) != 0) return 0;

  Header header{};
  if (control & 1) vtr::zarnCreateHeader(&props, header.data());
  for (size_t i = 0; i < std::min(size, header.size()); ++i) header[i] ^= data[i];
  if (control & 2) vtr::zarnSetHeaderCRC(header.data());

  Header copy = header;
  vtr::zarnValidateHeader(copy.data());
  vtr::zarnCheckHeader(&props, header.data());
  for (int strict : {0, 1}) {
    copy = header;
    vtr::zarnRepairHeader(&props, copy.data(), strict);
    // A repaired header goes through the check and a second repair too.
    vtr::zarnCheckHeader(&props, copy.data());
    vtr::zarnRepairHeader(&props, copy.data(), 0);
  }
  for (uint32_t partition : {0u, 1u, 7u, 8u}) {
    for (uint64_t offset : {uint64_t{0}, props.chunkSize, mediaSize - 1, ~uint64_t{0}}) {
      uint16_t chunk = 0;
      if (vtr::zarnChunkContainingPartitionByte(&props, header.data(), partition, offset, &chunk) == 0 &&
          chunk >= vtr::kZarnChunkMapSlots) {
        __builtin_trap();
      }
      vtr::zarnChunkContainingPartitionBlock(&props, header.data(), partition, offset, &chunk);
    }
  }
  ExportFromMemoryFile(header, mediaSize, blockSize);
  return 0;
}
