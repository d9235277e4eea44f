// Text pieces shared by zarnutil's reports.
#ifndef VTR_TOOLS_ZARNUTIL_REPORT_FORMAT_H_
#define VTR_TOOLS_ZARNUTIL_REPORT_FORMAT_H_

#include <nlohmann/json.hpp>

#include <cstdint>
#include <span>
#include <string>
#include <string_view>

#include "storage/zarn_layout.h"

namespace vtr {

// The 16 bytes as lower-case UUID text, in the order stored.
std::string UuidText(std::span<const uint8_t, 16> bytes);

// A partition entry's UTF-16LE name as UTF-8 (converted as the export does).
std::string EntryName(const ZarnEntryView& entry);

// "0x" and value in hexadecimal, zero-padded to digits.
std::string Hex(uint64_t value, int digits);

// The reports' JSON: members in the order they are added.
using Json = nlohmann::ordered_json;

// value as one line of compact JSON and a newline; bytes that are not
// well-formed UTF-8 become U+FFFD, so the result is always valid JSON.
std::string JsonLine(const Json& value);

// text as a quoted JSON string (quotes, backslashes and control characters
// escaped, bad UTF-8 replaced as above): safe to print on a terminal.
std::string JsonQuote(std::string_view text);

// A byte count for people: "16 MiB", "1.5 GiB", "512 bytes".
std::string HumanSize(uint64_t bytes);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_REPORT_FORMAT_H_
