#include "vitd_helper/final_location.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <iterator>
#include <optional>
#include <random>

#include "model/log.h"
#include "platform/atomic_file.h"
#include "platform/file_manager.h"
#include "platform/file_tree.h"
#include "platform/format.h"
#include "platform/item_io.h"
#include "platform/output_stream.h"
#include "platform/paths.h"

namespace vtr {
namespace {

// The helper's records beside the final location (entry suffixes).
constexpr const char* kRecordSuffixes[] = {".placing", ".source"};

// The longest staging path .NAME.source may hold.
constexpr size_t kMaxRecordBytes = 4096;

std::string RandomHex() {
  std::random_device random;
  return Format("%06x", random() & 0xffffff);
}

Status SyncDirectory(int fd, const std::string& pathForErrors) {
  if (::fsync(fd) != 0) return Error::FromErrno("fsync " + pathForErrors);
  return Status::Ok();
}

// rename(2) of one entry of dir to another that must not exist.
Status RenameWithin(int fromDir, const std::string& from, int toDir, const std::string& to,
                    const std::string& pathForErrors) {
  if (::renameat2(fromDir, from.c_str(), toDir, to.c_str(), RENAME_NOREPLACE) == 0) return Status::Ok();
  return Error::FromErrno("rename " + pathForErrors);
}

// The name a copied staging folder bears while it is removed.
std::string AsideName(const std::string& stagingName) { return "." + stagingName + ".moving"; }

bool IsAsideName(const std::string& name) {
  return name.size() > 8 && name[0] == '.' && name.compare(name.size() - 7, 7, ".moving") == 0;
}

}  // namespace

FinalLocation::FinalLocation(UniqueFd parent, std::string path, const ClientPathResolver& resolver)
    : parent_(std::move(parent)), path_(std::move(path)), resolver_(resolver) {
  const PathParts parts = SplitLastComponent(path_);
  parentPath_ = parts.parent;
  name_ = parts.name;
}

bool FinalLocation::exists(const std::string& name) const {
  struct stat st;
  return StatAt(parent_.get(), name, &st);
}

void FinalLocation::removeEntry(const std::string& name) {
  const std::string path = AppendPathComponent(parentPath_, name);
  if (Status removed = RemoveItemAt(parent_.get(), name, path); !removed.ok() && removed.error().code() != ENOENT) {
    VTRLogError("Could not remove %@: %@", path, removed.error().description());
  }
}

Status FinalLocation::writeRecord(const std::string& name, const std::string& text) {
  UniqueFd parentCopy(::fcntl(parent_.get(), F_DUPFD_CLOEXEC, 0));
  Result<AtomicFile> file = AtomicFile::CreateIn(std::move(parentCopy), AppendPathComponent(parentPath_, name), 0600);
  if (!file.ok()) return file.error();
  if (Status s = WriteFully(file->fd(), text.data(), text.size()); !s.ok()) return s;
  return file->commit();
}

std::optional<std::string> FinalLocation::readRecord(const std::string& name) const {
  // Only a file the helper wrote counts, and nothing else is waited on: a
  // client may have had its own file or a fifo linked under the name.
  UniqueFd fd = OpenAt(parent_.get(), name, O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC);
  struct stat st;
  if (!fd || ::fstat(fd.get(), &st) != 0 || !S_ISREG(st.st_mode) || st.st_uid != ::geteuid() || st.st_nlink != 1) {
    return std::nullopt;
  }
  std::string text(kMaxRecordBytes, '\0');
  const ssize_t n = ::read(fd.get(), text.data(), text.size());
  text.resize(n > 0 ? static_cast<size_t>(n) : 0);
  return text;
}

void FinalLocation::finishInterruptedMove() {
  const std::string incoming = entry(".incoming-");
  // A record killed between its naming and its rename bears its temporary
  // name (see AtomicFile): ".", the record's name, "." and six characters.
  const auto isUnfinishedRecord = [this](const std::string& name) {
    return std::any_of(std::begin(kRecordSuffixes), std::end(kRecordSuffixes), [&](const char* suffix) {
      const std::string prefix = "." + entry(suffix) + ".";
      return HasPrefix(name, prefix) && name.size() == prefix.size() + 6;
    });
  };
  if (Result<std::vector<std::string>> names = DirectoryEntryNames(parent_.get(), parentPath_); names.ok()) {
    for (const std::string& name : *names) {
      if (HasPrefix(name, incoming)) {
        VTRLog("Removing %@, the partial copy of an interrupted move", AppendPathComponent(parentPath_, name));
      } else if (isUnfinishedRecord(name)) {
        VTRLog("Removing %@, a record an interrupted move had not finished", AppendPathComponent(parentPath_, name));
      } else {
        continue;
      }
      removeEntry(name);
    }
  }
  const std::string ready = entry(".ready");
  const std::string outgoing = entry(".outgoing");
  // Killed right after the exchange, the replaced content bears the ready
  // name: the record of what was put in place tells them apart.
  const std::optional<std::string> placing = readRecord(entry(".placing"));
  struct stat current;
  if (exists(ready) && placing && StatAt(parent_.get(), name_, &current) &&
      *placing == std::to_string(current.st_ino)) {
    (void)RenameWithin(parent_.get(), ready, parent_.get(), outgoing, path_);
  }
  if (exists(ready)) {
    VTRLog("Putting %@ in place of %@: an interrupted move had made it whole", AppendPathComponent(parentPath_, ready),
           path_);
    if (Status placed = putReadyInPlace(); !placed.ok()) {
      VTRLogError("Could not put %@ in place: %@", AppendPathComponent(parentPath_, ready), placed.error().description());
    }
  }
  // Whatever bears a record's name goes, a folder a client had made there
  // too, or each later move would stumble on it.
  if (exists(entry(".placing"))) removeEntry(entry(".placing"));
  if (exists(outgoing)) {
    VTRLog("Removing %@, the content an interrupted move replaced", AppendPathComponent(parentPath_, outgoing));
    removeEntry(outgoing);
  }
  if (exists(entry(".source"))) {
    VTRLog("Removing the staging folder an interrupted move had copied to %@", path_);
    removeMovedSource();
  }
}

Status FinalLocation::receive(int stagingParent, const std::string& stagingName, const struct stat& staged,
                              const std::string& stagingPath) {
  const std::string ready = entry(".ready");
  const std::string readyPath = AppendPathComponent(parentPath_, ready);
  Status renamed = RenameWithin(stagingParent, stagingName, parent_.get(), ready, stagingPath);
  if (!renamed.ok() && renamed.error().code() == EXDEV) {
    return copyAcross(stagingParent, stagingName, staged, stagingPath);
  }
  if (!renamed.ok()) return renamed;
  // The staging folder is the client's: what it held when it was moved must
  // be the directory checked, not something swapped in since. A rename
  // moves an entry, not a descriptor, so it is checked after and put back
  // (or removed, never put in place) when it is not.
  struct stat moved;
  if (!StatAt(parent_.get(), ready, &moved) || moved.st_dev != staged.st_dev || moved.st_ino != staged.st_ino) {
    if (!RenameWithin(parent_.get(), ready, stagingParent, stagingName, readyPath).ok()) removeEntry(ready);
    return Error(EAGAIN, stagingPath + " changed while it was moved");
  }
  // The staged files (links the client had made) and both folders reach the
  // disk before the old content is replaced: one file system, one syncfs.
  if (::syncfs(parent_.get()) != 0) {
    Error failed = Error::FromErrno("syncfs " + readyPath);
    (void)RenameWithin(parent_.get(), ready, stagingParent, stagingName, readyPath);  // back where it was
    return failed;
  }
  return Status::Ok();
}

Status FinalLocation::copyAcross(int stagingParent, const std::string& stagingName, const struct stat& staged,
                                 const std::string& stagingPath) {
  const std::string incoming = entry(".incoming-") + RandomHex();
  const std::string incomingPath = AppendPathComponent(parentPath_, incoming);
  Status copied = CopyItemAt(stagingParent, stagingName, parent_.get(), incoming, stagingPath, incomingPath);
  // Without room beside the old content, the old content goes first: a
  // move discards it in any case.
  if (!copied.ok() && copied.error().code() == ENOSPC && exists(name_)) {
    discard();
    copied = CopyItemAt(stagingParent, stagingName, parent_.get(), incoming, stagingPath, incomingPath);
  }
  if (!copied.ok()) return copied;
  // The copy was made from the entry's name: a link swapped in for the
  // checked directory is copied as a link, and never put in place.
  struct stat copy;
  if (!StatAt(parent_.get(), incoming, &copy) || !S_ISDIR(copy.st_mode)) {
    removeEntry(incoming);
    return Error(EAGAIN, stagingPath + " changed while it was moved");
  }
  // Every file and folder of the copy reaches the disk before the copy
  // counts as whole.
  const std::string ready = entry(".ready");
  Status made = ::syncfs(parent_.get()) == 0 ? Status::Ok() : Status(Error::FromErrno("syncfs " + incomingPath));
  if (made.ok()) made = RenameWithin(parent_.get(), incoming, parent_.get(), ready, incomingPath);
  if (made.ok()) made = SyncDirectory(parent_.get(), parentPath_);
  if (made.ok()) made = moveSourceAside(stagingParent, stagingName, staged, stagingPath);
  if (!made.ok()) {
    removeEntry(incoming);
    removeEntry(ready);
  }
  return made;
}

Status FinalLocation::moveSourceAside(int stagingParent, const std::string& stagingName, const struct stat& staged,
                                      const std::string& stagingPath) {
  const std::string aside = AsideName(stagingName);
  const std::string asidePath = AppendPathComponent(SplitLastComponent(stagingPath).parent, aside);
  // Where it goes is recorded first, so that a kill after the rename leaves
  // it to be found and removed at the next start.
  if (Status recorded = writeRecord(entry(".source"), asidePath); !recorded.ok()) return recorded;
  // A folder of that name left by an earlier move is a leftover of the same kind.
  (void)RemoveItemAt(stagingParent, aside, asidePath);
  Status moved = RenameWithin(stagingParent, stagingName, stagingParent, aside, stagingPath);
  if (!moved.ok()) {
    (void)::unlinkat(parent_.get(), (entry(".source")).c_str(), 0);
    return moved;
  }
  // The name is the client's: only the directory checked (and copied) is
  // set aside to be removed; anything swapped in for it goes back.
  struct stat st;
  if (!StatAt(stagingParent, aside, &st) || st.st_dev != staged.st_dev || st.st_ino != staged.st_ino) {
    moved = Error(EAGAIN, stagingPath + " changed while it was moved");
  }
  if (moved.ok()) moved = SyncDirectory(stagingParent, stagingPath);
  if (!moved.ok()) {
    (void)RenameWithin(stagingParent, aside, stagingParent, stagingName, asidePath);
    (void)::unlinkat(parent_.get(), (entry(".source")).c_str(), 0);
  }
  return moved;
}

void FinalLocation::removeMovedSource() {
  const std::string record = entry(".source");
  const std::string recordPath = AppendPathComponent(parentPath_, record);
  const std::string text = readRecord(record).value_or(std::string());
  // Resolved as any client path: the folder it lies in is the client's.
  Result<CheckedPath> aside = resolver_.check(text, ClientUse::kChange);
  if (aside.ok() && !IsAsideName(aside->name())) aside = Error(EINVAL, text + ": not a folder the helper set aside");
  Result<UniqueFd> folder = aside.ok() ? resolver_.openParent(*aside) : Result<UniqueFd>(aside.error());
  Status removed = folder.ok() ? RemoveItemAt(folder->get(), aside->name(), aside->path) : Status(folder.error());
  if (!removed.ok() && removed.error().code() != ENOENT) {
    VTRLogError("Could not remove %@, a staging folder already moved to %@: %@", text, path_,
                removed.error().description());
  }
  removeEntry(record);
  (void)SyncDirectory(parent_.get(), recordPath);
}

Status FinalLocation::putReadyInPlace() {
  const std::string ready = entry(".ready");
  const std::string outgoing = entry(".outgoing");
  const std::string placing = entry(".placing");
  if (exists(outgoing)) removeEntry(outgoing);
  struct stat incoming;
  if (!StatAt(parent_.get(), ready, &incoming)) return Error::FromErrno(AppendPathComponent(parentPath_, ready));
  // Only a folder is put in place: the name lies in a client area, where a
  // client may have had a link or a file made under it.
  if (!S_ISDIR(incoming.st_mode)) {
    removeEntry(ready);
    return Error(ENOTDIR, AppendPathComponent(parentPath_, ready) + " is not a folder");
  }
  const bool replacing = exists(name_);
  if (!replacing) {
    if (Status s = RenameWithin(parent_.get(), ready, parent_.get(), name_, path_); !s.ok()) return s;
  } else {
    // One exchange of the two names: the final location is never empty.
    // What goes in is recorded first, so that a kill right after the
    // exchange does not take the old content for the new.
    if (Status s = writeRecord(placing, std::to_string(incoming.st_ino)); !s.ok()) return s;
    Status exchanged = ::renameat2(parent_.get(), ready.c_str(), parent_.get(), name_.c_str(), RENAME_EXCHANGE) == 0
                           ? Status::Ok()
                           : Status(Error::FromErrno("exchange " + path_));
    // A file system that cannot exchange: the old content is set aside
    // first; the moment between the renames is finished at the next start.
    if (!exchanged.ok() && exchanged.error().code() == EINVAL &&
        RenameWithin(parent_.get(), name_, parent_.get(), outgoing, path_).ok()) {
      exchanged = RenameWithin(parent_.get(), ready, parent_.get(), name_, path_);
      if (!exchanged.ok()) (void)RenameWithin(parent_.get(), outgoing, parent_.get(), name_, path_);
    }
    if (!exchanged.ok()) {
      (void)::unlinkat(parent_.get(), placing.c_str(), 0);
      return exchanged;
    }
  }
  (void)SyncDirectory(parent_.get(), parentPath_);
  if (replacing) {
    (void)RenameWithin(parent_.get(), ready, parent_.get(), outgoing, path_);
    (void)::unlinkat(parent_.get(), placing.c_str(), 0);
    removeEntry(outgoing);
  }
  if (exists(entry(".source"))) removeMovedSource();
  return Status::Ok();
}

void FinalLocation::discard() {
  if (exists(name_)) (void)RemoveItemAt(parent_.get(), name_, path_);
}

}  // namespace vtr
