#include "model/tree_walker.h"

#include <dirent.h>
#include <fcntl.h>
#include <linux/limits.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstddef>
#include <cstring>
#include <memory>

#include "platform/directory_listing.h"
#include "platform/format.h"
#include "platform/item_io.h"
#include "platform/paths.h"
#include "platform/utf8.h"

namespace vtr {
namespace {


TreeWalker::ItemType TypeFromMode(mode_t mode) {
  if (S_ISREG(mode)) return TreeWalker::ItemType::kRegular;
  if (S_ISDIR(mode)) return TreeWalker::ItemType::kDirectory;
  if (S_ISLNK(mode)) return TreeWalker::ItemType::kSymbolicLink;
  return TreeWalker::ItemType::kOther;
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
  UniqueFd fd = OpenAt(parentFd, name, kDirectoryFlags);
  if (!fd) {
    onError_(path, Error::FromErrno(path));
    return;
  }
  Result<std::vector<DirectoryEntry>> entries = ReadDirectory(fd.get(), path);
  if (!entries.ok()) {
    onError_(path, entries.error());
    return;
  }
  levels_.push_back(Level{std::make_shared<const UniqueFd>(std::move(fd)), path, std::move(*entries), 0});
}

bool TreeWalker::typeOf(const Level& level, const Entry& entry, ItemType* type) {
  switch (entry.type) {
    case DT_REG: *type = ItemType::kRegular; return true;
    case DT_DIR: *type = ItemType::kDirectory; return true;
    case DT_LNK: *type = ItemType::kSymbolicLink; return true;
    case DT_UNKNOWN: break;
    default: *type = ItemType::kOther; return true;
  }
  struct stat st;
  if (!StatAt(level.fd->get(), entry.name, &st)) {
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
    if (skip_ && skip_(path_)) continue;
    if (!IsValidUtf8(entry.name)) {
      onError_(path_, Error(EILSEQ, ToValidUtf8(path_)));
      continue;
    }
    if (!typeOf(level, entry, &type_)) continue;
    enterCurrent_ = type_ == ItemType::kDirectory;
    return true;
  }
  return false;
}

}  // namespace vtr
