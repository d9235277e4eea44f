#include "storage/zarn_geometry.h"

#include <gtest/gtest.h>

#include "tests/storage/zarn_test_support.h"

namespace vtr {
namespace {

using testing::kGiB;
using testing::kMiB;
using testing::StderrOf;

struct GeometryCase {
  uint64_t mediaSize;
  uint32_t blockSize;
  int result;
  const char* message;
  // Expected when accepted:
  uint32_t chunkShift = 0;
  uint32_t chunkCount = 0;
  uint64_t usableSize = 0;
};

TEST(ZarnGeometryTest, LimitsMessagesAndChunking) {
  const uint64_t kMax = uint64_t{1} << 42;
  const GeometryCase cases[] = {
      {16 * kGiB, 4096, 0, "", 24, 1024, uint64_t{1016} << 24},
      {kMax, 4096, 0, "", 32, 1024, uint64_t{1016} << 32},
      {kMax + 1, 4096, -1, "zarn: media too large\n"},
      {kMax + 4096, 4096, -1, "zarn: media too large\n"},
      {kMax + 1, 100, -1, "zarn: media too large\n"},  // size is tested before the block size
      {16 * kGiB, 4095, -1, "zarn: media block size too small\n"},
      {16 * kGiB, 0, -1, "zarn: media block size too small\n"},
      {16 * kGiB, 16384, 0, "", 24, 1024, uint64_t{1016} << 24},
      {16 * kGiB, 16385, -1, "zarn: media block size too large\n"},
      {16 * kGiB, 6000, 0, "", 24, 1024, uint64_t{1016} << 24},  // need not be a power of two
      // Just above a power of two: chunks double and only about half are used.
      {16 * kGiB + 8 * kMiB, 4096, 0, "", 25, 512, uint64_t{504} << 25},
      {600 * kMiB, 4096, 0, "", 20, 600, uint64_t{592} << 20},
      // Chunks smaller than a block: a warning, and still success.
      {1 * kMiB, 4096, 0, "zarn: media too small\n", 10, 1024, uint64_t{1016} << 10},
      {4 * kMiB, 8192, 0, "zarn: media too small\n", 12, 1024, uint64_t{1016} << 12},
      // Fewer than 8 chunks: the 32-bit subtraction wraps, as the volume manager has it.
      {5, 4096, 0, "zarn: media too small\n", 0, 5, uint64_t{0xFFFFFFFD}},
      // An empty medium: 4 GiB chunks, none of them on the medium.
      {0, 4096, 0, "", 32, 0, uint64_t{0xFFFFFFF8} << 32},
  };
  for (const GeometryCase& c : cases) {
    SCOPED_TRACE(::testing::Message() << "media " << c.mediaSize << " block " << c.blockSize);
    ZarnMediaProperties props;
    int result = 0;
    EXPECT_EQ(StderrOf([&] { result = zarnInitMediaGeometry(&props, c.mediaSize, c.blockSize); }), c.message);
    EXPECT_EQ(result, c.result);
    // Both sizes are stored before the limits are applied.
    EXPECT_EQ(props.mediaSize, c.mediaSize);
    EXPECT_EQ(props.blockSize, c.blockSize);
    if (c.result != 0) continue;
    EXPECT_EQ(props.chunkShift, c.chunkShift);
    EXPECT_EQ(props.chunkSize, uint64_t{1} << c.chunkShift);
    EXPECT_EQ(props.chunkCount, c.chunkCount);
    EXPECT_EQ(props.usableSize, c.usableSize);
    EXPECT_EQ(uint64_t{1} << props.blockShift, c.blockSize == 6000 ? 4096u : c.blockSize);
  }
}

TEST(ZarnGeometryTest, NullPropertiesAreRefused) {
  int result = 0;
  EXPECT_EQ(StderrOf([&] { result = zarnInitMediaGeometry(nullptr, 16 * kGiB, 4096); }),
            "zarn: NULL media properties\n");
  EXPECT_EQ(result, -1);
}

}  // namespace
}  // namespace vtr
