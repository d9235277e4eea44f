// Helpers for the volume-manager tests: geometry and fresh headers, capture
// of the library's standard-error messages, and media in memory or on disk.
#ifndef VTR_TESTS_STORAGE_ZARN_TEST_SUPPORT_H_
#define VTR_TESTS_STORAGE_ZARN_TEST_SUPPORT_H_

#include <gtest/gtest.h>

#include <array>
#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include "storage/zarn_geometry.h"
#include "storage/zarn_layout.h"
#include "storage/zarn_medium.h"

namespace vtr::testing {

using Header = std::array<uint8_t, kZarnHeaderSize>;

inline constexpr uint64_t kGiB = uint64_t{1} << 30;
inline constexpr uint64_t kMiB = uint64_t{1} << 20;

// What body writes to standard error.
std::string StderrOf(const std::function<void()>& body);

// Geometry of a medium (which must be accepted).
ZarnMediaProperties Geometry(uint64_t mediaSize, uint32_t blockSize = 4096);

// A fresh header for props, CRC stamped.
Header FreshHeader(const ZarnMediaProperties& props);

// Lowest byte a partition may start at for props' block size.
inline uint64_t Floor(const ZarnMediaProperties& props) { return 2 * uint64_t{props.blockSize} + 16384; }

// A medium in memory: each readable offset maps to the bytes a read there
// returns (a shorter vector gives a short read); reads elsewhere fail. It
// records the offsets read.
class FakeMedium final : public ZarnMedium {
 public:
  Result<uint32_t> blockSizeResult = uint32_t{4096};
  Result<uint64_t> blockCountResult = uint64_t{4 * kGiB / 4096};
  std::map<uint64_t, std::vector<uint8_t>> blocks;
  mutable std::vector<uint64_t> reads;

  Result<uint32_t> blockSize() const override { return blockSizeResult; }
  Result<uint64_t> blockCount() const override { return blockCountResult; }
  ssize_t readAt(uint8_t* buffer, size_t length, uint64_t offset) const override;
};

// A block of blockSize bytes starting with header.
std::vector<uint8_t> BlockWith(const Header& header, uint32_t blockSize = 4096);

// Creates a sparse image file of size bytes at path holding header as the
// main copy (at 0) and, when backupOffset is not 0, as the backup copy too.
void WriteImage(const std::string& path, uint64_t size, const Header& main, uint64_t backupOffset,
                const Header& backup);

}  // namespace vtr::testing

#endif  // VTR_TESTS_STORAGE_ZARN_TEST_SUPPORT_H_
