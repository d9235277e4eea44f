#include "storage/zarn_chunk.h"

#include <gtest/gtest.h>

#include "tests/storage/zarn_test_support.h"

namespace vtr {
namespace {

using testing::FreshHeader;
using testing::Geometry;
using testing::Header;
using testing::kGiB;
using testing::kMiB;

constexpr int kMiss = -1;

int Lookup(const ZarnMediaProperties& props, const Header& h, uint32_t partition, uint64_t byte) {
  uint16_t chunk = 0xEEEE;
  const int result = zarnChunkContainingPartitionByte(&props, h.data(), partition, byte, &chunk);
  return result == 0 ? chunk : kMiss;
}

TEST(ZarnChunkTest, BytesOfAFreshPartition) {
  const ZarnMediaProperties props = Geometry(16 * kGiB);
  const Header h = FreshHeader(props);
  const uint64_t length = props.usableSize;
  const struct {
    uint32_t partition;
    uint64_t byte;
    int chunk;
  } cases[] = {
      {0, 0, 1},
      {0, 16 * kMiB - 1, 1},
      {0, 16 * kMiB, 2},
      {0, length - 1, 1016},
      {0, length, kMiss},        // at the end
      {0, ~uint64_t{0}, kMiss},  // begin + offset wraps below the end, but the chunk is beyond the count
      {1, 0, kMiss},             // an empty entry has no byte
      {8, 0, kMiss},             // beyond the table
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(::testing::Message() << "partition " << c.partition << " byte " << c.byte);
    EXPECT_EQ(Lookup(props, h, c.partition, c.byte), c.chunk);
  }
  uint16_t chunk = 0;
  EXPECT_EQ(zarnChunkContainingPartitionBlock(&props, h.data(), 0, 4096, &chunk), 0);  // 4096 blocks = 16 MiB
  EXPECT_EQ(chunk, 2);
  EXPECT_EQ(zarnChunkContainingPartitionBlock(&props, h.data(), 0, length / 4096, &chunk), -1);
  EXPECT_EQ(zarnChunkContainingPartitionByte(&props, h.data(), 0, 0, nullptr), -1);
}

TEST(ZarnChunkTest, ChunkCountBoundAndMasking) {
  // 512 chunks of 32 MiB. A partition claiming far more than the medium lets
  // the offset bound show: chunk 512 is admitted, 513 is not.
  const ZarnMediaProperties props = Geometry(16 * kGiB + 8 * kMiB);
  Header h = FreshHeader(props);
  ZarnHeaderEditor e(h);
  e.entry(0).setEnd(~uint64_t{0});
  e.setChunk(511, 512);
  e.setChunk(510, 513);
  const uint64_t chunk = props.chunkSize;
  EXPECT_EQ(Lookup(props, h, 0, 512 * chunk), 511);
  EXPECT_EQ(Lookup(props, h, 0, 513 * chunk), kMiss);
  // The bound looks at the low 16 bits of the chunk offset and the search at
  // the low 10: offset 65536 + 3 finds chunk 3.
  EXPECT_EQ(Lookup(props, h, 0, (65536 + 3) * chunk), 4);
  // The first matching slot wins.
  e.setChunk(509, 2);
  EXPECT_EQ(Lookup(props, h, 0, 2 * chunk), 3);
  e.setChunk(1, kZarnChunkFree);
  EXPECT_EQ(Lookup(props, h, 0, 0), kMiss);
}

}  // namespace
}  // namespace vtr
