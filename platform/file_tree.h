// Building blocks of the file manager's tree operations, working relative to
// open directory descriptors so that no path under someone else's control is
// resolved twice. Used by file_manager.h's implementation; not meant for
// callers outside the platform layer.
#ifndef VTR_PLATFORM_FILE_TREE_H_
#define VTR_PLATFORM_FILE_TREE_H_

#include <sys/types.h>

#include <string>
#include <vector>

#include "platform/result.h"
#include "platform/unique_fd.h"

namespace vtr {

// The parent directory of path, opened (following links in it, as any path
// resolution does), and the last component. Fails with EINVAL for a path
// whose last component is empty, "." or "..", and for "/".
struct ParentAndName {
  UniqueFd parent;
  std::string name;
};
Result<ParentAndName> OpenParent(const std::string& path);

// The names in the directory open as dirFd, without "." and "..", sorted
// (ReadDirectory without the types). dirFd stays open and is not moved.
Result<std::vector<std::string>> DirectoryEntryNames(int dirFd, const std::string& pathForErrors);

// Changes the mode of the entry name of dirFd without following a symbolic
// link there (fchmodat2 with AT_SYMLINK_NOFOLLOW; on kernels without it, the
// C library's fchmodat, which needs /proc for this).
Status ChangeModeAt(int dirFd, const std::string& name, mode_t mode, const std::string& pathForErrors);

// The extended attributes of the entry name of dirFd itself, a symbolic
// link there not followed, for items that cannot be opened (links): the
// listxattrat and getxattrat system calls (Linux 6.13), which look the entry
// up in dirFd alone. They answer as llistxattr and lgetxattr do: the length
// of the name list or value (the size needed when size is 0), or -1 with
// errno. On older kernels the item is reached by fallbackPath with
// llistxattr / lgetxattr when one is given, which resolves that whole path
// again; without one they fail with ENOSYS.
ssize_t ListExtendedAttributesAt(int dirFd, const std::string& name, char* list, size_t size,
                                 const std::string* fallbackPath);
ssize_t GetExtendedAttributeAt(int dirFd, const std::string& name, const std::string& key, void* value,
                               size_t size, const std::string* fallbackPath);

// The bytes the entry name of dirFd and everything below it take on disk
// (allocated blocks, so holes count nothing), links never followed. What a
// copy of it will need at least.
Result<uint64_t> AllocatedBytesOfTree(int dirFd, const std::string& name, const std::string& pathForErrors);

// Sets the extended attribute key of the symbolic link open as linkFd
// (O_PATH, OpenLinkItself), the entry name of dirFd, on the link itself:
// through the descriptor's /proc/self/fd entry, which leads to the link
// opened and stops there, so the attribute lands on that inode whatever
// stands under its name now, on every kernel. Where /proc is missing (a
// chroot), the entry name of dirFd, not followed (setxattrat, Linux 6.13;
// ENOSYS before). 0, or -1 with errno.
int SetExtendedAttributeOfLink(int linkFd, int dirFd, const std::string& name, const std::string& key,
                               const void* value, size_t size);

// How ReplicateItem makes the files of the copy.
enum class Replication {
  kCopy,      // new files with the source's data, mode, owner, times and extended attributes
  kHardLink,  // hard links of the source's files
};

// Replicates the entry srcName of srcDir as dstName in dstDir, which must
// not exist. Directories are recreated entry by entry, with the source's
// mode, owner, times and extended attributes; symbolic links are recreated
// with their target text, owner and times; files (and special files) are
// copied or hard-linked as the mode says. A copy keeps holes (only data
// regions are written) and reads a file no further than its size when it was
// opened. Nothing is followed. Ownership
// that the caller may not give (EPERM when not root) and extended attributes
// that the destination cannot hold are passed over. On failure, whatever was
// made at dstName is removed again. Nesting deeper than kMaxTreeDepth fails
// with ELOOP.
Status ReplicateItem(int srcDir, const std::string& srcName, int dstDir, const std::string& dstName,
                     Replication mode, const std::string& srcPath, const std::string& dstPath);

}  // namespace vtr

#endif  // VTR_PLATFORM_FILE_TREE_H_
