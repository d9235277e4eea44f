// The preferences and container work of VTRHOperations.
#include "vitd_helper/operations.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "model/log.h"
#include "platform/accounts.h"
#include "platform/file_manager.h"
#include "platform/file_tree.h"
#include "platform/open_beneath.h"
#include "platform/paths.h"
#include "vitd_helper/failure_journal.h"

namespace vtr {
namespace {

constexpr char kPrepareDirectoryMethod[] = "-[VTRHOperations prepareDirectory:writableByMobile:]";

// Owner and group of the item open as fd (O_PATH will do) become the
// account's, by name. Only a directory, or a regular file with one link, is
// handed over: a hard link would hand over an inode that lives elsewhere
// too, as systemd-tmpfiles refuses to; a link or special file is never.
Status GiveToAccount(int fd, const std::string& account, const std::string& path) {
  struct stat st;
  if (::fstat(fd, &st) != 0) return Error::FromErrno(path);
  if (!S_ISDIR(st.st_mode) && !S_ISREG(st.st_mode)) return Error(EPERM, path + " is neither a file nor a directory");
  if (S_ISREG(st.st_mode) && st.st_nlink > 1) return Error(EMLINK, path + " has more than one link");
  std::shared_ptr<const AccountDatabase> accounts = AccountDatabase::Shared();
  const std::optional<uid_t> uid = accounts->userId(account);
  const std::optional<gid_t> gid = accounts->groupId(account);
  if (!uid || !gid) return Error(EINVAL, "no account " + account);
  if (::fchownat(fd, "", *uid, *gid, AT_EMPTY_PATH) != 0) return Error::FromErrno(path);
  return Status::Ok();
}

bool EntryExists(int dirFd, const std::string& name) {
  struct stat st;
  return ::fstatat(dirFd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0;
}

}  // namespace

VTRHOperations& VTRHOperations::sharedInstance() {
  static VTRHOperations* const instance = [] {
    auto root = std::make_shared<const UniqueFd>(::open("/", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    return new VTRHOperations(HelperPaths(), ClientPathResolver(ClientAreas::Defaults(), std::move(root)));
  }();
  return *instance;
}

VTRHOperations::VTRHOperations(HelperPaths paths, ClientPathResolver resolver)
    : paths_(std::move(paths)), resolver_(std::move(resolver)) {}

void VTRHOperations::setClientAreas(ClientAreas areas) {
  resolver_ = ClientPathResolver(std::move(areas), resolver_.rootDirectory());
}

std::optional<CheckedPath> VTRHOperations::checkClientPath(const std::string& path, ClientUse use) const {
  Result<CheckedPath> checked = resolver_.check(path, use);
  if (!checked.ok()) {
    LogRefusal(path, checked.error());
    return std::nullopt;
  }
  return std::move(*checked);
}

void VTRHOperations::finishInterruptedWork() {
  finishInterruptedMove();
  removeUnfinishedManifest();
}

bool VTRHOperations::migratePreferencesFile() {
  const std::string& name = paths_.preferencesFileName;
  const std::string source = AppendPathComponent(paths_.rootPreferencesFolder, name);
  const std::string target = AppendPathComponent(paths_.mobilePreferencesFolder, name);
  Result<CheckedPath> sourceFolder = ClientPathResolver::CheckFixed(paths_.rootPreferencesFolder);
  Result<CheckedPath> targetFolder = ClientPathResolver::CheckFixed(paths_.mobilePreferencesFolder);
  if (!sourceFolder.ok() || !targetFolder.ok()) {
    JournalFailure("Cannot use the preferences folders", source,
                   sourceFolder.ok() ? targetFolder.error() : sourceFolder.error());
    return false;
  }
  // Nothing to move is no failure worth a line in the day file; a link on
  // the way is. The journal says which it was.
  Result<UniqueFd> from = resolver_.openDirectory(*sourceFolder);
  if (!from.ok()) {
    if (from.error().code() != ENOENT) LogRefusal(source, from.error());
    JournalFailure("Nothing to move: cannot open", paths_.rootPreferencesFolder, from.error());
    return false;
  }
  if (!EntryExists(from->get(), name)) {
    JournalFailure("Nothing to move:", source, Error(ENOENT, ""));
    return false;
  }
  Result<UniqueFd> to = resolver_.openDirectory(*targetFolder);
  if (!to.ok() && to.error().code() != ENOENT) {
    LogRefusal(target, to.error());
    return false;
  }
  if (to.ok() && EntryExists(to->get(), name)) {
    JournalFailure("Not moving over an existing", target, Error(EEXIST, ""));
    return false;
  }
  Result<UniqueFd> file = OpenEntryNoFollow(from->get(), name, O_PATH, source);
  struct stat st;
  if (file.ok() && (::fstat(file->get(), &st) != 0 || !S_ISREG(st.st_mode) || st.st_nlink != 1)) {
    file = Error(EPERM, source + " is not a regular file with one link");
  }
  if (!file.ok()) {
    LogRefusal(source, file.error());
    return false;
  }
  Status moved = to.ok() ? MoveItemAt(from->get(), name, to->get(), name, source, target) : Status(to.error());
  if (!moved.ok()) {
    VTRLogError("Couldn't move %@ to %@", source, target);
    JournalFailure("Cannot move to", target, moved.error());
    return false;
  }
  // The moved file, as it stands now in mobile's folder: whatever mobile may
  // have put there meanwhile is given to it only if it is a file of its own
  // kind (one link, no link to follow).
  Result<UniqueFd> movedFile = OpenEntryNoFollow(to->get(), name, O_PATH, target);
  Status given = movedFile.ok() ? GiveToAccount(movedFile->get(), paths_.mobileAccount, target)
                                : Status(movedFile.error());
  if (!given.ok()) {
    VTRLogError("Couldn't change ownership for %@", target);
    JournalFailure("Cannot give to the mobile account", target, given.error());
    return false;
  }
  return true;
}

Result<UniqueFd> VTRHOperations::prepareDirectoryAt(const std::string& path, bool writableByMobile) {
  std::optional<CheckedPath> checked = checkClientPath(path, ClientUse::kChange);
  if (!checked) return Error(EPERM, path);
  Result<UniqueFd> dir = resolver_.openDirectory(*checked, /*create=*/true);
  if (!dir.ok()) {
    // A directory that cannot be made fails without a word in the day file
    // (the journal says why); a link or a file standing in the way is a
    // refusal.
    const int code = dir.error().code();
    if (code == ELOOP || code == ENOTDIR) {
      LogRefusal(path, dir.error());
    } else {
      JournalFailure("Cannot create or open the directory", path, dir.error());
    }
    return dir.error();
  }
  if (writableByMobile) {
    // These two messages pass the path where the method name stands and have
    // no argument for their last conversion; their texts are kept as they are.
    struct stat st;
    if (::fstat(dir->get(), &st) != 0) {
      const Error error = Error::FromErrno(path);
      VTRLogError("%s: Cannot get attribute from %@", path, nullptr);
      JournalFailure("Cannot read the permissions of", path, error);
      return error;
    }
    if (::fchmod(dir->get(), (st.st_mode & 07777) | 0077) != 0) {
      const Error error = Error::FromErrno(path);
      VTRLogError("%s: Cannot set attribute for %@ - %@", path, error.description(), nullptr);
      JournalFailure("Cannot open the permissions of", path, error);
      return error;
    }
  }
  const std::string& staging = paths_.stagingFolderName;
  if (EntryExists(dir->get(), staging)) {
    const std::string stagingPath = AppendPathComponent(checked->path, staging);
    Status removed = RemoveItemAt(dir->get(), staging, stagingPath);
    if (!removed.ok()) {
      VTRLogError("%s: Could not remove the path %@ with error - %@(0x%x)", kPrepareDirectoryMethod, stagingPath,
             removed.error().description(), static_cast<unsigned>(removed.error().code()));
      return removed.error();
    }
  }
  return dir;
}

bool VTRHOperations::prepareDirectory(const std::string& path, bool writableByMobile) {
  return prepareDirectoryAt(path, writableByMobile).ok();
}

bool VTRHOperations::prepareLogContainer(const std::string& path) {
  Result<UniqueFd> dir = prepareDirectoryAt(path, true);
  if (!dir.ok()) return false;
  // Each entry is handled relative to the folder listed, by descriptor: an
  // entry swapped for a link after the listing is opened as the link itself
  // and passed over.
  if (Result<std::vector<std::string>> names = DirectoryEntryNames(dir->get(), path); names.ok()) {
    for (const std::string& name : *names) {
      if (!HasPrefix(name, paths_.logEntryPrefix)) continue;
      const std::string entryPath = AppendPathComponent(path, name);
      Result<UniqueFd> entry = OpenEntryNoFollow(dir->get(), name, O_PATH, entryPath);
      if (entry.ok()) (void)GiveToAccount(entry->get(), paths_.mobileAccount, entryPath);
    }
  }
  return true;
}

bool VTRHOperations::removeDirectory(const std::string& path) {
  std::optional<CheckedPath> checked = checkClientPath(path, ClientUse::kChange);
  if (!checked) return false;
  Result<UniqueFd> parent = resolver_.openParent(*checked);
  if (!parent.ok()) {
    const int code = parent.error().code();
    if (code == ENOENT || code == ENOTDIR) return true;  // nothing there to remove
    LogRefusal(path, parent.error());
    return false;
  }
  if (!EntryExists(parent->get(), checked->name())) return true;
  Status removed = RemoveItemAt(parent->get(), checked->name(), checked->path);
  if (!removed.ok()) JournalFailure("Cannot remove", path, removed.error());
  return removed.ok();
}

}  // namespace vtr
