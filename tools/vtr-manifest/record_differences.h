// What differs between a manifest's record of an item and the item on disk,
// key by key with both values, as `compare` reports it.
#ifndef VTR_TOOLS_VTR_MANIFEST_RECORD_DIFFERENCES_H_
#define VTR_TOOLS_VTR_MANIFEST_RECORD_DIFFERENCES_H_

#include <string>
#include <vector>

#include <nlohmann/json.hpp>

#include "model/file_metadata.h"

namespace vtr::manifest_tool {

struct Difference {
  std::string key;           // "type", "owner", "group", "mode", "size", "digest",
                             // "modification time", "link target", "xattrs"
  nlohmann::json expected;   // the manifest's value (null: none recorded)
  nlohmann::json found;      // the item's value on disk (null: none)
};

// The keys that differ, in the order above. Size and digest count only for
// regular files, the link target only for links; owner and group are
// "NAME (ID)" (or the id alone when no name is recorded), the mode four
// octal digits, the modification time ISO 8601 with microseconds (compared
// to the whole second when the manifest holds whole seconds, as XML does), the
// digest lowercase hex, xattrs the sorted list of extended-attribute names
// (the one that differs from device to device by design left out); an
// attribute whose value alone changed shows as "xattr NAME" with the values
// in hex.
std::vector<Difference> DifferencesBetween(const VTRFileMetadata& expected, const VTRFileMetadata& found);

// A difference's value on one line: strings as they are (escaped), lists
// joined by ",", null as "none".
std::string ValueText(const nlohmann::json& value);

}  // namespace vtr::manifest_tool

#endif  // VTR_TOOLS_VTR_MANIFEST_RECORD_DIFFERENCES_H_
