// ClientPathResolver: the one way a path sent by a client, or one of the
// helper's own fixed paths, becomes something the helper acts on.
//
// Text first: an empty path, a NUL byte, a relative path and ".." are
// refused, "/var" is read as "/private/var", and a client path must lie in a
// client area, outside the closed trees (see client_areas.h). Then the file
// system: directories are opened from the helper's root one component at a
// time with O_NOFOLLOW, so no link at any position (a trailing slash
// included: it is dropped, never a reason to follow) is followed. Commands
// act only on the descriptors opened here, never on the text again.
//
// A refusal is an Error whose message says why; the caller logs one line
// with LogRefusal and answers NO. Thread-safe; immutable after construction.
#ifndef VTR_VITD_HELPER_CLIENT_PATH_RESOLVER_H_
#define VTR_VITD_HELPER_CLIENT_PATH_RESOLVER_H_

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/result.h"
#include "platform/unique_fd.h"
#include "vitd_helper/client_areas.h"

namespace vtr {

// What a command does with a client path.
enum class ClientUse {
  // Walked read-only; closed trees below it are passed over by the walk, so
  // an area itself may be named.
  kScan,
  // Changed, removed, moved, linked or handed to mobile together with all
  // below it: it must lie strictly inside an area and hold no closed tree.
  kChange,
};

// A path whose text passed the checks.
struct CheckedPath {
  std::string path;                     // normalised, e.g. "/private/var/x"
  std::vector<std::string> components;  // never empty
  const std::string& name() const { return components.back(); }
};

class ClientPathResolver {
 public:
  // Resolves beneath root, the helper's "/" (a test's own directory).
  ClientPathResolver(ClientAreas areas, std::shared_ptr<const UniqueFd> root);

  // The text checks of a client path for use (see above).
  Result<CheckedPath> check(std::string_view clientPath, ClientUse use) const;
  // The text checks of one of the helper's own paths: no area rules.
  static Result<CheckedPath> CheckFixed(std::string_view path);

  // The directory holding path, opened without following links. With
  // create, missing directories on the way are made (mode 0777 less umask).
  Result<UniqueFd> openParent(const CheckedPath& path, bool create = false) const;
  // path itself as a directory (a link or non-directory there: ELOOP / ENOTDIR).
  Result<UniqueFd> openDirectory(const CheckedPath& path, bool create = false) const;

  // The closed trees at or below path, in path's own spelling: spelled is
  // how the caller names path (a walk's item paths begin with it).
  std::vector<std::string> closedTreesWithin(const CheckedPath& path, std::string_view spelled) const;

  const ClientAreas& areas() const { return areas_; }
  int root() const { return root_->get(); }
  const std::shared_ptr<const UniqueFd>& rootDirectory() const { return root_; }

 private:
  ClientAreas areas_;
  std::shared_ptr<const UniqueFd> root_;
};

// Logs the one line of a refused path: "Refused path %@: %@".
void LogRefusal(std::string_view path, const Error& why);

}  // namespace vtr

#endif  // VTR_VITD_HELPER_CLIENT_PATH_RESOLVER_H_
