#include "platform/remove_item.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <vector>

#include "platform/unique_fd.h"

namespace vtr {
namespace {

// Names in the directory open as fd (without "." and ".."). The directory
// stream is closed again; fd stays open.
Result<std::vector<std::string>> ListNames(int fd, const std::string& path) {
  const int dupFd = ::fcntl(fd, F_DUPFD_CLOEXEC, 0);
  if (dupFd < 0) return Error::FromErrno(path);
  DIR* dir = ::fdopendir(dupFd);
  if (dir == nullptr) {
    Error e = Error::FromErrno(path);
    ::close(dupFd);
    return e;
  }
  ::rewinddir(dir);
  std::vector<std::string> names;
  errno = 0;
  while (struct dirent* entry = ::readdir(dir)) {
    if (std::strcmp(entry->d_name, ".") == 0 || std::strcmp(entry->d_name, "..") == 0) continue;
    names.emplace_back(entry->d_name);
  }
  const int readErrno = errno;
  ::closedir(dir);
  if (readErrno != 0) return Error(readErrno, path);
  return names;
}

Status RemoveAt(int dirFd, const std::string& name, const std::string& path, int depth) {
  if (::unlinkat(dirFd, name.c_str(), 0) == 0) return Status::Ok();
  if (errno != EISDIR && errno != EPERM) return Error::FromErrno(path);
  // A directory (EISDIR on Linux; EPERM where unlink of a directory is refused).
  if (depth >= kMaxRemoveDepth) return Error(ELOOP, path);
  UniqueFd fd(::openat(dirFd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return Error::FromErrno(path);
  Result<std::vector<std::string>> names = ListNames(fd.get(), path);
  if (!names.ok()) return names.error();
  Status first;
  for (const std::string& child : *names) {
    Status s = RemoveAt(fd.get(), child, path + "/" + child, depth + 1);
    if (!s.ok() && first.ok()) first = s;
  }
  if (!first.ok()) return first;
  if (::unlinkat(dirFd, name.c_str(), AT_REMOVEDIR) != 0) return Error::FromErrno(path);
  return Status::Ok();
}

}  // namespace

Status RemoveItemAt(int dirFd, const std::string& name, const std::string& pathForErrors) {
  return RemoveAt(dirFd, name, pathForErrors, 0);
}

Status RemoveItem(const std::string& path) {
  std::string trimmed = path;
  while (trimmed.size() > 1 && trimmed.back() == '/') trimmed.pop_back();
  const size_t slash = trimmed.rfind('/');
  const std::string dir = slash == std::string::npos ? "." : (slash == 0 ? "/" : trimmed.substr(0, slash));
  const std::string name = slash == std::string::npos ? trimmed : trimmed.substr(slash + 1);
  if (name.empty() || name == "." || name == ".." || trimmed == "/") return Error(EINVAL, path);
  UniqueFd dirFd(::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!dirFd) return Error::FromErrno(path);
  return RemoveAt(dirFd.get(), name, path, 0);
}

}  // namespace vtr
