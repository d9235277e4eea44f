#include "platform/remove_item.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <vector>

#include "platform/file_tree.h"
#include "platform/unique_fd.h"

namespace vtr {
namespace {

Status RemoveAt(int dirFd, const std::string& name, const std::string& path, int depth) {
  if (::unlinkat(dirFd, name.c_str(), 0) == 0) return Status::Ok();
  const int unlinkError = errno;
  // A directory gives EISDIR on Linux, EPERM where unlink of a directory is
  // refused; EPERM also means an immutable or append-only file, whose own
  // error is the one to report.
  struct stat st;
  if (unlinkError != EISDIR &&
      (unlinkError != EPERM || ::fstatat(dirFd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 || !S_ISDIR(st.st_mode))) {
    return Error(unlinkError, path);
  }
  if (depth >= kMaxRemoveDepth) return Error(ELOOP, path);
  UniqueFd fd(::openat(dirFd, name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return Error::FromErrno(path);
  Result<std::vector<std::string>> names = DirectoryEntryNames(fd.get(), path);
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
  Result<ParentAndName> parent = OpenParent(trimmed);
  if (!parent.ok()) return Error(parent.error().code(), path);
  return RemoveAt(parent->parent.get(), parent->name, path, 0);
}

}  // namespace vtr
