#include "model/tree_walker.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/limits.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstddef>
#include <cstring>
#include <memory>

#include "platform/format.h"
#include "platform/paths.h"
#include "platform/utf8.h"

namespace vtr {
namespace {

constexpr int kDirectoryOpenFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
constexpr size_t kListingBufferBytes = 64 * 1024;

TreeWalker::ItemType TypeFromMode(mode_t mode) {
  if (S_ISREG(mode)) return TreeWalker::ItemType::kRegular;
  if (S_ISDIR(mode)) return TreeWalker::ItemType::kDirectory;
  if (S_ISLNK(mode)) return TreeWalker::ItemType::kSymbolicLink;
  return TreeWalker::ItemType::kOther;
}

bool IsDotOrDotDot(const char* name) {
  return name[0] == '.' && (name[1] == '\0' || (name[1] == '.' && name[2] == '\0'));
}

}  // namespace

TreeWalker::TreeWalker(std::string root, ErrorHandler onError, SkipRule skip, TreeLocation location)
    : root_(std::move(root)), location_(std::move(location)), onError_(std::move(onError)), skip_(std::move(skip)) {}

const std::string& TreeWalker::name() const {
  const Level& level = levels_.back();
  return level.entries[level.next - 1].name;
}

int TreeWalker::parentFd() const { return levels_.back().fd->get(); }

std::shared_ptr<const UniqueFd> TreeWalker::parentDirectory() const { return levels_.back().fd; }

void TreeWalker::openRoot() {
  // The root keeps its spelling apart from trailing slashes, so that item
  // paths read as the caller named the tree.
  std::string rootPath = root_;
  while (rootPath.size() > 1 && rootPath.back() == '/') rootPath.pop_back();
  if (location_.parent) {
    enter(location_.parent->get(), location_.name, rootPath);
  } else {
    enter(AT_FDCWD, root_, rootPath);
  }
}

void TreeWalker::enter(int parentFd, const std::string& name, const std::string& path) {
  if (levels_.size() > kMaxWalkDepth) {
    onError_(path, Error::Invalid(Format("nested more than %zu levels deep; not entered", kMaxWalkDepth)));
    return;
  }
  UniqueFd fd(::openat(parentFd, name.c_str(), kDirectoryOpenFlags));
  if (!fd) {
    onError_(path, Error::FromErrno(path));
    return;
  }
  Result<std::vector<Entry>> entries = ReadEntries(fd.get(), path);
  if (!entries.ok()) {
    onError_(path, entries.error());
    return;
  }
  levels_.push_back(Level{std::make_shared<const UniqueFd>(std::move(fd)), path, std::move(*entries), 0});
}

Result<std::vector<TreeWalker::Entry>> TreeWalker::ReadEntries(int fd, const std::string& path) {
  std::vector<Entry> entries;
  std::unique_ptr<char[]> buffer(new char[kListingBufferBytes]);
  for (;;) {
    const ssize_t n = ::getdents64(fd, buffer.get(), kListingBufferBytes);
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return Error::FromErrno(path);
    if (n == 0) break;
    // The kernel fills whole records; each one's length is still checked
    // against what it returned before the record is read.
    for (ssize_t offset = 0; offset < n;) {
      const auto* record = reinterpret_cast<const struct dirent64*>(buffer.get() + offset);
      const size_t headerBytes = offsetof(struct dirent64, d_name);
      if (static_cast<size_t>(n - offset) < headerBytes || record->d_reclen < headerBytes ||
          record->d_reclen > n - offset) {
        return Error(EIO, path);
      }
      const size_t nameBytes = ::strnlen(record->d_name, record->d_reclen - headerBytes);
      if (nameBytes == record->d_reclen - headerBytes) return Error(EIO, path);  // no terminator
      if (!IsDotOrDotDot(record->d_name)) {
        entries.push_back(Entry{std::string(record->d_name, nameBytes), record->d_type});
      }
      offset += record->d_reclen;
    }
  }
  std::sort(entries.begin(), entries.end(), [](const Entry& a, const Entry& b) { return a.name < b.name; });
  return entries;
}

bool TreeWalker::typeOf(const Level& level, const Entry& entry, ItemType* type) {
  switch (entry.dtype) {
    case DT_REG: *type = ItemType::kRegular; return true;
    case DT_DIR: *type = ItemType::kDirectory; return true;
    case DT_LNK: *type = ItemType::kSymbolicLink; return true;
    case DT_UNKNOWN: break;
    default: *type = ItemType::kOther; return true;
  }
  struct stat st;
  if (::fstatat(level.fd->get(), entry.name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
    onError_(path_, Error::FromErrno(path_));
    return false;
  }
  *type = TypeFromMode(st.st_mode);
  return true;
}

bool TreeWalker::next() {
  if (!started_) {
    started_ = true;
    openRoot();
  } else if (enterCurrent_) {
    enterCurrent_ = false;
    enter(levels_.back().fd->get(), name(), path_);
  }
  while (!levels_.empty()) {
    Level& level = levels_.back();
    if (level.next == level.entries.size()) {
      levels_.pop_back();
      continue;
    }
    const Entry& entry = level.entries[level.next++];
    path_ = AppendPathComponent(level.path, entry.name);
    if (path_.size() >= PATH_MAX) {
      onError_(path_, Error(ENAMETOOLONG, path_));
      continue;
    }
    if (!IsValidUtf8(entry.name)) {
      const std::string shown = ToValidUtf8(path_);
      onError_(shown, Error(EILSEQ, shown));
      continue;
    }
    if (!typeOf(level, entry, &type_)) continue;
    if (skip_ && skip_(path_)) continue;
    enterCurrent_ = type_ == ItemType::kDirectory;
    return true;
  }
  return false;
}

}  // namespace vtr
