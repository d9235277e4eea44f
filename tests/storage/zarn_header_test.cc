#include "storage/zarn_header.h"

#include <gtest/gtest.h>

#include <algorithm>

#include "platform/little_endian.h"
#include "storage/zarn_check.h"
#include "tests/storage/zarn_test_support.h"

namespace vtr {
namespace {

using testing::Floor;
using testing::FreshHeader;
using testing::Geometry;
using testing::Header;
using testing::kGiB;
using testing::kMiB;
using testing::StderrOf;

bool AllZero(const Header& h, size_t from, size_t to) {
  return std::all_of(h.begin() + from, h.begin() + to, [](uint8_t b) { return b == 0; });
}

TEST(ZarnHeaderTest, FreshHeaderBytesOnA16GiBMedium) {
  const ZarnMediaProperties props = Geometry(16 * kGiB);
  Header h{};
  ASSERT_EQ(zarnCreateHeaderWithFlags(&props, h.data(), 0x8000000000000001), 0);

  EXPECT_TRUE(std::equal(kZarnTypeWithCrc.begin(), kZarnTypeWithCrc.end(), h.begin()));
  EXPECT_FALSE(AllZero(h, 16, 32));  // media identity
  EXPECT_EQ(LoadU64(&h[32]), 16 * kGiB);
  EXPECT_EQ(LoadU32(&h[40]), 1u);
  EXPECT_EQ(LoadU32(&h[44]), 0u);  // the CRC is left to zarnSetHeaderCRC
  EXPECT_EQ(LoadU64(&h[48]), 0x8000000000000001u);
  EXPECT_TRUE(AllZero(h, 56, 512));

  const uint8_t* entry = &h[512];
  EXPECT_TRUE(std::equal(kZarnHfsPlusType.begin(), kZarnHfsPlusType.end(), entry));
  EXPECT_FALSE(std::all_of(entry + 16, entry + 32, [](uint8_t b) { return b == 0; }));
  EXPECT_FALSE(std::equal(entry + 16, entry + 32, &h[16]));  // its own identity
  EXPECT_EQ(LoadU64(entry + 32), 24576u);
  EXPECT_EQ(LoadU64(entry + 40), 24576u + (uint64_t{1016} << 24));
  EXPECT_EQ(LoadU64(entry + 48), 0u);
  const uint8_t name[] = {'Z', 0, 'a', 0, 'r', 0, 'n', 0};
  EXPECT_TRUE(std::equal(std::begin(name), std::end(name), entry + 56));
  EXPECT_TRUE(AllZero(h, 512 + 56 + 8, 2048));  // rest of the name, entries 1..7, gap

  EXPECT_EQ(LoadU16(&h[2048]), 0xF000);
  for (uint32_t s = 1; s < 1024; ++s) {
    EXPECT_EQ(LoadU16(&h[2048 + 2 * s]), s <= 1016 ? s - 1 : 0xF111) << "slot " << s;
  }
}

TEST(ZarnHeaderTest, FreshHeadersPassTheCheck) {
  struct Medium {
    uint64_t size;
    uint32_t blockSize;
  };
  const Medium media[] = {{16 * kGiB, 4096},        {16 * kGiB, 16384},       {uint64_t{1} << 42, 4096},
                          {16 * kGiB + 8 * kMiB, 4096}, {600 * kMiB, 4096},   {64 * kMiB, 12288}};
  for (const Medium& m : media) {
    SCOPED_TRACE(::testing::Message() << "media " << m.size << " block " << m.blockSize);
    const ZarnMediaProperties props = Geometry(m.size, m.blockSize);
    const Header h = FreshHeader(props);
    // The partition ends exactly at usable size + floor, which is allowed.
    EXPECT_EQ(ZarnHeaderView(h).entry(0).end(), props.usableSize + Floor(props));
    EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnCheckHeader(&props, h.data()), 0); }), "");
    // Slots beyond a medium of fewer than 1024 chunks are invalid.
    for (uint32_t s = props.chunkCount; s < 1024; ++s) EXPECT_EQ(ZarnHeaderView(h).chunk(s), 0xF3FF);
  }
}

TEST(ZarnHeaderTest, MediaOfAtMostOneChunk) {
  // An empty medium has no chunk: slot 0 is overwritten with the invalid
  // mark and partition 0 has no chunk to stand on.
  const ZarnMediaProperties empty = Geometry(0);
  const Header h = FreshHeader(empty);
  EXPECT_EQ(ZarnHeaderView(h).chunk(0), 0xF3FF);
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnCheckHeader(&empty, h.data()), -1); }),
            "zarn: partition 0 missing chunk 0x0000\n");
}

TEST(ZarnHeaderTest, NullArgumentsAreRefused) {
  const ZarnMediaProperties props = Geometry(16 * kGiB);
  Header h{};
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnCreateHeader(nullptr, h.data()), -1); }), "zarn: NULL media properties\n");
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnCreateHeader(&props, nullptr), -1); }), "zarn: NULL header buffer\n");
}

TEST(ZarnHeaderTest, CrcOfAKnownHeader) {
  // Reference values from an independent crc32 (Python's zlib) over the same bytes.
  Header h{};
  std::copy(kZarnTypeWithCrc.begin(), kZarnTypeWithCrc.end(), h.begin());
  h[44] = 0xAA;  // whatever the field holds, it counts as zero
  EXPECT_EQ(static_cast<uint32_t>(zarnSetHeaderCRC(h.data())), 0x906324c1u);
  EXPECT_EQ(LoadU32(&h[44]), 0x906324c1u);
  StoreU64(&h[32], uint64_t{1} << 34);
  StoreU32(&h[40], 1);
  EXPECT_EQ(static_cast<uint32_t>(zarnSetHeaderCRC(h.data())), 0xbab86155u);
}

TEST(ZarnHeaderTest, ValidationOfBothKinds) {
  const ZarnMediaProperties props = Geometry(16 * kGiB);
  const Header fresh = FreshHeader(props);
  Header h = fresh;
  EXPECT_EQ(zarnValidateHeader(h.data()), 0);

  // Any changed byte, the CRC field included, is a mismatch; the failed
  // validation leaves the recomputed CRC behind, so a second one passes.
  for (size_t offset : {20, 44, 47, 600, 2048, 4095}) {
    SCOPED_TRACE(offset);
    h = fresh;
    h[offset] ^= 0x01;
    EXPECT_EQ(zarnValidateHeader(h.data()), -1);
    EXPECT_EQ(zarnValidateHeader(h.data()), 0);
  }

  // A header without CRC validates whatever its CRC field holds, and
  // zarnSetHeaderCRC leaves it alone.
  h = fresh;
  std::copy(kZarnTypeWithoutCrc.begin(), kZarnTypeWithoutCrc.end(), h.begin());
  StoreU32(&h[44], 0xDEADBEEF);
  const Header withoutCrc = h;
  EXPECT_NE(zarnSetHeaderCRC(h.data()), 0);
  EXPECT_EQ(h, withoutCrc);
  EXPECT_EQ(zarnValidateHeader(h.data()), 0);

  // Any other identifier is unknown.
  h[0] ^= 0xFF;
  EXPECT_EQ(zarnValidateHeader(h.data()), -2);
  EXPECT_NE(zarnSetHeaderCRC(h.data()), 0);
}

}  // namespace
}  // namespace vtr
