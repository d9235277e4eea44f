// ClientAreas: where the paths a client sends may lie.
//
// The helper serves a client that may be compromised; whatever it names must
// lie in one of the client areas and outside the closed trees inside them.
// The areas come from the root-owned file /etc/vitd/helper.conf (inside the
// sandbox root under --root), one directive a line:
//
//   # comment
//   area   /private/var          a tree client paths may lie in
//   closed /private/var/root     a tree inside an area that stays closed
//
// Without the file the defaults hold: area /private/var, closed
// /private/var/root. The helper's own log folder /private/var/logs/vitd is
// closed whatever the file says. Paths in the file are absolute; "/var" is
// read as "/private/var", as in client paths.
//
// Immutable once made; safe to share between threads.
#ifndef VTR_VITD_HELPER_CLIENT_AREAS_H_
#define VTR_VITD_HELPER_CLIENT_AREAS_H_

#include <string>
#include <string_view>
#include <vector>

#include "platform/result.h"

namespace vtr {

inline constexpr char kClientAreasFile[] = "/etc/vitd/helper.conf";
inline constexpr char kHelperLogFolder[] = "/private/var/logs/vitd";

struct ClientAreas {
  std::vector<std::string> areas;   // normalised absolute paths
  std::vector<std::string> closed;  // normalised, each inside an area

  static ClientAreas Defaults();

  // The areas a helper.conf text names. An Error (its message naming the
  // line) for an unknown directive, a directive without exactly one path, a
  // path that is not absolute or holds "..", a closed tree outside every
  // area, or a text that names no area.
  static Result<ClientAreas> Parse(std::string_view text);

  // Reads the file at path beneath rootFd (no link followed): absent gives
  // the defaults. An Error when it cannot be read, when it or its folder is
  // not a root-owned file (directory) that group and others cannot write, or
  // when Parse refuses it. The helper refuses to start on an Error.
  static Result<ClientAreas> Load(int rootFd, const std::string& path = kClientAreasFile);
};

// Normalised text of a path as the helper reads client paths: components as
// SplitPathComponents gives them, a leading "var" read as "private/var".
// An Error (EINVAL, saying why) where SplitPathComponents refuses.
Result<std::vector<std::string>> ClientPathComponents(std::string_view path);

// True when path is tree or lies beneath it (both normalised).
bool PathIsWithin(std::string_view path, std::string_view tree);

}  // namespace vtr

#endif  // VTR_VITD_HELPER_CLIENT_AREAS_H_
