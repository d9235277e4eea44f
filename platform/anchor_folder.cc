#include "platform/anchor_folder.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <optional>

#include "platform/file_tree.h"
#include "platform/format.h"
#include "platform/open_beneath.h"
#include "platform/read_fully.h"

namespace vtr {
namespace {

// Why an item of this status may not hold trust anchors; none when it may.
// Root owns the anchors; a tool run by someone else verifies against that
// user's own anchors too, which the helper (root) never does.
std::optional<std::string> WhyNotClosed(const struct stat& st) {
  if (st.st_uid != 0 && st.st_uid != ::geteuid()) return Format("owned by uid %u, not root", st.st_uid);
  if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
    return Format("writable by group or others (mode %04o)", st.st_mode & 07777);
  }
  return std::nullopt;
}

// The anchor file name of dir, or why it does not count.
Result<std::string> ReadAnchorEntry(int dir, const std::string& name, const std::string& path) {
  Result<UniqueFd> fd = OpenEntryNoFollow(dir, name, O_RDONLY, path);
  if (!fd.ok()) return Error::Invalid(fd.error().code() == ELOOP ? "a symbolic link" : std::strerror(fd.error().code()));
  struct stat st;
  if (::fstat(fd->get(), &st) != 0) return Error::FromErrno("fstat");
  if (!S_ISREG(st.st_mode)) return Error::Invalid("not a regular file");
  if (std::optional<std::string> why = WhyNotClosed(st)) return Error::Invalid(*why);
  Result<std::string> bytes = ReadFully(fd->get(), kMaxAnchorFileBytes);
  if (!bytes.ok() && bytes.error().code() == EFBIG) return Error::Invalid("larger than 1 MiB");
  return bytes;
}

}  // namespace

Result<AnchorFolder> ReadAnchorFolder(const std::string& folder, int rootFd) {
  // A relative folder (a tool's argument) is taken from the working folder.
  const bool relative = !folder.empty() && folder.front() != '/';
  Result<std::vector<std::string>> components = SplitPathComponents(relative ? "/" + folder : folder);
  if (!components.ok()) return Error(components.error().code(), folder + ": " + components.error().message());
  UniqueFd base;
  if (rootFd == AT_FDCWD) {
    base.reset(::open(relative ? "." : "/", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (!base) return Error::FromErrno(folder);
    rootFd = base.get();
  }
  Result<UniqueFd> dir = OpenDirectoryBeneath(rootFd, *components, components->size());
  if (!dir.ok()) return dir.error();
  struct stat st;
  if (::fstat(dir->get(), &st) != 0) return Error::FromErrno(folder);
  if (std::optional<std::string> why = WhyNotClosed(st)) return Error(EPERM, folder + " is refused: " + *why);
  Result<std::vector<std::string>> names = DirectoryEntryNames(dir->get(), folder);
  if (!names.ok()) return names.error();
  std::sort(names->begin(), names->end());
  AnchorFolder anchors;
  for (const std::string& name : *names) {
    if (name.size() <= 4 || name.compare(name.size() - 4, 4, ".pem") != 0) continue;
    const std::string path = folder + "/" + name;
    Result<std::string> bytes = ReadAnchorEntry(dir->get(), name, path);
    if (bytes.ok()) {
      anchors.files.push_back({path, std::move(*bytes)});
    } else {
      anchors.passedOver.push_back(path + " is passed over: " + bytes.error().description());
    }
  }
  return anchors;
}

}  // namespace vtr
