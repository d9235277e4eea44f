#include "vitd_helper/client_path_resolver.h"

#include "model/log.h"
#include "platform/open_beneath.h"

namespace vtr {

ClientPathResolver::ClientPathResolver(ClientAreas areas, std::shared_ptr<const UniqueFd> root)
    : areas_(std::move(areas)), root_(std::move(root)) {}

Result<CheckedPath> ClientPathResolver::CheckFixed(std::string_view path) {
  Result<std::vector<std::string>> components = ClientPathComponents(path);
  if (!components.ok()) return components.error();
  if (components->empty()) return Error(EINVAL, "the root directory itself");
  std::string text = JoinPathComponents(*components, components->size());
  return CheckedPath{std::move(text), std::move(*components)};
}

Result<CheckedPath> ClientPathResolver::check(std::string_view clientPath, ClientUse use) const {
  Result<CheckedPath> checked = CheckFixed(clientPath);
  if (!checked.ok()) return checked;
  const std::string& path = checked->path;
  bool inArea = false;
  for (const std::string& area : areas_.areas) {
    if (!PathIsWithin(path, area)) continue;
    inArea = true;
    if (use == ClientUse::kChange && path == area) return Error(EPERM, "a client area itself cannot be changed");
  }
  if (!inArea) return Error(EPERM, "outside the client areas");
  for (const std::string& closed : areas_.closed) {
    if (PathIsWithin(path, closed)) return Error(EPERM, "inside the closed tree " + closed);
    if (use == ClientUse::kChange && PathIsWithin(closed, path)) return Error(EPERM, "holds the closed tree " + closed);
  }
  return checked;
}

Result<UniqueFd> ClientPathResolver::openParent(const CheckedPath& path, bool create) const {
  return OpenDirectoryBeneath(root(), path.components, path.components.size() - 1, create, 0777);
}

Result<UniqueFd> ClientPathResolver::openDirectory(const CheckedPath& path, bool create) const {
  return OpenDirectoryBeneath(root(), path.components, path.components.size(), create, 0777);
}

std::vector<std::string> ClientPathResolver::closedTreesWithin(const CheckedPath& path,
                                                               std::string_view spelled) const {
  std::string base(spelled);
  while (base.size() > 1 && base.back() == '/') base.pop_back();
  std::vector<std::string> within;
  for (const std::string& closed : areas_.closed) {
    if (PathIsWithin(closed, path.path)) within.push_back(base + closed.substr(path.path.size()));
  }
  return within;
}

void LogRefusal(std::string_view path, const Error& why) {
  VTRLogError("Refused path %@: %@", path, why.message());
  // The day file's line names the rule; the journal adds the system's text.
  if (why.code() != 0) VTRJournalError("Refused path %@: %@", path, why.description());
}

}  // namespace vtr
