// The resize drivers' own rules, in-process on disk images (a regular file
// stands for the disk; nothing is mounted): the numbers they log, what they
// refuse and with which words. The loop-device tests (partition_test.cc)
// cover the mounted file systems.
#include "vitd_helper/partition_resize.h"

#include <fcntl.h>
#include <uuid/uuid.h>

#include <algorithm>
#include <cstring>
#include <functional>

#include <gtest/gtest.h>

#include "platform/unique_fd.h"
#include "storage/gpt_disk.h"
#include "platform/little_endian.h"
#include "storage/zarn_layout.h"
#include "tests/support/test_support.h"

namespace vtr::testing {
namespace {

constexpr uint32_t kBlock = 4096;
constexpr uint64_t kBlocks = 65536;  // a 256 MiB image
constexpr uint64_t kFirstUsable = 256;
constexpr uint64_t kLastUsable = kBlocks - 3;

struct Entry {
  const char* name;
  uint64_t first;
  uint64_t blocks;
};

// A disk image with the signature (unless unsigned) and a GPT of entries.
void MakeImage(const std::string& path, const std::vector<Entry>& entries, bool signed_ = true) {
  UniqueFd fd(::open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  ASSERT_EQ(::ftruncate(fd.get(), static_cast<off_t>(kBlocks * kBlock)), 0);
  uint8_t mbr[512] = {};
  if (signed_) StoreU32(mbr + kMbrSignatureOffset, kZarnMbrSignature);
  mbr[510] = 0x55;
  mbr[511] = 0xAA;
  ASSERT_EQ(::pwrite(fd.get(), mbr, sizeof mbr, 0), static_cast<ssize_t>(sizeof mbr));
  GptImage gpt;
  std::memcpy(gpt.header.data(), "EFI PART", 8);
  StoreU32(&gpt.header[8], 0x00010000);
  StoreU64(&gpt.header[kGptFirstUsableLbaOffset], kFirstUsable);
  StoreU64(&gpt.header[kGptLastUsableLbaOffset], kLastUsable);
  StoreU64(&gpt.header[kGptAlternateLbaOffset], kBlocks - 1);
  uuid_generate(&gpt.header[kGptDiskGuidOffset]);
  StoreU32(&gpt.header[kGptEntryCountOffset], static_cast<uint32_t>(entries.size()));
  StoreU32(&gpt.header[kGptEntrySizeOffset], kGptEntrySize);
  for (size_t i = 0; i < entries.size(); ++i) {
    ZarnEntryEditor entry(std::span<uint8_t, kGptEntrySize>(&gpt.table[i * kGptEntrySize], kGptEntrySize));
    entry.setType(kZarnHfsPlusType);
    ZarnUuid identity;
    uuid_generate(identity.data());
    entry.setIdentity(identity);
    entry.setAsciiName(entries[i].name);
    entry.setBegin(entries[i].first);
    entry.setEnd(entries[i].first + entries[i].blocks - 1);
  }
  ASSERT_TRUE(WriteGptWithBackup(fd.get(), kBlock, kBlocks, gpt).ok());
}

// The blocks that hold the image's MBR and both GPT copies.
std::string TableBlocks(const std::string& path) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  std::string bytes(5 * kBlock, '\0');
  EXPECT_EQ(::pread(fd.get(), bytes.data(), 3 * kBlock, 0), static_cast<ssize_t>(3 * kBlock));
  EXPECT_EQ(::pread(fd.get(), bytes.data() + 3 * kBlock, 2 * kBlock, (kBlocks - 2) * kBlock),
            static_cast<ssize_t>(2 * kBlock));
  return bytes;
}

class PartitionResizeTest : public ::testing::Test {
 protected:
  void SetUp() override {
    DataPartitionDisk disk;
    disk.rawDevice = image_;
    disk.dataVolume = dir_.path();
    SetDataPartitionDisk(std::move(disk));
  }
  void TearDown() override { SetDataPartitionDisk(DataPartitionDisk()); }

  // The log lines from the first that starts with from.
  std::vector<std::string> linesFrom(const std::string& from) const {
    std::vector<std::string> lines = log_.messages();
    auto at = std::find_if(lines.begin(), lines.end(), [&](const std::string& l) { return l.rfind(from, 0) == 0; });
    return std::vector<std::string>(at, lines.end());
  }

  TempDir dir_;
  const std::string image_ = dir_ / "disk.img";
  LogCapture log_;
};

const std::vector<Entry> kLayout = {{"System", 256, 4096}, {"Data", 8448, 16384}, {"Update", 4352, 4096}};

TEST_F(PartitionResizeTest, RefusalsSayWhyOrNothingAsTheyMust) {
  const struct {
    const char* what;
    std::vector<Entry> layout;
    uint64_t bytes;
    int result;
    std::vector<std::string> lines;  // from "partition: requiredSize="
  } cases[] = {
      {"no fit: silent", kLayout, kBlocks * kBlock, 1, {"partition: requiredSize=65536"}},
      {"zero", kLayout, 0, 1, {"partition: requiredSize=0", "deletion of partition 1 disallowed"}},
      {"same size", kLayout, 16384 * kBlock - 100, 0, {"partition: requiredSize=16384", "no change in size"}},
      {"not mounted", kLayout, 8192 * kBlock, 1,
       {"partition: requiredSize=8192", "failed to get filesystem information", "scanning -1 filesystems for *",
        "filesystem must be mounted "
        "(mountPoint=(null),which=1,nPartitions=3,newSize=8192)", "failed to adjust partition 1"}},
      {"a full table without Data",
       {{"A", 256, 16}, {"B", 272, 16}, {"C", 288, 16}, {"D", 304, 16}, {"E", 320, 16}, {"F", 336, 16},
        {"G", 352, 16}, {"H", 368, 16}},
       kBlock, 1, {"partition: requiredSize=1", "bad partion number", "failed to create partition 8"}},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    MakeImage(image_, c.layout);
    const std::string before = TableBlocks(image_);
    log_.clear();
    EXPECT_EQ(adjust_partition(c.bytes), c.result);
    std::vector<std::string> lines = linesFrom("partition: requiredSize=");
    ASSERT_EQ(lines.size(), c.lines.size()) << ::testing::PrintToString(lines);
    for (size_t i = 0; i < lines.size(); ++i) {
      const std::string& want = c.lines[i];
      if (!want.empty() && want.back() == '*') {
        EXPECT_EQ(lines[i].rfind(want.substr(0, want.size() - 1), 0), 0u) << lines[i];
      } else {
        EXPECT_EQ(lines[i], want);
      }
    }
    EXPECT_TRUE(TableBlocks(image_) == before) << "the table changed";
  }
}

TEST_F(PartitionResizeTest, TheDiskMustBeAManagedDeviceOrImage) {
  const struct {
    const char* what;
    std::function<void()> make;
    std::string line;
  } cases[] = {
      {"missing", [] {}, "failed to open " + image_},
      {"a directory", [this] { ::mkdir(image_.c_str(), 0700); }, image_ + " is not a suitable device (try /dev/rdisk*)"},
      {"no signature", [this] { MakeImage(image_, kLayout, false); }, image_ + " not managed by Zarn"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.what);
    RemoveTree(image_);
    c.make();
    log_.clear();
    EXPECT_EQ(adjust_partition(kBlock), 1);
    EXPECT_EQ(linesFrom("entering"), (std::vector<std::string>{"entering adjust_partition", c.line}));
  }
}

TEST_F(PartitionResizeTest, ShrinkHalvesTheFreeSpaceAndExpandSkipsTablePositionOne) {
  MakeImage(image_, kLayout);
  EXPECT_EQ(ShrinkDataPartition(), -1);  // nothing is mounted
  const std::vector<std::string> shrink = linesFrom("freeSize = ");
  ASSERT_FALSE(shrink.empty());
  long long freeSize = 0, totalSize = 0, newSize = 0;
  ASSERT_EQ(std::sscanf(shrink[0].c_str(), "freeSize = %lld(bytes), totalSize = %lld(bytes), newSize = %lld(bytes)",
                        &freeSize, &totalSize, &newSize),
            3);
  EXPECT_EQ(newSize, totalSize - freeSize / 2);
  EXPECT_EQ(shrink[0].substr(shrink[0].size() - 2), "\n\n");

  log_.clear();
  EXPECT_EQ(ExpandDataPartition(), 1);  // not mounted either
  const std::vector<std::string> expand = linesFrom("gpt.pth.first_lba");
  ASSERT_GE(expand.size(), 6u);
  EXPECT_EQ(expand[0], "gpt.pth.first_lba = 256, last_lba = 65533");
  EXPECT_EQ(expand[1], "Partition 0: first = 256, last = 4351, lbaNumber = 4096");
  EXPECT_EQ(expand[2], "Partition 1: first = 8448, last = 24831, lbaNumber = 16384");
  EXPECT_EQ(expand[3], "Partition 2: first = 4352, last = 8447, lbaNumber = 4096");
  EXPECT_EQ(expand[4], "Block numbers that could be used as data partition = 57086");  // 65278 - 2 x 4096
  EXPECT_EQ(expand[5], "newSize = 233824256(bytes)");

  // Without the disk-usage answer the shrink stops at once.
  SetDataPartitionDisk(DataPartitionDisk{image_, dir_ / "missing", nullptr});
  log_.clear();
  EXPECT_EQ(ShrinkDataPartition(), -1);
  EXPECT_EQ(log_.messages(), std::vector<std::string>{"Cannot get disk usage."});
}

TEST_F(PartitionResizeTest, ANewPartitionIsWrittenWithBothCopiesOfTheTable) {
  MakeImage(image_, {{"System", 256, 4096}});
  EXPECT_EQ(ExpandDataPartition(), 0);
  EXPECT_EQ(log_.messages().back(), "Wrote GPT header back to disk");
  UniqueFd fd(::open(image_.c_str(), O_RDONLY | O_CLOEXEC));
  Result<GptValidity> validity = CheckGpt(fd.get(), kBlock, kBlocks);
  ASSERT_TRUE(validity.ok());
  EXPECT_TRUE(validity->valid());
  uint8_t block[kBlock];
  ASSERT_EQ(::pread(fd.get(), block, sizeof block, kBlock), static_cast<ssize_t>(sizeof block));
  EXPECT_EQ(LoadU32(block + kGptEntryCountOffset), 2u);
  ASSERT_EQ(::pread(fd.get(), block, sizeof block, 2 * kBlock), static_cast<ssize_t>(sizeof block));
  ZarnEntryAccess<const uint8_t> made(std::span<const uint8_t, kGptEntrySize>(block + kGptEntrySize, kGptEntrySize));
  EXPECT_EQ(made.begin(), 4352u);
  EXPECT_EQ(made.end(), kLastUsable);
  EXPECT_EQ(made.name()[0], 'N');
}

TEST_F(PartitionResizeTest, APowerCutDuringTheTableWriteLeavesOneWholeCopy) {
  MakeImage(image_, kLayout);
  UniqueFd fd(::open(image_.c_str(), O_RDWR | O_CLOEXEC));
  Result<GptImage> old = ReadGptImage(fd.get(), kBlock);
  ASSERT_TRUE(old.ok());
  GptImage grown = *old;
  StoreU64(&grown.table[kGptEntrySize + kZarnEntryEndOffset], old->lastLba(1) + 100);
  Result<std::vector<GptWrite>> writes = PlanGptWrites(kBlock, kBlocks, grown);
  ASSERT_TRUE(writes.ok());
  std::vector<std::string> original;
  for (const GptWrite& w : *writes) {
    original.emplace_back(w.bytes.size(), '\0');
    ASSERT_EQ(::pread(fd.get(), original.back().data(), w.bytes.size(), static_cast<off_t>(w.offset)),
              static_cast<ssize_t>(w.bytes.size()));
  }
  auto put = [&](uint64_t offset, const void* bytes, size_t size) {
    ASSERT_EQ(::pwrite(fd.get(), bytes, size, static_cast<off_t>(offset)), static_cast<ssize_t>(size));
  };
  // A power cut keeps every write made before the last flush, and of the
  // writes after it each one not at all, torn (its first 512-byte sector
  // alone) or whole, in any mix.
  size_t flushed = 0;
  for (size_t last = 0; last < writes->size(); ++last) {
    if (!(*writes)[last].flushAfter) continue;
    size_t mixes = 1;
    for (size_t k = flushed; k <= last; ++k) mixes *= 3;
    for (size_t mix = 0; mix < mixes; ++mix) {
      std::string landed;
      for (size_t k = 0, digits = mix; k < writes->size(); ++k) {
        const GptWrite& w = (*writes)[k];
        put(w.offset, original[k].data(), original[k].size());
        const size_t kept[] = {0, 512, w.bytes.size()};
        const size_t how = k < flushed ? 2 : k <= last ? digits % 3 : 0;
        if (k >= flushed && k <= last) digits /= 3;
        put(w.offset, w.bytes.data(), kept[how]);
        landed += "-t="[how];
      }
      Result<GptValidity> seen = CheckGpt(fd.get(), kBlock, kBlocks);
      ASSERT_TRUE(seen.ok());
      EXPECT_TRUE((seen->primaryHeaderCrc && seen->primaryTableCrc) || (seen->backupHeaderCrc && seen->backupTableCrc))
          << "writes landed as " << landed << " (- none, t torn, = whole)";
    }
    flushed = last + 1;
  }
  ASSERT_TRUE(WriteGptWithBackup(fd.get(), kBlock, kBlocks, grown).ok());
  EXPECT_TRUE(CheckGpt(fd.get(), kBlock, kBlocks)->valid());
}

}  // namespace
}  // namespace vtr::testing
