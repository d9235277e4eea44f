#include "vitd_helper/client_areas.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>

#include "platform/format.h"
#include "platform/open_beneath.h"
#include "platform/read_fully.h"

namespace vtr {
namespace {

// The file is a few lines; anything larger is not one.
constexpr size_t kMaxAreasFileBytes = 64 * 1024;

Result<std::string> NormalisedPath(std::string_view path) {
  Result<std::vector<std::string>> components = ClientPathComponents(path);
  if (!components.ok()) return components.error();
  return JoinPathComponents(*components, components->size());
}

// Ok when st describes something only root can change.
Status CheckRootOwned(const struct stat& st, const std::string& path) {
  if (st.st_uid != 0) return Error(EPERM, Format("%s is owned by uid %u, not root", path.c_str(), st.st_uid));
  if ((st.st_mode & 022) != 0) {
    return Error(EPERM, Format("%s is writable by group or others (mode %04o)", path.c_str(), st.st_mode & 07777));
  }
  return Status::Ok();
}

}  // namespace

Result<std::vector<std::string>> ClientPathComponents(std::string_view path) {
  Result<std::vector<std::string>> components = SplitPathComponents(path);
  if (!components.ok()) return components.error();
  // The platform's "/var" is an alias of "/private/var": mapped in text,
  // never by following the link that may stand there.
  if (!components->empty() && components->front() == "var") components->insert(components->begin(), "private");
  return components;
}

bool PathIsWithin(std::string_view path, std::string_view tree) {
  if (tree == "/") return true;
  return path.substr(0, tree.size()) == tree && (path.size() == tree.size() || path[tree.size()] == '/');
}

ClientAreas ClientAreas::Defaults() { return ClientAreas{{"/private/var"}, {"/private/var/root", kHelperLogFolder}}; }

Result<ClientAreas> ClientAreas::Parse(std::string_view text) {
  ClientAreas result;
  std::vector<std::string> closed;
  size_t lineNumber = 0;
  while (!text.empty()) {
    ++lineNumber;
    const size_t end = std::min(text.find('\n'), text.size());
    std::string_view line = text.substr(0, end);
    text.remove_prefix(std::min(end + 1, text.size()));
    if (const size_t hash = line.find('#'); hash != std::string_view::npos) line = line.substr(0, hash);
    std::vector<std::string_view> words;
    for (size_t at = 0; at < line.size();) {
      const size_t start = line.find_first_not_of(" \t\r", at);
      if (start == std::string_view::npos) break;
      const size_t stop = std::min(line.find_first_of(" \t\r", start), line.size());
      words.push_back(line.substr(start, stop - start));
      at = stop;
    }
    if (words.empty()) continue;
    const auto lineError = [lineNumber](const std::string& why) {
      return Error(EINVAL, Format("line %zu: %s", lineNumber, why.c_str()));
    };
    if (words.size() != 2 || (words[0] != "area" && words[0] != "closed")) {
      return lineError("expected \"area PATH\" or \"closed PATH\"");
    }
    Result<std::string> path = NormalisedPath(words[1]);
    if (!path.ok()) return lineError(path.error().message());
    (words[0] == "area" ? result.areas : closed).push_back(*path);
  }
  if (result.areas.empty()) return Error(EINVAL, "names no area");
  closed.push_back(kHelperLogFolder);
  for (const std::string& tree : closed) {
    const bool inArea = std::any_of(result.areas.begin(), result.areas.end(),
                                    [&tree](const std::string& area) { return PathIsWithin(tree, area); });
    if (inArea) {
      result.closed.push_back(tree);
    } else if (tree != kHelperLogFolder) {
      return Error(EINVAL, "closed tree " + tree + " lies in no area");
    }
  }
  return result;
}

Result<ClientAreas> ClientAreas::Load(int rootFd, const std::string& path) {
  Result<std::vector<std::string>> components = SplitPathComponents(path);
  if (!components.ok() || components->empty()) return Error(EINVAL, path);
  const size_t folderDepth = components->size() - 1;
  Result<UniqueFd> folder = OpenDirectoryBeneath(rootFd, *components, folderDepth);
  if (!folder.ok()) {
    if (folder.error().code() == ENOENT) return Defaults();
    return folder.error();
  }
  Result<UniqueFd> file = OpenEntryNoFollow(folder->get(), components->back(), O_RDONLY, path);
  if (!file.ok()) {
    if (file.error().code() == ENOENT) return Defaults();
    return file.error();
  }
  struct stat folderStat, fileStat;
  if (::fstat(folder->get(), &folderStat) != 0 || ::fstat(file->get(), &fileStat) != 0) {
    return Error::FromErrno(path);
  }
  if (Status s = CheckRootOwned(folderStat, JoinPathComponents(*components, folderDepth)); !s.ok()) return s.error();
  if (Status s = CheckRootOwned(fileStat, path); !s.ok()) return s.error();
  if (!S_ISREG(fileStat.st_mode)) return Error(EINVAL, path + " is not a regular file");
  if (static_cast<size_t>(fileStat.st_size) > kMaxAreasFileBytes) return Error(EFBIG, path);
  Result<std::string> text = ReadFully(file->get(), kMaxAreasFileBytes);
  if (!text.ok()) return Error(text.error().code(), path);
  Result<ClientAreas> areas = Parse(*text);
  if (!areas.ok()) return Error(EINVAL, path + ", " + areas.error().message());
  return areas;
}

}  // namespace vtr
