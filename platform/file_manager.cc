// The file manager's single-item operations and its two tree operations,
// move and link (the walk itself is in file_tree.cc).
#include "platform/file_manager.h"

#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>

#include "platform/file_tree.h"
#include "platform/make_directories.h"

namespace vtr {

bool FileExists(const std::string& path, bool* isDirectory) {
  struct stat st;
  const bool exists = ::stat(path.c_str(), &st) == 0;
  if (isDirectory != nullptr) *isDirectory = exists && S_ISDIR(st.st_mode);
  return exists;
}

Status ChangeOwnerOfItem(const std::string& path, uid_t uid, gid_t gid) {
  if (::fchownat(AT_FDCWD, path.c_str(), uid, gid, AT_SYMLINK_NOFOLLOW) != 0) return Error::FromErrno(path);
  return Status::Ok();
}

Status ChangeModeOfItem(const std::string& path, mode_t mode) { return ChangeModeAt(AT_FDCWD, path, mode, path); }

Status CreateDirectory(const std::string& path, bool withIntermediateDirectories) {
  if (withIntermediateDirectories) return MakeDirectories(path, 0777);
  if (::mkdir(path.c_str(), 0777) != 0) return Error::FromErrno(path);
  return Status::Ok();
}

Result<std::vector<std::string>> ContentsOfDirectory(const std::string& path) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return Error::FromErrno(path);
  Result<std::vector<std::string>> names = DirectoryEntryNames(fd.get(), path);
  if (names.ok()) std::sort(names->begin(), names->end());
  return names;
}

Result<std::string> DestinationOfSymbolicLink(const std::string& path) {
  return DestinationOfSymbolicLinkAt(AT_FDCWD, path, path);
}

namespace {

// Replicates src at dst, which must not exist, relative to their parents.
Status Replicate(const std::string& src, const std::string& dst, Replication mode) {
  Result<ParentAndName> from = OpenParent(src);
  if (!from.ok()) return from.error();
  Result<ParentAndName> to = OpenParent(dst);
  if (!to.ok()) return to.error();
  return ReplicateItem(from->parent.get(), from->name, to->parent.get(), to->name, mode, src, dst);
}

}  // namespace

Status MoveItem(const std::string& src, const std::string& dst) {
  if (::renameat2(AT_FDCWD, src.c_str(), AT_FDCWD, dst.c_str(), RENAME_NOREPLACE) == 0) return Status::Ok();
  if (errno == EINVAL) {
    // Some file systems cannot rename without replacing; check first there
    // (EINVAL also means moving a directory into itself, which rename
    // refuses again below).
    struct stat st;
    if (::lstat(dst.c_str(), &st) == 0) return Error(EEXIST, dst);
    if (::rename(src.c_str(), dst.c_str()) == 0) return Status::Ok();
  }
  if (errno == EEXIST) return Error::FromErrno(dst);
  if (errno != EXDEV) return Error::FromErrno(src);
  Status copied = Replicate(src, dst, Replication::kCopy);
  if (!copied.ok()) return copied;
  return RemoveItem(src);
}

Status LinkItem(const std::string& src, const std::string& dst) {
  return Replicate(src, dst, Replication::kHardLink);
}

}  // namespace vtr
