#include "storage/zarn_acquire.h"

#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

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

// What a copy on the fake medium is like.
enum class Copy { kUnreadable, kShort, kCorrupt, kUnknownKind, kValid, kWithoutCrc };

class ZarnAcquireTest : public ::testing::Test {
 protected:
  ZarnMediaProperties props_ = Geometry(16 * kGiB);  // backup at 16 MiB - 4 KiB
  Header fresh_ = FreshHeader(props_);

  Header Variant(Copy kind) const {
    Header h = fresh_;
    if (kind == Copy::kCorrupt) h[100] ^= 1;
    if (kind == Copy::kUnknownKind) h[0] ^= 1;
    if (kind == Copy::kWithoutCrc) {
      std::copy(kZarnTypeWithoutCrc.begin(), kZarnTypeWithoutCrc.end(), h.begin());
      h[44] ^= 0x5A;
    }
    return h;
  }
  void Place(FakeMedium* medium, uint64_t offset, Copy kind) const {
    if (kind == Copy::kUnreadable) return;
    std::vector<uint8_t> block = BlockWith(Variant(kind));
    if (kind == Copy::kShort) block.resize(4095);
    medium->blocks[offset] = block;
  }
};

TEST_F(ZarnAcquireTest, MainThenBackupAndTheFinalVerdict) {
  const uint64_t backup = 16 * kMiB - 4096;
  struct Case {
    Copy main;
    Copy backup;
    int result;
    const char* messages;
  };
  const Case cases[] = {
      {Copy::kValid, Copy::kUnreadable, 0, ""},
      {Copy::kCorrupt, Copy::kValid, 0, ""},  // silently from the backup
      {Copy::kUnknownKind, Copy::kValid, 0, ""},
      {Copy::kUnreadable, Copy::kWithoutCrc, 0, "zarn: failed to read main header\n"},
      {Copy::kUnreadable, Copy::kUnknownKind, -1,
       "zarn: failed to read main header\nzarn: media header not found or not supported\n"},
      {Copy::kCorrupt, Copy::kUnknownKind, -1, "zarn: media header corrupt\n"},
      {Copy::kUnknownKind, Copy::kCorrupt, -1, "zarn: media header corrupt\n"},
      {Copy::kCorrupt, Copy::kUnreadable, -1, "zarn: failed to read backup header\nzarn: media header corrupt\n"},
      {Copy::kUnknownKind, Copy::kUnknownKind, -1, "zarn: media header not found or not supported\n"},
      {Copy::kUnreadable, Copy::kUnreadable, -1,
       "zarn: failed to read main header\nzarn: failed to read backup header\nzarn: could not read media header\n"},
      {Copy::kShort, Copy::kShort, -1,
       "zarn: failed to read main header\nzarn: failed to read backup header\nzarn: could not read media header\n"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(::testing::Message() << "main " << int(c.main) << " backup " << int(c.backup));
    FakeMedium medium;
    Place(&medium, 0, c.main);
    Place(&medium, backup, c.backup);
    Header out{};
    int result = 0;
    EXPECT_EQ(StderrOf([&] { result = zarnAcquireHeader(medium, &props_, out.data()); }), c.messages);
    EXPECT_EQ(result, c.result);
    if (result == 0) {
      EXPECT_EQ(out, Variant(c.main == Copy::kValid ? Copy::kValid : c.backup));
      // A valid main copy ends the search.
      EXPECT_EQ(medium.reads.size(), c.main == Copy::kValid ? 1u : 2u);
    }
  }
}

TEST_F(ZarnAcquireTest, GeometryFailuresAndNoRoomForABackup) {
  Header out{};
  FakeMedium noBlockSize;
  noBlockSize.blockSizeResult = Error(ENOTTY, "x");
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnAcquireHeader(noBlockSize, &props_, out.data()), -1); }),
            "zarn: block size acquisition error\n");
  FakeMedium noBlockCount;
  noBlockCount.blockCountResult = Error(ENOTTY, "x");
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnAcquireHeader(noBlockCount, &props_, out.data()), -1); }),
            "zarn: block count acquisition error\n");

  // 1 KiB chunks: chunk 0 has no last block to hold a backup.
  const ZarnMediaProperties tiny = Geometry(1 * kMiB);
  FakeMedium medium;
  Place(&medium, 0, Copy::kCorrupt);
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnAcquireHeader(medium, &tiny, out.data()), -1); }),
            "zarn: failed to read backup header\nzarn: media header corrupt\n");
}

TEST_F(ZarnAcquireTest, LargeBlocksHoldTheHeaderInTheirFirstBytes) {
  FakeMedium medium;
  medium.blockSizeResult = uint32_t{16384};
  medium.blocks[0] = BlockWith(Variant(Copy::kCorrupt), 16384);
  medium.blocks[16 * kMiB - 16384] = BlockWith(fresh_, 16384);
  ZarnMediaProperties props = Geometry(16 * kGiB, 16384);
  Header out{};
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnAcquireHeader(medium, &props, out.data()), 0); }), "");
  EXPECT_EQ(out, fresh_);
}

TEST_F(ZarnAcquireTest, FromImageFilesAndOtherDescriptors) {
  vtr::testing::TempDir dir;
  const std::string path = dir / "disk.img";
  Header bad = Variant(Copy::kCorrupt);
  testing::WriteImage(path, 16 * kGiB, bad, 16 * kMiB - 4096, fresh_);
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  ASSERT_TRUE(fd.valid());
  Header out{};
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnAcquireHeader(fd.get(), &props_, out.data()), 0); }), "");
  EXPECT_EQ(out, fresh_);

  // A pipe is neither a block device nor an image.
  int fds[2];
  ASSERT_EQ(::pipe2(fds, O_CLOEXEC), 0);
  UniqueFd readEnd(fds[0]), writeEnd(fds[1]);
  EXPECT_EQ(StderrOf([&] { EXPECT_EQ(zarnAcquireHeader(readEnd.get(), &props_, out.data()), -1); }),
            "zarn: block size acquisition error\n");
}

}  // namespace
}  // namespace vtr
