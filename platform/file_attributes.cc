// The attribute dictionary of one item, from a single statx, and the target
// of a symbolic link.
#include <fcntl.h>
#include <linux/limits.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include "platform/accounts.h"
#include "platform/file_dates.h"
#include "platform/file_manager.h"

namespace vtr {
namespace {

const char* FileTypeName(mode_t mode) {
  switch (mode & S_IFMT) {
    case S_IFREG: return kNSFileTypeRegular;
    case S_IFDIR: return kNSFileTypeDirectory;
    case S_IFLNK: return kNSFileTypeSymbolicLink;
    case S_IFCHR: return kNSFileTypeCharacterSpecial;
    case S_IFBLK: return kNSFileTypeBlockSpecial;
    case S_IFSOCK: return kNSFileTypeSocket;
    default: return kNSFileTypeUnknown;
  }
}

// Whether the file system reports attribute bit `flag` and the item has it.
bool HasAttribute(const struct statx& stx, uint64_t flag) {
  return (stx.stx_attributes_mask & flag) != 0 && (stx.stx_attributes & flag) != 0;
}

}  // namespace

Result<Value> AttributesOfItem(const std::string& path) { return AttributesOfItemAt(AT_FDCWD, path, path); }

Result<Value> AttributesOfItemAt(int dirFd, const std::string& name, const std::string& pathForErrors) {
  struct statx stx;
  if (::statx(dirFd, name.c_str(), AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS | STATX_BTIME, &stx) != 0) {
    return Error::FromErrno(pathForErrors);
  }
  const bool isDevice = S_ISCHR(stx.stx_mode) || S_ISBLK(stx.stx_mode);
  const std::shared_ptr<const AccountDatabase> accounts = AccountDatabase::Shared();
  const std::string* ownerName = accounts->userName(stx.stx_uid);
  const std::string* groupName = accounts->groupName(stx.stx_gid);

  DictionaryBuilder attributes;
  attributes.reserve(17);
  attributes.add(kNSFileAppendOnly, Value::Boolean(HasAttribute(stx, STATX_ATTR_APPEND)));
  attributes.add(kNSFileCreationDate, Value::DateValue(CreationDateFromStatx(stx)));
  if (isDevice) {
    attributes.add(kNSFileDeviceIdentifier,
                   Value::Integer(static_cast<int64_t>(::makedev(stx.stx_rdev_major, stx.stx_rdev_minor))));
  }
  attributes.add(kNSFileExtensionHidden, Value::Boolean(false));
  attributes.add(kNSFileGroupOwnerAccountID, Value::Integer(stx.stx_gid));
  if (groupName != nullptr) attributes.add(kNSFileGroupOwnerAccountName, Value::String(*groupName));
  attributes.add(kNSFileImmutable, Value::Boolean(HasAttribute(stx, STATX_ATTR_IMMUTABLE)));
  attributes.add(kNSFileModificationDate, Value::DateValue(ModificationDateFromStatx(stx)));
  attributes.add(kNSFileOwnerAccountID, Value::Integer(stx.stx_uid));
  if (ownerName != nullptr) attributes.add(kNSFileOwnerAccountName, Value::String(*ownerName));
  attributes.add(kNSFilePosixPermissions, Value::Integer(stx.stx_mode & 07777));
  attributes.add(kNSFileReferenceCount, Value::Integer(stx.stx_nlink));
  attributes.add(kNSFileSize, Value::Unsigned(stx.stx_size));
  attributes.add(kNSFileSystemFileNumber, Value::Unsigned(stx.stx_ino));
  attributes.add(kNSFileSystemNumber,
                 Value::Integer(static_cast<int64_t>(::makedev(stx.stx_dev_major, stx.stx_dev_minor))));
  attributes.add(kNSFileType, Value::String(FileTypeName(stx.stx_mode)));
  return attributes.build();
}

Result<std::string> DestinationOfSymbolicLinkAt(int dirFd, const std::string& name,
                                                const std::string& pathForErrors) {
  // Linux keeps link targets below PATH_MAX bytes; a full buffer means the
  // text may have been cut.
  char buffer[PATH_MAX];
  const ssize_t n = ::readlinkat(dirFd, name.c_str(), buffer, sizeof buffer);
  if (n < 0) return Error::FromErrno(pathForErrors);
  if (static_cast<size_t>(n) == sizeof buffer) return Error(ENAMETOOLONG, pathForErrors);
  return std::string(buffer, static_cast<size_t>(n));
}

}  // namespace vtr
