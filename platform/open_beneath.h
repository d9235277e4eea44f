// Opening a path one component at a time from a directory descriptor,
// never following a symbolic link at any position: the building block of
// every path the helper takes from a client and of its own fixed paths.
//
// Paths here are already normalised (see SplitPathComponents): no empty
// components, no "." or "..". Each directory is opened relative to the one
// before with O_DIRECTORY | O_NOFOLLOW, so a link planted anywhere on the way
// is refused (ELOOP) instead of followed, and whatever is renamed above a
// directory once it is open changes nothing below it. All functions are
// thread-safe; descriptors are returned close-on-exec.
#ifndef VTR_PLATFORM_OPEN_BENEATH_H_
#define VTR_PLATFORM_OPEN_BENEATH_H_

#include <sys/types.h>

#include <string>
#include <string_view>
#include <vector>

#include "platform/result.h"
#include "platform/unique_fd.h"

namespace vtr {

// The components of an absolute path: "/a//b/./c/" gives {"a", "b", "c"},
// "/" gives none. An Error (EINVAL, message saying why) for an empty or
// relative path, a NUL byte, or a ".." component.
Result<std::vector<std::string>> SplitPathComponents(std::string_view path);

// "/" followed by the components joined with "/".
std::string JoinPathComponents(const std::vector<std::string>& components, size_t count);

// Opens the directory reached from rootFd through components[0, count) (the
// root itself when count is 0). With create, a missing directory on the way
// is made with mkdirat(mode) first. ELOOP (message "a symbolic link stands at
// PATH") when a link is met, ENOTDIR when something other than a directory
// is; the error's message names the path reached so far.
Result<UniqueFd> OpenDirectoryBeneath(int rootFd, const std::vector<std::string>& components, size_t count,
                                      bool create = false, mode_t mode = 0755);

// The directories along one path beneath a root, kept open so that the next
// path sharing a prefix with it opens only the components that differ: for
// going through many paths in tree order (a manifest's records), where each
// path would otherwise cost one open per component. Directories are opened
// as OpenDirectoryBeneath opens them, each relative to the one before. One
// renamed elsewhere after it was opened is still the one used below it; it
// was beneath the root when it was reached. Not thread-safe.
class OpenDirectoryChain {
 public:
  // rootFd stays the caller's and must outlive the chain.
  explicit OpenDirectoryChain(int rootFd) : rootFd_(rootFd) {}

  // The directory reached through components[0, count) (rootFd itself when
  // count is 0), with OpenDirectoryBeneath's errors. Valid until the next
  // call.
  Result<int> open(const std::vector<std::string>& components, size_t count);

 private:
  int rootFd_;
  std::vector<std::string> names_;
  std::vector<UniqueFd> directories_;  // directories_[i]: the directory of names_[0, i]
};

// Opens the entry name of dirFd with flags | O_NOFOLLOW | O_CLOEXEC, adding
// O_NONBLOCK so that a fifo planted there cannot block the helper. A link
// gives ELOOP. pathForErrors names the entry in the error.
Result<UniqueFd> OpenEntryNoFollow(int dirFd, const std::string& name, int flags, const std::string& pathForErrors);

}  // namespace vtr

#endif  // VTR_PLATFORM_OPEN_BENEATH_H_
