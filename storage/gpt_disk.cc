#include "storage/gpt_disk.h"

#include <linux/blkpg.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <uuid/uuid.h>
#include <zlib.h>

#include <algorithm>
#include <array>
#include <cstring>
#include <vector>

#include "platform/little_endian.h"
#include "storage/utf16.h"
#include "storage/zarn_layout.h"

namespace vtr {
namespace {

uint32_t Crc(const uint8_t* bytes, size_t size) {
  return static_cast<uint32_t>(::crc32(0L, bytes, static_cast<uInt>(size)));
}

// The header's CRC over its own size, the CRC field taken as zero.
uint32_t HeaderCrc(std::vector<uint8_t> header) {
  const uint32_t size = std::min<uint32_t>(LoadU32(&header[kGptHeaderSizeOffset]), header.size());
  StoreU32(&header[kGptHeaderCrcOffset], 0);
  return Crc(header.data(), size);
}

Status WriteAt(int fd, const std::vector<uint8_t>& bytes, uint64_t offset) {
  const ssize_t n = ::pwrite(fd, bytes.data(), bytes.size(), static_cast<off_t>(offset));
  if (n < 0) return Error::FromErrno("pwrite");
  if (static_cast<size_t>(n) != bytes.size()) return Error(EIO, "short write");
  return Status::Ok();
}

Result<std::vector<uint8_t>> ReadAt(int fd, size_t size, uint64_t offset) {
  std::vector<uint8_t> bytes(size);
  const ssize_t n = ::pread(fd, bytes.data(), size, static_cast<off_t>(offset));
  if (n < 0) return Error::FromErrno("pread");
  if (static_cast<size_t>(n) != size) return Error(EIO, "short read");
  return bytes;
}

// Blocks holding count entries of entrySize bytes.
uint64_t TableBlocks(uint64_t count, uint64_t entrySize, uint32_t blockSize) {
  return (count * entrySize + blockSize - 1) / blockSize;
}

}  // namespace

uint32_t GptImage::entryCount() const { return LoadU32(&header[kGptEntryCountOffset]); }
uint64_t GptImage::firstUsableLba() const { return LoadU64(&header[kGptFirstUsableLbaOffset]); }
uint64_t GptImage::lastUsableLba() const { return LoadU64(&header[kGptLastUsableLbaOffset]); }
uint64_t GptImage::alternateLba() const { return LoadU64(&header[kGptAlternateLbaOffset]); }
uint64_t GptImage::firstLba(uint32_t i) const { return LoadU64(&table[i * kGptEntrySize + kZarnEntryBeginOffset]); }
uint64_t GptImage::lastLba(uint32_t i) const { return LoadU64(&table[i * kGptEntrySize + kZarnEntryEndOffset]); }

int GptImage::positionOf(std::string_view name) const {
  std::array<uint8_t, kZarnEntryNameSize> wanted{};
  for (size_t i = 0; i < name.size() && 2 * i + 1 < wanted.size(); ++i) wanted[2 * i] = static_cast<uint8_t>(name[i]);
  int found = -1;
  for (uint32_t i = 0; i < std::min<uint32_t>(entryCount(), kGptTableEntries); ++i) {
    if (std::memcmp(&table[i * kGptEntrySize + kZarnEntryNameOffset], wanted.data(), wanted.size()) == 0) {
      found = static_cast<int>(i);
    }
  }
  return found;
}

std::string GptImage::nameOf(uint32_t i) const {
  uint8_t text[3 * kZarnEntryNameSize];
  size_t length = 0;
  utf_encodestr2(&table[i * kGptEntrySize + kZarnEntryNameOffset], kZarnEntryNameSize, text, &length, sizeof text);
  return std::string(reinterpret_cast<const char*>(text), length);
}

std::string GptImage::uuidOf(uint32_t i) const {
  const uint8_t* id = &table[i * kGptEntrySize + kZarnEntryIdentityOffset];
  static constexpr int kOrder[16] = {3, 2, 1, 0, 5, 4, 7, 6, 8, 9, 10, 11, 12, 13, 14, 15};
  uuid_t uuid;
  for (int k = 0; k < 16; ++k) uuid[k] = id[kOrder[k]];
  char text[37];
  uuid_unparse(uuid, text);
  return text;
}

Result<bool> ReadZarnSignature(int fd, uint32_t blockSize) {
  Result<std::vector<uint8_t>> mbr = ReadAt(fd, std::max<size_t>(blockSize, kMbrSignatureOffset + 4), 0);
  if (!mbr.ok()) return mbr.error();
  return LoadU32(&(*mbr)[kMbrSignatureOffset]) == kZarnMbrSignature;
}

Result<GptImage> ReadGptImage(int fd, uint32_t blockSize) {
  Result<std::vector<uint8_t>> blocks = ReadAt(fd, size_t{2} * std::max<size_t>(blockSize, kGptTableSize), blockSize);
  if (!blocks.ok()) return blocks.error();
  GptImage image;
  std::copy_n(blocks->begin(), kGptHeaderSize, image.header.begin());
  std::copy_n(blocks->begin() + blockSize, kGptTableSize, image.table.begin());
  return image;
}

Result<std::vector<GptWrite>> PlanGptWrites(uint32_t blockSize, uint64_t blockCount, const GptImage& image) {
  const uint64_t lastLba = blockCount - 1;
  const uint32_t count = image.entryCount();
  const uint32_t entrySize = LoadU32(&image.header[kGptEntrySizeOffset]);
  if (blockSize < kGptTableSize || count > kGptTableEntries || entrySize != kGptEntrySize) {
    return Error(EINVAL, "not a table of at most eight 128-byte entries");
  }
  const uint64_t backupTableLba = image.lastUsableLba() + 1;
  if (image.alternateLba() != lastLba || backupTableLba + TableBlocks(count, entrySize, blockSize) > lastLba) {
    return Error(EINVAL, "the backup header is not in the disk's last block or has no room for its table");
  }

  // The table in a block of its own, zero after its entries; its CRC covers
  // the header's entry count.
  std::vector<uint8_t> table(blockSize, 0);
  std::copy(image.table.begin(), image.table.end(), table.begin());
  const uint32_t tableCrc = Crc(table.data(), size_t{count} * entrySize);

  std::vector<uint8_t> primary(image.header.begin(), image.header.end());
  StoreU32(&primary[kGptHeaderSizeOffset], kGptHeaderSize);
  StoreU64(&primary[kGptMyLbaOffset], 1);
  StoreU64(&primary[kGptAlternateLbaOffset], lastLba);
  StoreU64(&primary[kGptEntriesLbaOffset], 2);
  StoreU32(&primary[kGptEntriesCrcOffset], tableCrc);
  StoreU32(&primary[kGptHeaderCrcOffset], HeaderCrc(primary));

  std::vector<uint8_t> backup = primary;
  StoreU64(&backup[kGptMyLbaOffset], lastLba);
  StoreU64(&backup[kGptAlternateLbaOffset], 1);
  StoreU64(&backup[kGptEntriesLbaOffset], backupTableLba);
  StoreU32(&backup[kGptHeaderCrcOffset], HeaderCrc(backup));

  auto inBlock = [blockSize](const std::vector<uint8_t>& header) {
    std::vector<uint8_t> block(blockSize, 0);
    std::copy(header.begin(), header.end(), block.begin());
    return block;
  };
  std::vector<GptWrite> writes;
  writes.push_back({backupTableLba * blockSize, table, false});
  writes.push_back({lastLba * blockSize, inBlock(backup), true});
  writes.push_back({uint64_t{2} * blockSize, table, false});
  writes.push_back({blockSize, inBlock(primary), true});
  return writes;
}

Status WriteGptWithBackup(int fd, uint32_t blockSize, uint64_t blockCount, const GptImage& image) {
  Result<std::vector<GptWrite>> writes = PlanGptWrites(blockSize, blockCount, image);
  if (!writes.ok()) return writes.error();
  for (const GptWrite& write : *writes) {
    if (Status s = WriteAt(fd, write.bytes, write.offset); !s.ok()) return s;
    if (write.flushAfter && ::fsync(fd) != 0) return Error::FromErrno("fsync");
  }
  return Status::Ok();
}

Result<GptValidity> CheckGpt(int fd, uint32_t blockSize, uint64_t blockCount) {
  GptValidity validity;
  struct Copy {
    std::vector<uint8_t> header;
    std::vector<uint8_t> table;
    bool headerCrc = false;
    bool tableCrc = false;
  };
  auto read = [&](uint64_t lba) -> Result<Copy> {
    Result<std::vector<uint8_t>> header = ReadAt(fd, kGptHeaderSize, lba * blockSize);
    if (!header.ok()) return header.error();
    Copy copy;
    copy.header = std::move(*header);
    copy.headerCrc = std::memcmp(copy.header.data(), "EFI PART", 8) == 0 &&
                     LoadU32(&copy.header[kGptHeaderSizeOffset]) == kGptHeaderSize &&
                     HeaderCrc(copy.header) == LoadU32(&copy.header[kGptHeaderCrcOffset]);
    const uint64_t count = LoadU32(&copy.header[kGptEntryCountOffset]);
    const uint64_t entrySize = LoadU32(&copy.header[kGptEntrySizeOffset]);
    const uint64_t tableLba = LoadU64(&copy.header[kGptEntriesLbaOffset]);
    if (count * entrySize > (uint64_t{1} << 20) || tableLba >= blockCount) return copy;  // nonsense: no table
    Result<std::vector<uint8_t>> table = ReadAt(fd, count * entrySize, tableLba * blockSize);
    if (!table.ok()) return table.error();
    copy.table = std::move(*table);
    copy.tableCrc = Crc(copy.table.data(), copy.table.size()) == LoadU32(&copy.header[kGptEntriesCrcOffset]);
    return copy;
  };
  Result<Copy> primary = read(1);
  if (!primary.ok()) return primary.error();
  validity.primaryHeaderCrc = primary->headerCrc;
  validity.primaryTableCrc = primary->tableCrc;
  // A torn or stale primary header points nowhere reliable: the backup is
  // then looked for where readers look for it, in the disk's last block.
  const uint64_t alternate =
      primary->headerCrc ? LoadU64(&primary->header[kGptAlternateLbaOffset]) : blockCount - 1;
  if (alternate == 0 || alternate >= blockCount) return validity;
  Result<Copy> backup = read(alternate);
  if (!backup.ok()) return backup.error();
  validity.backupHeaderCrc = backup->headerCrc;
  validity.backupTableCrc = backup->tableCrc;
  // The backup mirrors the primary: same fields but the two LBAs that
  // point at each other, its own table's place and its own CRC.
  std::vector<uint8_t> mirrored = backup->header;
  StoreU64(&mirrored[kGptMyLbaOffset], 1);
  StoreU64(&mirrored[kGptAlternateLbaOffset], alternate);
  StoreU64(&mirrored[kGptEntriesLbaOffset], LoadU64(&primary->header[kGptEntriesLbaOffset]));
  StoreU32(&mirrored[kGptHeaderCrcOffset], LoadU32(&primary->header[kGptHeaderCrcOffset]));
  validity.copiesAgree = backup->table == primary->table && mirrored == primary->header &&
                         LoadU64(&backup->header[kGptMyLbaOffset]) == alternate;
  return validity;
}

Status TellKernelPartition(int fd, int number, uint64_t startBytes, uint64_t lengthBytes, bool isNew) {
  struct stat st;
  if (::fstat(fd, &st) != 0) return Error::FromErrno("fstat");
  if (!S_ISBLK(st.st_mode)) return Status::Ok();
  struct blkpg_partition partition {};
  partition.start = static_cast<long long>(startBytes);
  partition.length = static_cast<long long>(lengthBytes);
  partition.pno = number;
  struct blkpg_ioctl_arg request {};
  request.op = isNew ? BLKPG_ADD_PARTITION : BLKPG_RESIZE_PARTITION;
  request.datalen = sizeof partition;
  request.data = &partition;
  if (::ioctl(fd, BLKPG, &request) != 0) return Error::FromErrno(isNew ? "BLKPG_ADD_PARTITION" : "BLKPG_RESIZE_PARTITION");
  return Status::Ok();
}

}  // namespace vtr
