// Text pieces shared by zarnutil's reports.
#ifndef VTR_TOOLS_ZARNUTIL_REPORT_FORMAT_H_
#define VTR_TOOLS_ZARNUTIL_REPORT_FORMAT_H_

#include <cstdint>
#include <span>
#include <string>

#include "storage/zarn_layout.h"

namespace vtr {

// The 16 bytes as lower-case UUID text, in the order stored.
std::string UuidText(std::span<const uint8_t, 16> bytes);

// A partition entry's UTF-16LE name as UTF-8 (converted as the export does).
std::string EntryName(const ZarnEntryView& entry);

// "0x" and value in hexadecimal, zero-padded to digits.
std::string Hex(uint64_t value, int digits);

// A byte count for people: "16 MiB", "1.5 GiB", "512 bytes".
std::string HumanSize(uint64_t bytes);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_REPORT_FORMAT_H_
