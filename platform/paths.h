// Path strings as the system joins and splits them: plain text operations,
// no file-system access.
#ifndef VTR_PLATFORM_PATHS_H_
#define VTR_PLATFORM_PATHS_H_

#include <string>
#include <string_view>

namespace vtr {

// base joined with component by exactly one "/": trailing slashes of base
// and leading slashes of component are dropped first ("/a/" + "b" is "/a/b",
// "/" + "b" is "/b", "" + "b" is "b"). An empty component gives base without
// its trailing slashes.
std::string AppendPathComponent(std::string_view base, std::string_view component);

// The text after the last "/" (trailing slashes ignored); "/" for "/".
std::string LastPathComponent(std::string_view path);

// True when text starts with prefix.
inline bool HasPrefix(std::string_view text, std::string_view prefix) { return text.substr(0, prefix.size()) == prefix; }

}  // namespace vtr

#endif  // VTR_PLATFORM_PATHS_H_
