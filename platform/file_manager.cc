// The file manager's single-item operations and its two tree operations,
// move and link (the walk itself is in file_tree.cc).
#include "platform/file_manager.h"

#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>

#include "platform/file_tree.h"
#include "platform/format.h"

namespace vtr {

Status ChangeOwnerOfItem(const std::string& path, uid_t uid, gid_t gid) {
  if (::fchownat(AT_FDCWD, path.c_str(), uid, gid, AT_SYMLINK_NOFOLLOW) != 0) return Error::FromErrno(path);
  return Status::Ok();
}

Status ChangeModeOfItem(const std::string& path, mode_t mode) { return ChangeModeAt(AT_FDCWD, path, mode, path); }

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

Status MoveItemAt(int srcDir, const std::string& srcName, int dstDir, const std::string& dstName,
                  const std::string& srcPath, const std::string& dstPath) {
  const char* from = srcName.c_str();
  const char* to = dstName.c_str();
  if (::renameat2(srcDir, from, dstDir, to, RENAME_NOREPLACE) == 0) return Status::Ok();
  if (errno == EINVAL) {
    // Some file systems cannot rename without replacing; check first there
    // (EINVAL also means moving a directory into itself, which rename
    // refuses again below).
    struct stat st;
    if (::fstatat(dstDir, to, &st, AT_SYMLINK_NOFOLLOW) == 0) return Error(EEXIST, dstPath);
    if (::renameat(srcDir, from, dstDir, to) == 0) return Status::Ok();
  }
  if (errno == EEXIST) return Error::FromErrno(dstPath);
  if (errno != EXDEV) return Error::FromErrno(srcPath);
  // Across file systems: a copy, then the source goes. A copy that fails is
  // removed again and the source stays as it was.
  Status copied = CopyItemAt(srcDir, srcName, dstDir, dstName, srcPath, dstPath);
  if (!copied.ok()) return copied;
  return RemoveItemAt(srcDir, srcName, srcPath);
}

Status CopyItemAt(int srcDir, const std::string& srcName, int dstDir, const std::string& dstName,
                  const std::string& srcPath, const std::string& dstPath) {
  // Made only when it fits (holes take no room).
  Result<uint64_t> needed = AllocatedBytesOfTree(srcDir, srcName, srcPath);
  if (!needed.ok()) return needed.error();
  struct statvfs room;
  if (::fstatvfs(dstDir, &room) == 0 && uint64_t{room.f_bavail} * room.f_frsize < *needed) {
    return Error(ENOSPC, Format("%s needs %llu bytes", dstPath.c_str(), static_cast<unsigned long long>(*needed)));
  }
  return ReplicateItem(srcDir, srcName, dstDir, dstName, Replication::kCopy, srcPath, dstPath);
}

Status MoveItem(const std::string& src, const std::string& dst) {
  Result<ParentAndName> from = OpenParent(src);
  if (!from.ok()) return from.error();
  Result<ParentAndName> to = OpenParent(dst);
  if (!to.ok()) return to.error();
  return MoveItemAt(from->parent.get(), from->name, to->parent.get(), to->name, src, dst);
}

Status LinkItem(const std::string& src, const std::string& dst) {
  return Replicate(src, dst, Replication::kHardLink);
}

}  // namespace vtr
