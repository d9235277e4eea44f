#include "platform/open_beneath.h"

#include <fcntl.h>
#include <sys/stat.h>

namespace vtr {
namespace {

// The error of an open of name in dirFd that failed with error: ELOOP saying
// so where a link stands there (O_NOFOLLOW gives ELOOP or, with
// O_DIRECTORY, ENOTDIR for one), else error naming path.
Error OpenError(int error, int dirFd, const char* name, const std::string& path) {
  struct stat st;
  if ((error == ELOOP || error == ENOTDIR) && ::fstatat(dirFd, name, &st, AT_SYMLINK_NOFOLLOW) == 0 &&
      S_ISLNK(st.st_mode)) {
    return Error(ELOOP, "a symbolic link stands at " + path);
  }
  return Error(error, path);
}

}  // namespace

Result<std::vector<std::string>> SplitPathComponents(std::string_view path) {
  if (path.empty()) return Error(EINVAL, "an empty path");
  if (path.find('\0') != std::string_view::npos) return Error(EINVAL, "a NUL byte in the path");
  if (path.front() != '/') return Error(EINVAL, "not an absolute path");
  std::vector<std::string> components;
  size_t start = 0;
  while (start < path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string_view::npos) end = path.size();
    const std::string_view component = path.substr(start, end - start);
    if (component == "..") return Error(EINVAL, "a \"..\" component");
    if (!component.empty() && component != ".") components.emplace_back(component);
    start = end + 1;
  }
  return components;
}

std::string JoinPathComponents(const std::vector<std::string>& components, size_t count) {
  if (count == 0) return "/";
  std::string path;
  for (size_t i = 0; i < count && i < components.size(); ++i) path += "/" + components[i];
  return path;
}

namespace {

constexpr int kDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

// Opens components[i] in parent, the directory of components[0, i); with
// create, a missing one is made with mkdirat(mode) first.
Result<UniqueFd> OpenComponent(int parent, const std::vector<std::string>& components, size_t i, bool create,
                               mode_t mode) {
  const char* name = components[i].c_str();
  UniqueFd next(::openat(parent, name, kDirectoryFlags));
  if (!next && errno == ENOENT && create) {
    if (::mkdirat(parent, name, mode) != 0 && errno != EEXIST) {
      return Error::FromErrno(JoinPathComponents(components, i + 1));
    }
    next.reset(::openat(parent, name, kDirectoryFlags));
  }
  if (!next) return OpenError(errno, parent, name, JoinPathComponents(components, i + 1));
  return next;
}

}  // namespace

Result<UniqueFd> OpenDirectoryBeneath(int rootFd, const std::vector<std::string>& components, size_t count,
                                      bool create, mode_t mode) {
  UniqueFd current(::openat(rootFd, ".", kDirectoryFlags));
  if (!current) return Error::FromErrno("/");
  for (size_t i = 0; i < count; ++i) {
    Result<UniqueFd> next = OpenComponent(current.get(), components, i, create, mode);
    if (!next.ok()) return next.error();
    current = std::move(*next);
  }
  return current;
}

Result<int> OpenDirectoryChain::open(const std::vector<std::string>& components, size_t count) {
  size_t shared = 0;
  while (shared < count && shared < names_.size() && names_[shared] == components[shared]) ++shared;
  names_.resize(shared);
  directories_.resize(shared);
  for (size_t i = shared; i < count; ++i) {
    Result<UniqueFd> next = OpenComponent(i == 0 ? rootFd_ : directories_[i - 1].get(), components, i, false, 0);
    if (!next.ok()) return next.error();
    names_.push_back(components[i]);
    directories_.push_back(std::move(*next));
  }
  return count == 0 ? rootFd_ : directories_[count - 1].get();
}

Result<UniqueFd> OpenEntryNoFollow(int dirFd, const std::string& name, int flags, const std::string& pathForErrors) {
  UniqueFd fd(::openat(dirFd, name.c_str(), flags | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (fd) return fd;
  return OpenError(errno, dirFd, name.c_str(), pathForErrors);
}

}  // namespace vtr
