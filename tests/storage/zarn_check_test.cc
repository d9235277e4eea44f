#include <gtest/gtest.h>

#include <functional>

#include "storage/zarn_check.h"
#include "storage/zarn_header.h"
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

constexpr uint64_t kChunk = 16 * kMiB;  // of a 16 GiB medium

struct CheckCase {
  const char* name;
  std::function<void(const ZarnMediaProperties&, ZarnHeaderEditor)> damage;
  const char* message;  // "" when the header stays consistent
};

TEST(ZarnCheckTest, EachFaultGivesItsMessage) {
  const ZarnMediaProperties props = Geometry(16 * kGiB);
  const uint64_t floor = Floor(props);
  const CheckCase cases[] = {
      {"fresh", [](auto&, ZarnHeaderEditor) {}, ""},
      {"without CRC", [](auto&, ZarnHeaderEditor h) { h.setType(kZarnTypeWithoutCrc); }, ""},
      {"unknown kind", [](auto&, ZarnHeaderEditor h) { h.setType(kZarnHfsPlusType); },
       "zarn: media header mismatch\n"},
      {"media size", [](auto&, ZarnHeaderEditor h) { h.setMediaSize(16 * kGiB - 4096); },
       "zarn: media size mismatch\n"},
      {"count", [](auto&, ZarnHeaderEditor h) { h.setPartitionCount(9); }, "zarn: illegal partition count\n"},
      {"type zero", [](auto&, ZarnHeaderEditor h) { h.entry(0).setType({}); }, "zarn: partition 0 has type zero\n"},
      {"identity zero", [](auto&, ZarnHeaderEditor h) { h.entry(0).setIdentity({}); },
       "zarn: partition 0 has identity zero\n"},
      {"too low", [=](auto&, ZarnHeaderEditor h) { h.entry(0).setBegin(floor - 4096); },
       "zarn: partition 0 starts too low\n"},
      {"too high", [=](auto& p, ZarnHeaderEditor h) { h.entry(0).setEnd(p.usableSize + floor + 4096); },
       "zarn: partition 0 ends too high\n"},
      {"empty", [=](auto&, ZarnHeaderEditor h) { h.entry(0).setEnd(floor); },
       "zarn: partition 0 start/end not in order\n"},
      {"unaligned", [=](auto&, ZarnHeaderEditor h) { h.entry(0).setBegin(floor + 512); },
       "zarn: partition 0 start/end not block aligned\n"},
      {"overlap",
       [=](auto&, ZarnHeaderEditor h) {
         h.setPartitionCount(2);
         h.entry(1).setType(kZarnHfsPlusType);
         h.entry(1).setIdentity({1});
         h.entry(1).setBegin(floor + 100 * kChunk);
         h.entry(1).setEnd(floor + 200 * kChunk);
       },
       "zarn: partition 1 overlaps partition 0\n"},
      {"missing", [](auto&, ZarnHeaderEditor h) { h.setChunk(10, kZarnChunkFree); },
       "zarn: partition 0 missing chunk 0x0009\n"},
      // A chunk standing twice is reported as missing.
      {"duplicate", [](auto&, ZarnHeaderEditor h) { h.setChunk(1020, 0x0005); },
       "zarn: partition 0 missing chunk 0x0005\n"},
      {"orphan", [](auto&, ZarnHeaderEditor h) { h.entry(3).setBegin(1); }, "zarn: partition 3 orphaned\n"},
      {"orphan name only", [](auto&, ZarnHeaderEditor h) { h.entry(7).setAsciiName("x"); }, ""},
      {"chunk zero", [](auto&, ZarnHeaderEditor h) { h.setChunk(0, kZarnChunkFree); },
       "zarn: chunk zero not marked reserved\n"},
      {"foreign partition", [](auto&, ZarnHeaderEditor h) { h.setChunk(1020, 0x1000); },
       "zarn: chunk 0x03fc claims nonexistent partition (0x1000)\n"},
      {"invalid mark inside", [](auto&, ZarnHeaderEditor h) { h.setChunk(1020, kZarnChunkInvalid); },
       "zarn: chunk 0x03fc claims nonexistent partition (0xf3ff)\n"},
      {"reserved mark inside", [](auto&, ZarnHeaderEditor h) { h.setChunk(1, kZarnChunkReserved); },
       "zarn: partition 0 missing chunk 0x0000\n"},
      {"offset past end", [](auto&, ZarnHeaderEditor h) { h.setChunk(1020, 0x03FF); },
       "zarn: chunk 0x03fc assigned to invalid partition offset (0x03ff)\n"},
      // A chunk exactly at the partition's end passes.
      {"offset at end", [](auto&, ZarnHeaderEditor h) { h.setChunk(1020, 1016); }, ""},
  };
  const Header fresh = FreshHeader(props);
  for (const CheckCase& c : cases) {
    SCOPED_TRACE(c.name);
    Header h = fresh;
    c.damage(props, ZarnHeaderEditor(h));
    int result = 0;
    EXPECT_EQ(StderrOf([&] { result = zarnCheckHeader(&props, h.data()); }), c.message);
    EXPECT_EQ(result, *c.message == '\0' ? 0 : -1);
  }
}

TEST(ZarnCheckTest, SlotsBeyondTheMediumMustBeInvalid) {
  const ZarnMediaProperties props = Geometry(16 * kGiB + 8 * kMiB);  // 512 chunks
  Header h = FreshHeader(props);
  ZarnHeaderEditor(h).setChunk(600, kZarnChunkFree);
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnCheckHeader(&props, h.data()), -1); }),
            "zarn: chunk 0x0258 not invalid (0xf111)\n");
}

TEST(ZarnCheckTest, NullArguments) {
  const ZarnMediaProperties props = Geometry(16 * kGiB);
  const Header h = FreshHeader(props);
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnCheckHeader(nullptr, h.data()), -1); }), "zarn: NULL media properties\n");
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnCheckHeader(&props, nullptr), -1); }), "zarn: NULL header buffer\n");
}

}  // namespace
}  // namespace vtr
