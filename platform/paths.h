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

// path split at its last "/": the folder before it ("/" when the slash is
// the first character, "." when there is none) and the name after it (""
// when path ends in "/"). "a/b" gives "a" and "b", "/b" gives "/" and "b".
struct PathParts {
  std::string parent;
  std::string name;
};
PathParts SplitLastComponent(std::string_view path);

// True when text starts with prefix.
inline bool HasPrefix(std::string_view text, std::string_view prefix) { return text.substr(0, prefix.size()) == prefix; }

}  // namespace vtr

#endif  // VTR_PLATFORM_PATHS_H_
