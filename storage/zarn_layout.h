// The on-disk layout of the Zarn volume manager's header: a 4096-byte,
// little-endian record at byte 0 of the medium (main copy) and in the last
// block of chunk 0 (backup copy). It names the medium, lists up to eight
// partitions and maps each fixed-size chunk of the medium to a partition.
//
//   offset  width  field
//        0     16  header type identifier (kZarnTypeWithCrc or kZarnTypeWithoutCrc)
//       16     16  media identity (random UUID)
//       32      8  media size in bytes
//       40      4  partition count, 0..8
//       44      4  CRC-32 of the 4096 bytes taken with this field zero
//       48      8  header flags (bit 0 is exported)
//      512  8x128  partition entries (shape of a GPT partition entry)
//     2048 1024x2  chunk map, one u16 per chunk of the medium
// Every other byte is zero in a fresh header.
//
// ZarnHeaderView / ZarnHeaderEditor and ZarnEntryView / ZarnEntryEditor read
// and write the fields of a borrowed buffer; they own nothing and hold no
// state, so any number may look at the same bytes from one thread.
#ifndef VTR_STORAGE_ZARN_LAYOUT_H_
#define VTR_STORAGE_ZARN_LAYOUT_H_

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdint>
#include <span>
#include <string_view>
#include <type_traits>

#include "platform/little_endian.h"

namespace vtr {

using ZarnUuid = std::array<uint8_t, 16>;

inline constexpr size_t kZarnHeaderSize = 4096;
inline constexpr size_t kZarnTypeOffset = 0;
inline constexpr size_t kZarnMediaIdentityOffset = 16;
inline constexpr size_t kZarnMediaSizeOffset = 32;
inline constexpr size_t kZarnPartitionCountOffset = 40;
inline constexpr size_t kZarnCrcOffset = 44;
inline constexpr size_t kZarnFlagsOffset = 48;
inline constexpr size_t kZarnEntriesOffset = 512;
inline constexpr size_t kZarnChunkMapOffset = 2048;

inline constexpr uint32_t kZarnMaxPartitions = 8;
inline constexpr uint32_t kZarnChunkMapSlots = 1024;

// Partition entry (also the shape of a GPT partition entry).
inline constexpr size_t kZarnEntrySize = 128;
inline constexpr size_t kZarnEntryTypeOffset = 0;
inline constexpr size_t kZarnEntryIdentityOffset = 16;
inline constexpr size_t kZarnEntryBeginOffset = 32;
inline constexpr size_t kZarnEntryEndOffset = 40;
inline constexpr size_t kZarnEntryAttributesOffset = 48;
inline constexpr size_t kZarnEntryNameOffset = 56;
inline constexpr size_t kZarnEntryNameSize = 72;  // 36 UTF-16LE code units
// Attribute bit that the export reports as flag bit 0.
inline constexpr uint64_t kZarnEntryExportedAttribute = uint64_t{1} << 48;

// The two header kinds, as stored at offset 0.
inline constexpr ZarnUuid kZarnTypeWithCrc = {0x6a, 0x90, 0x88, 0xcf, 0x8a, 0xfd, 0x63, 0x0a,
                                              0xe3, 0x51, 0xe2, 0x48, 0x87, 0xe0, 0xb9, 0x8b};
inline constexpr ZarnUuid kZarnTypeWithoutCrc = {0xb1, 0x89, 0xa5, 0x19, 0x4f, 0x59, 0x4b, 0x1d,
                                                 0xad, 0x44, 0x1e, 0x12, 0x7a, 0xaf, 0x45, 0x39};
// HFS Plus partition type, deliberately in UUID string order (48465300-0000-
// 11aa-aa11-00306543ecac), not in the mixed-endian order GPT tools use: the
// volume manager below the disk compares these bytes as they are.
inline constexpr ZarnUuid kZarnHfsPlusType = {0x48, 0x46, 0x53, 0x00, 0x00, 0x00, 0x11, 0xaa,
                                              0xaa, 0x11, 0x00, 0x30, 0x65, 0x43, 0xec, 0xac};

// Chunk map values. Any other value is (partition << 12) | chunk offset, the
// offset in the low ten bits and bits 10 and 11 zero.
inline constexpr uint16_t kZarnChunkReserved = 0xF000;  // chunk 0: the header copies
inline constexpr uint16_t kZarnChunkFree = 0xF111;      // on the medium, unused
inline constexpr uint16_t kZarnChunkInvalid = 0xF3FF;   // beyond the medium's chunks
inline constexpr uint16_t kZarnChunkOffsetMask = 0x3FF;
inline constexpr unsigned kZarnChunkPartitionShift = 12;

// Fields of one 128-byte partition entry. Byte is uint8_t (editable) or
// const uint8_t (read-only).
template <typename Byte>
class ZarnEntryAccess {
 public:
  explicit ZarnEntryAccess(std::span<Byte, kZarnEntrySize> bytes) : bytes_(bytes) {}
  // An editor also serves as a view.
  template <typename Editable>
    requires(std::is_const_v<Byte> && std::is_same_v<Editable, uint8_t>)
  ZarnEntryAccess(const ZarnEntryAccess<Editable>& editor) : bytes_(editor.bytes()) {}  // NOLINT: implicit

  std::span<Byte, kZarnEntrySize> bytes() const { return bytes_; }

  std::span<const uint8_t, 16> type() const { return bytes_.template subspan<kZarnEntryTypeOffset, 16>(); }
  std::span<const uint8_t, 16> identity() const { return bytes_.template subspan<kZarnEntryIdentityOffset, 16>(); }
  uint64_t begin() const { return LoadU64(&bytes_[kZarnEntryBeginOffset]); }
  uint64_t end() const { return LoadU64(&bytes_[kZarnEntryEndOffset]); }
  uint64_t attributes() const { return LoadU64(&bytes_[kZarnEntryAttributesOffset]); }
  std::span<const uint8_t, kZarnEntryNameSize> name() const {
    return bytes_.template subspan<kZarnEntryNameOffset, kZarnEntryNameSize>();
  }
  bool typeIsZero() const { return IsZero(type()); }
  bool identityIsZero() const { return IsZero(identity()); }
  bool isEmpty() const { return typeIsZero() && identityIsZero() && begin() == 0 && end() == 0; }

  void setType(const ZarnUuid& type) requires(!std::is_const_v<Byte>) { Copy(type, kZarnEntryTypeOffset); }
  void setIdentity(const ZarnUuid& id) requires(!std::is_const_v<Byte>) { Copy(id, kZarnEntryIdentityOffset); }
  void setBegin(uint64_t v) requires(!std::is_const_v<Byte>) { StoreU64(&bytes_[kZarnEntryBeginOffset], v); }
  void setEnd(uint64_t v) requires(!std::is_const_v<Byte>) { StoreU64(&bytes_[kZarnEntryEndOffset], v); }
  void setAttributes(uint64_t v) requires(!std::is_const_v<Byte>) {
    StoreU64(&bytes_[kZarnEntryAttributesOffset], v);
  }
  // Stores the ASCII text as UTF-16LE code units, the rest of the field zero.
  void setAsciiName(std::string_view text) requires(!std::is_const_v<Byte>) {
    std::fill_n(&bytes_[kZarnEntryNameOffset], kZarnEntryNameSize, uint8_t{0});
    for (size_t i = 0; i < text.size() && i < kZarnEntryNameSize / 2; ++i) {
      StoreU16(&bytes_[kZarnEntryNameOffset + 2 * i], static_cast<uint8_t>(text[i]));
    }
  }
  void clear() requires(!std::is_const_v<Byte>) { std::fill(bytes_.begin(), bytes_.end(), uint8_t{0}); }

 private:
  static bool IsZero(std::span<const uint8_t, 16> bytes) {
    return std::all_of(bytes.begin(), bytes.end(), [](uint8_t b) { return b == 0; });
  }
  void Copy(const ZarnUuid& id, size_t offset) { std::copy(id.begin(), id.end(), &bytes_[offset]); }

  std::span<Byte, kZarnEntrySize> bytes_;
};
using ZarnEntryView = ZarnEntryAccess<const uint8_t>;
using ZarnEntryEditor = ZarnEntryAccess<uint8_t>;

// Fields of one 4096-byte header.
template <typename Byte>
class ZarnHeaderAccess {
 public:
  explicit ZarnHeaderAccess(std::span<Byte, kZarnHeaderSize> bytes) : bytes_(bytes) {}
  // header must point at kZarnHeaderSize bytes.
  explicit ZarnHeaderAccess(Byte* header) : bytes_(header, kZarnHeaderSize) {}
  // An editor also serves as a view.
  template <typename Editable>
    requires(std::is_const_v<Byte> && std::is_same_v<Editable, uint8_t>)
  ZarnHeaderAccess(const ZarnHeaderAccess<Editable>& editor) : bytes_(editor.bytes()) {}  // NOLINT: implicit

  std::span<Byte, kZarnHeaderSize> bytes() const { return bytes_; }

  std::span<const uint8_t, 16> type() const { return bytes_.template subspan<kZarnTypeOffset, 16>(); }
  bool hasType(const ZarnUuid& kind) const { return std::equal(kind.begin(), kind.end(), type().begin()); }
  // True for either of the two header kinds.
  bool hasKnownType() const { return hasType(kZarnTypeWithCrc) || hasType(kZarnTypeWithoutCrc); }
  std::span<const uint8_t, 16> mediaIdentity() const {
    return bytes_.template subspan<kZarnMediaIdentityOffset, 16>();
  }
  uint64_t mediaSize() const { return LoadU64(&bytes_[kZarnMediaSizeOffset]); }
  uint32_t partitionCount() const { return LoadU32(&bytes_[kZarnPartitionCountOffset]); }
  uint32_t crc() const { return LoadU32(&bytes_[kZarnCrcOffset]); }
  uint64_t flags() const { return LoadU64(&bytes_[kZarnFlagsOffset]); }
  // Entry i, i < kZarnMaxPartitions.
  ZarnEntryAccess<Byte> entry(uint32_t i) const {
    return ZarnEntryAccess<Byte>(
        bytes_.subspan(kZarnEntriesOffset + size_t{i} * kZarnEntrySize).template first<kZarnEntrySize>());
  }
  // Map slot s, s < kZarnChunkMapSlots.
  uint16_t chunk(uint32_t s) const { return LoadU16(&bytes_[kZarnChunkMapOffset + 2 * size_t{s}]); }

  void setType(const ZarnUuid& kind) requires(!std::is_const_v<Byte>) { Copy(kind, kZarnTypeOffset); }
  void setMediaIdentity(const ZarnUuid& id) requires(!std::is_const_v<Byte>) {
    Copy(id, kZarnMediaIdentityOffset);
  }
  void setMediaSize(uint64_t v) requires(!std::is_const_v<Byte>) { StoreU64(&bytes_[kZarnMediaSizeOffset], v); }
  void setPartitionCount(uint32_t v) requires(!std::is_const_v<Byte>) {
    StoreU32(&bytes_[kZarnPartitionCountOffset], v);
  }
  void setCrc(uint32_t v) requires(!std::is_const_v<Byte>) { StoreU32(&bytes_[kZarnCrcOffset], v); }
  void setFlags(uint64_t v) requires(!std::is_const_v<Byte>) { StoreU64(&bytes_[kZarnFlagsOffset], v); }
  void setChunk(uint32_t s, uint16_t v) requires(!std::is_const_v<Byte>) {
    StoreU16(&bytes_[kZarnChunkMapOffset + 2 * size_t{s}], v);
  }

 private:
  void Copy(const ZarnUuid& id, size_t offset) { std::copy(id.begin(), id.end(), &bytes_[offset]); }

  std::span<Byte, kZarnHeaderSize> bytes_;
};
using ZarnHeaderView = ZarnHeaderAccess<const uint8_t>;
using ZarnHeaderEditor = ZarnHeaderAccess<uint8_t>;

}  // namespace vtr

#endif  // VTR_STORAGE_ZARN_LAYOUT_H_
