// Manifest entries as people and programs read them.
#ifndef VTR_TOOLS_VTR_MANIFEST_MANIFEST_RENDER_H_
#define VTR_TOOLS_VTR_MANIFEST_MANIFEST_RENDER_H_

#include <string>
#include <string_view>

#include <nlohmann/json.hpp>

#include "platform/value.h"

namespace vtr::manifest_tool {

// One line for an entry (no newline), fields separated by spaces:
//   TYPE MODE OWNER:GROUP SIZE SHA1 PATH[ -> TARGET][ xattrs=NAME,NAME...]
// TYPE is a letter as ls shows it ('-' file, 'd', 'l', 'c', 'b', 's', '?'),
// MODE four octal digits, OWNER and GROUP names where the record has them,
// else ids; SHA1 lowercase hex. A part the record lacks is shown as "-".
// Bytes of the path, target and names that are not printable or not UTF-8
// are written as \xNN (and a backslash as \\), so that every entry takes
// one line.
std::string RecordLine(std::string_view path, const Value& record);

// A value as JSON: dictionaries as objects, arrays as arrays, data as a
// lowercase hex string, dates as "YYYY-MM-DDTHH:MM:SSZ", nil as null.
nlohmann::json ToJson(const Value& value);

// text with backslashes, control bytes and bytes that are not part of valid
// UTF-8 escaped (\\, \xNN), so that it stays on one line and shows every
// byte of a name faithfully.
std::string EscapedText(std::string_view text);

// Lowercase hex of bytes.
std::string Hex(const Bytes& bytes);

}  // namespace vtr::manifest_tool

#endif  // VTR_TOOLS_VTR_MANIFEST_MANIFEST_RENDER_H_
