// The fields of a GPT header and partition table that the volume manager's
// re-packing and the data partition resize use. Little-endian, at the
// standard offsets; the Zarn medium's table holds eight 128-byte entries.
#ifndef VTR_STORAGE_GPT_LAYOUT_H_
#define VTR_STORAGE_GPT_LAYOUT_H_

#include <cstddef>

namespace vtr {

inline constexpr size_t kGptHeaderSize = 92;
inline constexpr size_t kGptFirstUsableLbaOffset = 40;   // u64
inline constexpr size_t kGptLastUsableLbaOffset = 48;    // u64
inline constexpr size_t kGptEntryCountOffset = 80;       // u32

inline constexpr size_t kGptTableEntries = 8;
inline constexpr size_t kGptEntrySize = 128;
inline constexpr size_t kGptTableSize = kGptTableEntries * kGptEntrySize;
// An entry has the shape of a Zarn partition entry (ZarnEntryAccess in
// storage/zarn_layout.h): its begin and end fields are the first and last
// (inclusive) LBA.

}  // namespace vtr

#endif  // VTR_STORAGE_GPT_LAYOUT_H_
