// TreeWalker: the pre-order walk of a directory tree that manifests are built
// from. A directory comes before its contents; the entries of each directory
// come in the byte order of their names, so the same tree always gives the
// same sequence (and a manifest written from it the same bytes).
//
// The walk never follows a symbolic link: the root is opened with O_NOFOLLOW
// (a link there is reported, not entered) and every directory below it is
// opened relative to its parent's descriptor with O_NOFOLLOW | O_DIRECTORY,
// so a link planted or swapped in while the walk runs cannot lead it out of
// the tree. Links, fifos, sockets and devices are reported as items and never
// opened. Nothing recurses: the walk keeps an explicit stack, one open
// descriptor and the sorted names of one directory per level.
//
// Whatever cannot be walked goes to the error handler and the walk goes on
// with the next entry:
//   - a directory (or the root) that cannot be opened or listed;
//   - an entry whose type cannot be read (it vanished after it was listed);
//   - a directory nested more than kMaxWalkDepth levels below the root: it is
//     yielded as an item but not entered (this bounds the descriptors a tree
//     can make the walk hold);
//   - an entry whose path would reach PATH_MAX bytes: neither yielded nor
//     entered, since no path-based call could name it;
//   - an entry whose name is not valid UTF-8: neither yielded nor entered,
//     since paths become text (keys, messages) everywhere above the walk.
//     The path reported has the ill-formed bytes replaced by U+FFFD.
//
// A TreeWalker is used by one thread at a time.
#ifndef VTR_MODEL_TREE_WALKER_H_
#define VTR_MODEL_TREE_WALKER_H_

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/directory_listing.h"
#include "platform/result.h"
#include "platform/unique_fd.h"

namespace vtr {

// Directory levels below the root that a walk enters. It matches the depth
// RemoveItem descends, and with the handful of descriptors the rest of the
// helper holds it stays well under the usual limit of 1024 open files.
inline constexpr size_t kMaxWalkDepth = 512;

// Where a tree stands when its path is not to be resolved as text: the entry
// name of an open directory (a client's path, opened without following
// links). Empty (no parent) means "resolve the path".
struct TreeLocation {
  std::shared_ptr<const UniqueFd> parent;
  std::string name;
};

class TreeWalker {
 public:
  enum class ItemType : uint8_t { kRegular, kDirectory, kSymbolicLink, kOther };

  // Called with the path of what could not be walked and why. The path is
  // the item's as it stands, even when a name in it is not UTF-8 (error
  // EILSEQ, whose message shows it with replacement characters); a skipped
  // item is never reported.
  using ErrorHandler = std::function<void(const std::string& path, const Error& error)>;
  // Answers true for a path the walk must pass over: such an item is not
  // yielded, and a directory is not entered.
  using SkipRule = std::function<bool(const std::string& path)>;

  // Prepares a walk of the tree at root (nothing is opened yet). Item paths
  // are root joined with the names below it by single slashes (a trailing
  // slash of root is dropped). The handlers must outlive the walker; skip may
  // be empty.
  // With a location, the root is opened as that entry (no link followed)
  // and root serves only as the text of item paths.
  TreeWalker(std::string root, ErrorHandler onError, SkipRule skip = nullptr, TreeLocation location = {});
  TreeWalker(const TreeWalker&) = delete;
  TreeWalker& operator=(const TreeWalker&) = delete;

  // Moves to the next item below the root (the root itself is never an
  // item); false when the walk is over. The first call opens the root.
  bool next();

  // The current item; valid after next() answered true, until the next call.
  const std::string& path() const { return path_; }
  ItemType type() const { return type_; }
  // The item's name and the descriptor of the directory holding it, for
  // calls relative to it (fstatat and the like). The descriptor belongs to
  // the walker.
  const std::string& name() const;
  int parentFd() const;
  // The same directory descriptor, shared: it stays open for as long as the
  // caller keeps it, after the walk has left the directory, so that the
  // item can be read relative to it later (on another thread). Many items
  // share one descriptor; each kept one counts against the process's limit
  // of open files.
  std::shared_ptr<const UniqueFd> parentDirectory() const;

 private:
  using Entry = DirectoryEntry;
  struct Level {
    std::shared_ptr<const UniqueFd> fd;
    std::string path;
    std::vector<Entry> entries;  // sorted by name
    size_t next = 0;
  };

  void openRoot();
  // Opens the directory `name` of the innermost level (or the root when
  // parentFd is AT_FDCWD) and pushes it as a new level; errors are reported.
  void enter(int parentFd, const std::string& name, const std::string& path);
  // The type of an entry from its listing, or from fstatat where the file
  // system did not say; false (after reporting) when it cannot be read.
  bool typeOf(const Level& level, const Entry& entry, ItemType* type);

  std::string root_;
  TreeLocation location_;
  ErrorHandler onError_;
  SkipRule skip_;
  bool started_ = false;
  bool enterCurrent_ = false;  // the current item is a directory to descend into
  std::vector<Level> levels_;
  std::string path_;
  ItemType type_ = ItemType::kOther;
};

}  // namespace vtr

#endif  // VTR_MODEL_TREE_WALKER_H_
