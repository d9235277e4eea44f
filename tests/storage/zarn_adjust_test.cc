#include "storage/zarn_adjust.h"

#include <gtest/gtest.h>

#include <array>
#include <string>
#include <vector>

#include "platform/little_endian.h"
#include "storage/zarn_layout.h"
#include "tests/storage/zarn_test_support.h"

namespace vtr {
namespace {

using testing::Geometry;
using testing::kGiB;
using testing::StderrOf;

// A GPT with usable LBAs 34..1033 (1000 blocks of 4096 bytes) and the given
// partitions as (first, last) pairs.
class ZarnAdjustTest : public ::testing::Test {
 protected:
  static constexpr uint64_t kFirstUsable = 34;
  static constexpr uint64_t kLastUsable = 1033;

  void SetUp() override {
    StoreU64(&header_[kGptFirstUsableLbaOffset], kFirstUsable);
    StoreU64(&header_[kGptLastUsableLbaOffset], kLastUsable);
  }
  void SetPartitions(const std::vector<std::pair<uint64_t, uint64_t>>& ranges) {
    StoreU32(&header_[kGptEntryCountOffset], static_cast<uint32_t>(ranges.size()));
    for (size_t i = 0; i < ranges.size(); ++i) {
      ZarnEntryEditor e = entry(i);
      e.setType(kZarnHfsPlusType);
      e.setIdentity({static_cast<uint8_t>(i + 1)});
      e.setBegin(ranges[i].first);
      e.setEnd(ranges[i].second);
      std::string name = "P";
      name += std::to_string(i);
      e.setAsciiName(name);
    }
  }
  ZarnEntryEditor entry(size_t i) {
    return ZarnEntryEditor(std::span<uint8_t, kGptEntrySize>(&table_[i * kGptEntrySize], kGptEntrySize));
  }
  // (first, last) of each entry below count.
  std::vector<std::pair<uint64_t, uint64_t>> CurrentLayout() {
    std::vector<std::pair<uint64_t, uint64_t>> layout;
    for (size_t i = 0; i < count(); ++i) layout.emplace_back(entry(i).begin(), entry(i).end());
    return layout;
  }
  uint32_t count() const { return LoadU32(&header_[kGptEntryCountOffset]); }
  int Adjust(uint32_t index, uint64_t bytes, std::string* messages) {
    int result = 0;
    *messages = StderrOf([&] { result = zarnAdjustPartition(&props_, header_.data(), table_.data(), index, bytes); });
    return result;
  }

  ZarnMediaProperties props_ = Geometry(16 * kGiB);  // 4096-byte blocks
  std::array<uint8_t, kGptHeaderSize> header_{};
  std::array<uint8_t, kGptTableSize> table_{};
  std::string messages_;
};

using Layout = std::vector<std::pair<uint64_t, uint64_t>>;

TEST_F(ZarnAdjustTest, ResizeRepacksInOrderOfStart) {
  SetPartitions({{34, 133}, {134, 533}, {534, 633}});
  ASSERT_EQ(Adjust(1, 200 * 4096, &messages_), 0);
  EXPECT_EQ(messages_, "");
  EXPECT_EQ(CurrentLayout(), (Layout{{34, 133}, {134, 333}, {334, 433}}));
  // Sizes round up to whole blocks.
  ASSERT_EQ(Adjust(0, 1, &messages_), 0);
  EXPECT_EQ(CurrentLayout(), (Layout{{34, 34}, {35, 234}, {235, 334}}));
}

TEST_F(ZarnAdjustTest, TablePositionsStayWhileLbasFollowTheStarts) {
  // Entry 0 lies after entry 1 on the disk, entries 1 and 2 start together:
  // the bubble sort keeps equal starts in table order.
  SetPartitions({{900, 909}, {100, 119}, {100, 104}});
  ASSERT_EQ(Adjust(0, 10 * 4096, &messages_), 0);
  EXPECT_EQ(CurrentLayout(), (Layout{{59, 68}, {34, 53}, {54, 58}}));
  EXPECT_EQ(entry(0).bytes()[kZarnEntryNameOffset], 'P');
  EXPECT_EQ(entry(0).bytes()[kZarnEntryNameOffset + 2], '0');
}

TEST_F(ZarnAdjustTest, CreateAppendsANewPartition) {
  SetPartitions({{34, 133}, {134, 533}});
  ASSERT_EQ(Adjust(2, 50 * 4096, &messages_), 0);
  EXPECT_EQ(count(), 3u);
  EXPECT_EQ(CurrentLayout(), (Layout{{34, 133}, {134, 533}, {534, 583}}));
  ZarnEntryEditor created = entry(2);
  EXPECT_TRUE(std::equal(kZarnHfsPlusType.begin(), kZarnHfsPlusType.end(), created.type().begin()));
  EXPECT_FALSE(created.identityIsZero());
  const uint8_t name[] = {'N', 0, 'e', 0, 'w', 0, 0, 0};
  EXPECT_TRUE(std::equal(std::begin(name), std::end(name), created.name().begin()));

  EXPECT_EQ(Adjust(3, 0, &messages_), -1);
  EXPECT_EQ(messages_, "zarn: cannot create zero-sized partition\n");
  EXPECT_EQ(count(), 3u);
}

TEST_F(ZarnAdjustTest, DeleteMovesTheFollowingEntriesDown) {
  SetPartitions({{34, 133}, {134, 533}, {534, 633}});
  ASSERT_EQ(Adjust(0, 0, &messages_), 0);
  EXPECT_EQ(count(), 2u);
  EXPECT_EQ(CurrentLayout(), (Layout{{34, 433}, {434, 533}}));
  EXPECT_EQ(entry(0).identity()[0], 2);  // what was entry 1
  EXPECT_TRUE(entry(2).isEmpty());
  EXPECT_EQ(entry(2).name()[0], 0);
}

TEST_F(ZarnAdjustTest, RefusalsAndOverflow) {
  SetPartitions({{34, 133}, {134, 533}});
  EXPECT_EQ(Adjust(3, 4096, &messages_), -1);
  EXPECT_EQ(messages_, "zarn: cannot adjust partition 3 - out of range\n");
  EXPECT_EQ(Adjust(8, 4096, &messages_), -1);
  EXPECT_EQ(messages_, "zarn: cannot adjust partition 8 - out of range\n");

  // 1000 usable blocks, 400 of them partition 1's: partition 0 asks for 1300.
  EXPECT_EQ(Adjust(0, 1300 * 4096, &messages_), -1);
  EXPECT_EQ(messages_, "zarn: new layout does not fit, overflows by 0x2bc blocks\n");
  EXPECT_EQ(count(), 2u);  // not stored; the entries stay re-packed
  EXPECT_EQ(CurrentLayout(), (Layout{{34, 1333}, {1334, 1733}}));

  // A table claiming more entries than it holds.
  StoreU32(&header_[kGptEntryCountOffset], 9);
  EXPECT_EQ(Adjust(1, 4096, &messages_), -1);
  EXPECT_EQ(messages_, "zarn: cannot adjust partition 1 - out of range\n");

  // An entry that ends before it starts has no length: it would wrap around
  // and seem to fit. So would one whose length wraps the LBA range.
  for (const Layout& broken : {Layout{{34, 133}, {300, 200}}, Layout{{34, 133}, {134, UINT64_MAX}}}) {
    SetPartitions(broken);
    EXPECT_EQ(Adjust(0, 4096, &messages_), -1);
    EXPECT_NE(messages_, "") << "silently accepted";
    EXPECT_EQ(count(), 2u);
  }
  SetPartitions({{34, 133}, {300, 200}});
  EXPECT_EQ(Adjust(0, 4096, &messages_), -1);
  EXPECT_EQ(messages_, "zarn: partition 1 ends before it starts\n");
}

}  // namespace
}  // namespace vtr
