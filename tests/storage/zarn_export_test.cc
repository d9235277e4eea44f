#include "storage/zarn_export.h"

#include <fcntl.h>

#include <gtest/gtest.h>

#include <functional>

#include "platform/unique_fd.h"
#include "storage/zarn_header.h"
#include "tests/storage/zarn_test_support.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

using testing::BlockWith;
using testing::FakeMedium;
using testing::FreshHeader;
using testing::Geometry;
using testing::Header;
using testing::kGiB;
using testing::kMiB;
using testing::StderrOf;

constexpr uint64_t kChunk = 16 * kMiB;

class ZarnExportTest : public ::testing::Test {
 protected:
  ZarnMediaProperties props_ = Geometry(16 * kGiB);
  Header header_ = FreshHeader(props_);
  std::vector<ZarnExportedPartition> list_{ZarnExportedPartition{}};  // a sentinel to see it untouched
  ZarnUuid identity_{};

  // Exports header_ (CRC restamped) from a 16 GiB medium in memory.
  int Export() {
    zarnSetHeaderCRC(header_.data());
    FakeMedium medium;
    medium.blockCountResult = uint64_t{16 * kGiB / 4096};
    medium.blocks[0] = BlockWith(header_);
    int result = 0;
    EXPECT_EQ(StderrOf([&] { result = Zarn_ExportMediaInfo(medium, identity_.data(), &list_); }), "");
    return result;
  }
  ZarnHeaderEditor edit() { return ZarnHeaderEditor(header_); }
};

TEST_F(ZarnExportTest, FreshHeaderFromAnImageFile) {
  vtr::testing::TempDir dir;
  const std::string path = dir / "disk.img";
  testing::WriteImage(path, 16 * kGiB, header_, 0, header_);
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_EQ(Zarn_ExportMediaInfo(fd.get(), identity_.data(), &list_), 0);

  const ZarnHeaderView h(header_);
  EXPECT_TRUE(std::equal(identity_.begin(), identity_.end(), h.mediaIdentity().begin()));
  ASSERT_EQ(list_.size(), 1u);
  const ZarnExportedPartition& p = list_[0];
  EXPECT_EQ(p.name, "Zarn");
  EXPECT_EQ(p.index, 0);
  EXPECT_EQ(p.flags, 0);
  EXPECT_EQ(p.type, kZarnHfsPlusType);
  EXPECT_TRUE(std::equal(p.identity.begin(), p.identity.end(), h.entry(0).identity().begin()));
  EXPECT_EQ(p.size, props_.usableSize);
  ASSERT_EQ(p.extents.size(), 1u);
  EXPECT_EQ(p.extents[0].offset, kChunk);
  EXPECT_EQ(p.extents[0].length, 1016 * kChunk);
}

TEST_F(ZarnExportTest, ExtentsFollowPartitionOrderAndMergeNeighbours) {
  // Chunk 500 moves to slot 1020; its old slot 501 is free.
  edit().setChunk(501, kZarnChunkFree);
  edit().setChunk(1020, 500);
  // A second partition of three chunks in slots 1022, 1017, 1018.
  edit().setPartitionCount(2);
  ZarnEntryEditor second = edit().entry(1);
  second.setType(kZarnHfsPlusType);
  second.setIdentity({9});
  second.setBegin(1);
  second.setEnd(1 + 2 * kChunk + 1);  // a partial last chunk counts whole
  second.setAttributes(kZarnEntryExportedAttribute);
  const uint8_t name[] = {0xE9, 0x00, 0x00, 0x00, 'x', 0x00};  // "é", a zero unit, "x"
  std::copy(std::begin(name), std::end(name), second.bytes().begin() + kZarnEntryNameOffset);
  edit().setChunk(1022, 0x1000);
  edit().setChunk(1017, 0x1001);
  edit().setChunk(1018, 0x1002);
  edit().setFlags(1);
  ASSERT_EQ(Export(), 0);

  ASSERT_EQ(list_.size(), 2u);
  const std::vector<ZarnExtent>& first = list_[0].extents;
  ASSERT_EQ(first.size(), 3u);
  EXPECT_EQ(first[0].offset, 1 * kChunk);
  EXPECT_EQ(first[0].length, 500 * kChunk);
  EXPECT_EQ(first[1].offset, 1020 * kChunk);
  EXPECT_EQ(first[1].length, 1 * kChunk);
  EXPECT_EQ(first[2].offset, 502 * kChunk);
  EXPECT_EQ(first[2].length, 515 * kChunk);
  EXPECT_EQ(list_[0].flags, 0);  // header flag bit 0 counts only with the attribute

  const ZarnExportedPartition& p = list_[1];
  EXPECT_EQ(p.index, 1);
  EXPECT_EQ(p.name, "\xC3\xA9x");
  EXPECT_EQ(p.flags, kZarnExportFlagAttribute | kZarnExportFlagHeader);
  ASSERT_EQ(p.extents.size(), 2u);
  EXPECT_EQ(p.extents[0].offset, 1022 * kChunk);
  EXPECT_EQ(p.extents[0].length, kChunk);
  EXPECT_EQ(p.extents[1].offset, 1017 * kChunk);
  EXPECT_EQ(p.extents[1].length, 2 * kChunk);

  // Without the header flag only bit 0 is set.
  edit().setFlags(0);
  ASSERT_EQ(Export(), 0);
  EXPECT_EQ(list_[1].flags, kZarnExportFlagAttribute);
}

TEST_F(ZarnExportTest, RefusedHeadersLeaveTheListAlone) {
  const struct {
    const char* name;
    std::function<void(ZarnHeaderEditor)> damage;
  } cases[] = {
      {"hole", [](ZarnHeaderEditor e) { e.setChunk(10, kZarnChunkFree); }},
      {"zero size", [](ZarnHeaderEditor e) { e.entry(0).setEnd(e.entry(0).begin()); }},
      {"negative size", [](ZarnHeaderEditor e) { e.entry(0).setEnd(e.entry(0).begin() - 1); }},
      {"more than 1024 chunks", [](ZarnHeaderEditor e) { e.entry(0).setEnd(e.entry(0).begin() + 1025 * kChunk); }},
      {"count above 8", [](ZarnHeaderEditor e) { e.setPartitionCount(9); }},
      {"unknown kind", [](ZarnHeaderEditor e) { e.setType(kZarnHfsPlusType); }},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    header_ = FreshHeader(props_);
    c.damage(edit());
    EXPECT_EQ(Export(), -1);
    EXPECT_EQ(list_.size(), 1u);
  }
}

TEST_F(ZarnExportTest, EdgesThatStillExport) {
  // A slot naming a chunk past the partition's end is passed over.
  edit().setChunk(1020, 0x03FF);
  ASSERT_EQ(Export(), 0);
  EXPECT_EQ(list_[0].extents.size(), 1u);
  // No partition: an empty list and the identity.
  header_ = FreshHeader(props_);
  edit().setPartitionCount(0);
  ASSERT_EQ(Export(), 0);
  EXPECT_TRUE(list_.empty());
  EXPECT_TRUE(std::equal(identity_.begin(), identity_.end(), ZarnHeaderView(header_).mediaIdentity().begin()));
}

TEST_F(ZarnExportTest, OnlyTheMainCopyCounts) {
  Header bad = header_;
  bad[1000] ^= 1;
  FakeMedium medium;
  medium.blockCountResult = uint64_t{16 * kGiB / 4096};
  medium.blocks[0] = BlockWith(bad);
  medium.blocks[16 * kMiB - 4096] = BlockWith(header_);
  EXPECT_EQ(Zarn_ExportMediaInfo(medium, identity_.data(), &list_), -1);
  // A geometry the library refuses prints its own message, nothing more.
  medium.blockSizeResult = uint32_t{512};
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(Zarn_ExportMediaInfo(medium, identity_.data(), &list_), -1); }),
            "zarn: media block size too small\n");
  EXPECT_EQ(list_.size(), 1u);
}

}  // namespace
}  // namespace vtr
