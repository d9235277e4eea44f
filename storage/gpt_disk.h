// The GPT of the boot disk as the data-partition resize reads and writes it:
// the 92-byte header at block 1, the eight-entry table at block 2, and the
// backup table and header at the end of the disk. Nothing sits between the
// disk and its table on Linux, so a write recomputes both CRCs and rewrites
// the backup copy, and the kernel (which keeps its own idea of the
// partitions, registered with BLKPG) is told of the change.
#ifndef VTR_STORAGE_GPT_DISK_H_
#define VTR_STORAGE_GPT_DISK_H_

#include <array>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "platform/result.h"
#include "storage/gpt_layout.h"

namespace vtr {

// Offsets of the header fields the write maintains.
inline constexpr size_t kGptHeaderSizeOffset = 12;       // u32
inline constexpr size_t kGptHeaderCrcOffset = 16;        // u32
inline constexpr size_t kGptMyLbaOffset = 24;            // u64
inline constexpr size_t kGptAlternateLbaOffset = 32;     // u64
inline constexpr size_t kGptDiskGuidOffset = 56;         // 16 bytes
inline constexpr size_t kGptEntriesLbaOffset = 72;       // u64
inline constexpr size_t kGptEntrySizeOffset = 84;        // u32
inline constexpr size_t kGptEntriesCrcOffset = 88;       // u32
// The MBR's disk-signature field, which holds "nraZ" on a managed disk.
inline constexpr size_t kMbrSignatureOffset = 440;
inline constexpr uint32_t kZarnMbrSignature = 0x5A61726E;

struct GptImage {
  std::array<uint8_t, kGptHeaderSize> header{};
  std::array<uint8_t, kGptTableSize> table{};

  uint32_t entryCount() const;
  uint64_t firstUsableLba() const;
  uint64_t lastUsableLba() const;
  uint64_t alternateLba() const;
  // First and last LBA of entry i.
  uint64_t firstLba(uint32_t i) const;
  uint64_t lastLba(uint32_t i) const;
  // The table position of the last of the header's entries whose 72-byte
  // name is name (ASCII, as UTF-16 code units, zero-filled), or -1.
  int positionOf(std::string_view name) const;
  // Entry i's name as UTF-8, and its unique GUID as UUID text (the GPT
  // keeps the first three fields little-endian).
  std::string nameOf(uint32_t i) const;
  std::string uuidOf(uint32_t i) const;
};

// Whether the MBR (the disk's first block) carries the Zarn signature;
// EIO when the block cannot be read whole.
Result<bool> ReadZarnSignature(int fd, uint32_t blockSize);

// The GPT header (block 1) and the eight-entry table (block 2) of the disk
// open as fd; EIO when the two blocks cannot be read whole.
Result<GptImage> ReadGptImage(int fd, uint32_t blockSize);

// One write of a table update: bytes at a byte offset of the disk, and
// whether the disk is flushed after it (a write barrier).
struct GptWrite {
  uint64_t offset = 0;
  std::vector<uint8_t> bytes;
  bool flushAfter = false;
};

// The writes that put image on a disk of blockCount blocks of blockSize
// bytes, in the order they must reach it: the header and the table get both
// CRCs recomputed; the backup copy (table right after the last usable
// block, header in the last block) is written first and flushed, then the
// primary (table at block 2, header at block 1) and flushed. Within a copy
// the table goes before the header whose CRC covers it, so the header is
// the copy's commit. Readers take the primary copy while it is valid and
// fall back to the backup: whatever prefix of these writes reaches the disk
// (a power cut), one copy is whole, the old one or the new. EINVAL when the
// header's alternate LBA is not the disk's last block or the usable range
// leaves no room for the backup table.
Result<std::vector<GptWrite>> PlanGptWrites(uint32_t blockSize, uint64_t blockCount, const GptImage& image);

// Makes PlanGptWrites' writes on the disk open as fd, flushing (fsync)
// where they say.
Status WriteGptWithBackup(int fd, uint32_t blockSize, uint64_t blockCount, const GptImage& image);

// What a reader finds checking both copies of a GPT. The backup is read at
// the primary header's alternate LBA, or in the disk's last block when the
// primary header is not valid (as the kernel and sgdisk look for it).
struct GptValidity {
  bool primaryHeaderCrc = false;
  bool primaryTableCrc = false;
  bool backupHeaderCrc = false;
  bool backupTableCrc = false;
  // The backup's table equals the primary's, and its header mirrors it.
  bool copiesAgree = false;
  bool valid() const { return primaryHeaderCrc && primaryTableCrc && backupHeaderCrc && backupTableCrc && copiesAgree; }
};
Result<GptValidity> CheckGpt(int fd, uint32_t blockSize, uint64_t blockCount);

// Tells the kernel that partition number (1-based: the table position + 1)
// of the whole disk open as fd spans length bytes from start: resized, or
// added when isNew. A regular file (a disk image) has no kernel partitions:
// nothing is done.
Status TellKernelPartition(int fd, int number, uint64_t startBytes, uint64_t lengthBytes, bool isNew);

}  // namespace vtr

#endif  // VTR_STORAGE_GPT_DISK_H_
