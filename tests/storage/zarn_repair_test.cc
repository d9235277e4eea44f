#include <gtest/gtest.h>

#include <string>

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

constexpr uint64_t kChunk = 16 * kMiB;

size_t Count(const std::string& text, const std::string& line) {
  size_t n = 0;
  for (size_t at = text.find(line); at != std::string::npos; at = text.find(line, at + 1)) ++n;
  return n;
}

// The free-slot message for every slot from `from` to 1023.
std::string ReclaimFreeSlots(uint32_t from) {
  std::string text;
  char line[80];
  for (uint32_t s = from; s < 1024; ++s) {
    std::snprintf(line, sizeof line, "zarn: reclaiming chunk 0x%04x not assigned to valid partition\n", s);
    text += line;
  }
  return text;
}

class ZarnRepairTest : public ::testing::Test {
 protected:
  int Repair(Header* h, bool strict, std::string* messages) {
    int result = 0;
    *messages = StderrOf([&] { result = zarnRepairHeader(&props_, h->data(), strict ? 1 : 0); });
    return result;
  }

  // A header whose partition 0 passes the repair's entry tests: its begin
  // lies above its end (the repair's order test is reversed). Its chunks
  // 0, 1 and 2 stand in slots 1 to 3; every other slot is free.
  Header ReversedPartition() const {
    Header h = FreshHeader(props_);
    ZarnHeaderEditor e(h);
    e.entry(0).setBegin(Floor(props_) + 8 * kChunk);
    e.entry(0).setEnd(Floor(props_));
    for (uint32_t s = 1; s < 1024; ++s) e.setChunk(s, s <= 3 ? static_cast<uint16_t>(s - 1) : kZarnChunkFree);
    return h;
  }

  ZarnMediaProperties props_ = Geometry(16 * kGiB);
};

TEST_F(ZarnRepairTest, AFreshHeaderIsTakenAsFaulty) {
  Header h = FreshHeader(props_);
  std::string messages;
  EXPECT_EQ(Repair(&h, true, &messages), -1);
  EXPECT_EQ(messages, "zarn: partition 0 start/end not in order\nzarn: partition table corrupt\n");

  h = FreshHeader(props_);
  EXPECT_EQ(Repair(&h, false, &messages), 0);
  EXPECT_EQ(messages,
            "zarn: partition 0 start/end not in order\n"
            "zarn: deleting partition(s) and fixing partition count\n" +
                ReclaimFreeSlots(1));
  const ZarnHeaderView view(h);
  EXPECT_EQ(view.partitionCount(), 0u);
  EXPECT_TRUE(view.entry(0).isEmpty());
  EXPECT_TRUE(view.entry(0).name()[0] == 0);
  // What is left is consistent.
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnCheckHeader(&props_, h.data()), 0); }), "");
}

TEST_F(ZarnRepairTest, EntryFaultsInStrictMode) {
  const uint64_t floor = Floor(props_);
  struct Case {
    uint64_t begin;
    uint64_t end;
    bool nullType;
    const char* fault;
  };
  const Case cases[] = {
      {floor + 2 * kChunk, floor, true, "zarn: found null partition type/identity\n"},
      {floor, floor, false, "zarn: partition 0 start/end not in order\n"},
      {floor - 4096, floor - 8192, false, "zarn: partition 0 starts too low\n"},
      {props_.usableSize + floor + 8192, props_.usableSize + floor + 4096, false, "zarn: partition 0 ends too high\n"},
      {floor + 2 * kChunk + 512, floor, false, "zarn: partition 0 start/end not block aligned\n"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.fault);
    Header h = FreshHeader(props_);
    ZarnHeaderEditor e(h);
    e.entry(0).setBegin(c.begin);
    e.entry(0).setEnd(c.end);
    if (c.nullType) e.entry(0).setType({});
    std::string messages;
    EXPECT_EQ(Repair(&h, true, &messages), -1);
    EXPECT_EQ(messages, std::string(c.fault) + "zarn: partition table corrupt\n");
  }
}

TEST_F(ZarnRepairTest, MediaSizeAndCount) {
  std::string messages;
  Header h = ReversedPartition();
  ZarnHeaderEditor(h).setMediaSize(props_.mediaSize - 4096);
  ZarnHeaderEditor(h).setPartitionCount(12);
  ASSERT_EQ(Repair(&h, true, &messages), -1);
  EXPECT_EQ(messages,
            "zarn: adjusting header media size\nzarn: fixing illegal partition count\n"
            "zarn: partition 0 missing chunk 0x0003\n");
  EXPECT_EQ(ZarnHeaderView(h).partitionCount(), 8u);
  EXPECT_EQ(ZarnHeaderView(h).mediaSize(), props_.mediaSize);

  h = ReversedPartition();
  ZarnHeaderEditor(h).setMediaSize(props_.mediaSize + 4096);
  EXPECT_EQ(Repair(&h, true, &messages), -1);
  EXPECT_EQ(messages, "zarn: media size smaller than required by header\n");
  EXPECT_EQ(Repair(&h, false, &messages), 0);
  EXPECT_TRUE(messages.starts_with("zarn: adjusting header media size\nzarn: truncated partition 0\n"));
  EXPECT_EQ(ZarnHeaderView(h).mediaSize(), props_.mediaSize);
}

TEST_F(ZarnRepairTest, MissingAndDuplicateChunks) {
  std::string messages;
  // Lenient: the duplicate of chunk 1 is freed silently, chunk 3 is missing
  // so the partition is cut to three chunks, chunk 5 then lies past the end.
  Header h = ReversedPartition();
  ZarnHeaderEditor(h).setChunk(6, 0x0001);
  ZarnHeaderEditor(h).setChunk(4, 0x0005);
  ZarnHeaderEditor(h).setChunk(0, 0x1234);
  EXPECT_EQ(Repair(&h, false, &messages), 0);
  EXPECT_EQ(messages,
            "zarn: truncated partition 0\n"
            "zarn: fixing chunk0 assignment\n"
            "zarn: reclaiming chunk 0x0004 off the end of partition 0\n" +
                ReclaimFreeSlots(5));
  const ZarnHeaderView view(h);
  EXPECT_EQ(view.partitionCount(), 1u);
  EXPECT_EQ(view.entry(0).end() - view.entry(0).begin(), 3 * kChunk);
  EXPECT_EQ(view.chunk(0), kZarnChunkReserved);
  EXPECT_EQ(view.chunk(4), kZarnChunkFree);
  EXPECT_EQ(view.chunk(6), kZarnChunkFree);
  // The result is consistent.
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnCheckHeader(&props_, h.data()), 0); }), "");

  // Strict: the duplicate, then the missing chunk, each fail.
  h = ReversedPartition();
  ZarnHeaderEditor(h).setChunk(6, 0x0001);
  EXPECT_EQ(Repair(&h, true, &messages), -1);
  EXPECT_EQ(messages, "zarn: partition 0 duplicate chunk 0x0001\n");
  h = ReversedPartition();
  EXPECT_EQ(Repair(&h, true, &messages), -1);
  EXPECT_EQ(messages, "zarn: partition 0 missing chunk 0x0003\n");

  // A missing first chunk deletes the partition (lenient) or fails (strict).
  h = ReversedPartition();
  ZarnHeaderEditor(h).setChunk(1, kZarnChunkFree);
  EXPECT_EQ(Repair(&h, true, &messages), -1);
  EXPECT_EQ(messages, "zarn: partition 0 missing chunk 0x0000\n");
  EXPECT_EQ(Repair(&h, false, &messages), 0);
  EXPECT_EQ(messages, "zarn: deleting partition(s) and fixing partition count\n" + ReclaimFreeSlots(1));
  EXPECT_EQ(ZarnHeaderView(h).partitionCount(), 0u);
}

TEST_F(ZarnRepairTest, LaterPartitionsOutOfOrder) {
  // Partition 1 is not compared with partition 0; partition 2 is compared
  // with partition 1 and deleted.
  Header h = ReversedPartition();
  ZarnHeaderEditor e(h);
  e.setPartitionCount(3);
  for (uint32_t i = 1; i < 3; ++i) {
    e.entry(i).setType(kZarnHfsPlusType);
    e.entry(i).setIdentity({static_cast<uint8_t>(i)});
    e.setChunk(3 + i, static_cast<uint16_t>(i << 12));
  }
  const uint64_t floor = Floor(props_);
  e.entry(1).setBegin(floor + 4 * kChunk);  // overlaps partition 0: not looked at
  e.entry(1).setEnd(floor + 2 * kChunk);
  e.entry(2).setBegin(floor + 3 * kChunk);  // below partition 1's end
  e.entry(2).setEnd(floor + kChunk);
  std::string messages;
  EXPECT_EQ(Repair(&h, false, &messages), 0);
  EXPECT_EQ(Count(messages, "zarn: partition 2 out of order or overlapping\n"), 1u);
  EXPECT_EQ(Count(messages, "zarn: deleting partition(s) and fixing partition count\n"), 1u);
  EXPECT_EQ(Count(messages, "zarn: truncated partition 0\n"), 1u);
  EXPECT_EQ(Count(messages, "zarn: truncated partition 1\n"), 1u);
  EXPECT_EQ(ZarnHeaderView(h).partitionCount(), 2u);
  EXPECT_TRUE(ZarnHeaderView(h).entry(2).isEmpty());
}

TEST_F(ZarnRepairTest, BadArguments) {
  Header h = FreshHeader(props_);
  std::string messages = StderrOf([&] { EXPECT_EQ(zarnRepairHeader(nullptr, h.data(), 0), -1); });
  EXPECT_EQ(messages, "zarn: NULL media properties\n");
  messages = StderrOf([&] { EXPECT_EQ(zarnRepairHeader(&props_, nullptr, 0), -1); });
  EXPECT_EQ(messages, "zarn: NULL header buffer\n");
  h[3] ^= 1;
  EXPECT_EQ(Repair(&h, false, &messages), -1);
  EXPECT_EQ(messages, "zarn: media header mismatch\n");
}

}  // namespace
}  // namespace vtr
