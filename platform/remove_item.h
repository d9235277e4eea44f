// Removal of a file-system item and everything below it, as root, without
// ever following a symbolic link: a link is removed itself, and directories
// are entered only by descriptor (openat with O_NOFOLLOW), so a link planted
// or swapped in during the walk cannot lead the removal elsewhere.
#ifndef VTR_PLATFORM_REMOVE_ITEM_H_
#define VTR_PLATFORM_REMOVE_ITEM_H_

#include <string>

#include "platform/result.h"

namespace vtr {

// Deepest directory nesting RemoveItem descends into; a deeper tree is left
// in place and the call fails with ELOOP (each level holds a descriptor).
inline constexpr int kMaxRemoveDepth = 512;

// Removes the item at path: a file, link or special file by unlinking it, a
// directory with all its contents. A missing item is an error (ENOENT).
// On failure, what could be removed is gone and the rest stays.
Status RemoveItem(const std::string& path);

// The same for the entry `name` of the directory open as dirFd.
Status RemoveItemAt(int dirFd, const std::string& name, const std::string& pathForErrors);

}  // namespace vtr

#endif  // VTR_PLATFORM_REMOVE_ITEM_H_
