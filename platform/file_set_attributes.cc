// Changing the attributes of one item: the values are checked and turned
// into a plan first, then applied without following a link at the path.
#include <fcntl.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cmath>
#include <optional>
#include <span>
#include <string_view>

#include "platform/accounts.h"
#include "platform/file_manager.h"
#include "platform/unique_fd.h"

namespace vtr {
namespace {

// What an attribute dictionary asks for, checked.
struct AttributeChanges {
  std::optional<uid_t> owner;
  std::optional<gid_t> group;
  std::optional<mode_t> mode;
  std::optional<struct timespec> modificationTime;
  std::optional<bool> immutable;
  std::optional<bool> appendOnly;

  bool changesInode() const { return owner || group || mode || modificationTime; }
  bool changesMoreThanOwnership() const { return mode || modificationTime || immutable || appendOnly; }
  bool empty() const { return !changesInode() && !immutable && !appendOnly; }
};

// The attribute dictionary as the plan reads it: when keys is not empty,
// an entry under any other key is passed over as if absent.
struct AttributeLookup {
  const Dictionary& attributes;
  std::span<const std::string_view> keys;

  const Value* find(std::string_view key) const {
    if (!keys.empty() && std::find(keys.begin(), keys.end(), key) == keys.end()) return nullptr;
    return attributes.find(key);
  }
};

Error Invalid(const std::string& path, const char* key, const char* what) {
  return Error(EINVAL, path + ": " + key + " " + what);
}

// An account id: a number that fits a uid_t and is not -1 (which would mean
// "leave as it is").
Result<uint32_t> AccountId(const Value& value, const std::string& path, const char* key) {
  std::optional<uint64_t> id = value.isNumber() ? value.unsignedInteger() : std::nullopt;
  if (!id || *id >= UINT32_MAX) return Invalid(path, key, "is not an account id");
  return static_cast<uint32_t>(*id);
}

// The account asked for by name or id; a name that the database knows wins.
template <typename Lookup>
Result<std::optional<uint32_t>> ResolveAccount(const AttributeLookup& attributes, const char* nameKey, const char* idKey,
                                               Lookup lookup, const std::string& path) {
  const Value* name = attributes.find(nameKey);
  const Value* id = attributes.find(idKey);
  if (name != nullptr) {
    if (name->string() == nullptr) return Invalid(path, nameKey, "is not a string");
    if (std::optional<uint32_t> found = lookup(*name->string())) return std::optional<uint32_t>(*found);
  }
  if (id != nullptr) {
    Result<uint32_t> parsed = AccountId(*id, path, idKey);
    if (!parsed.ok()) return parsed.error();
    return std::optional<uint32_t>(*parsed);
  }
  if (name != nullptr) return Error(EINVAL, path + ": no account named " + *name->string());
  return std::optional<uint32_t>();
}

Result<struct timespec> TimeFromDate(const Value& value, const std::string& path) {
  std::optional<Date> date = value.date();
  // Far beyond any real file time, yet safely inside time_t.
  constexpr double kLimit = 1e15;
  if (!date || !std::isfinite(date->unixSeconds()) || std::fabs(date->unixSeconds()) > kLimit) {
    return Invalid(path, kNSFileModificationDate, "is not a usable date");
  }
  const double seconds = std::floor(date->unixSeconds());
  long nanoseconds = std::lround((date->unixSeconds() - seconds) * 1e9);
  if (nanoseconds > 999999999) nanoseconds = 999999999;
  return timespec{static_cast<time_t>(seconds), nanoseconds};
}

Result<std::optional<bool>> Flag(const AttributeLookup& attributes, const char* key, const std::string& path) {
  const Value* value = attributes.find(key);
  if (value == nullptr) return std::optional<bool>();
  if (value->type() != Value::Type::kBoolean && !value->isNumber()) return Invalid(path, key, "is not a boolean");
  return std::optional<bool>(value->boolValue());
}

Result<AttributeChanges> PlanChanges(const AttributeLookup& attributes, const std::string& path) {
  AttributeChanges changes;
  const std::shared_ptr<const AccountDatabase> accounts = AccountDatabase::Shared();
  auto owner = ResolveAccount(attributes, kNSFileOwnerAccountName, kNSFileOwnerAccountID,
                              [&](std::string_view name) { return accounts->userId(name); }, path);
  if (!owner.ok()) return owner.error();
  changes.owner = *owner;
  auto group = ResolveAccount(attributes, kNSFileGroupOwnerAccountName, kNSFileGroupOwnerAccountID,
                              [&](std::string_view name) { return accounts->groupId(name); }, path);
  if (!group.ok()) return group.error();
  changes.group = *group;

  if (const Value* mode = attributes.find(kNSFilePosixPermissions)) {
    std::optional<uint64_t> bits = mode->isNumber() ? mode->unsignedInteger() : std::nullopt;
    if (!bits) return Invalid(path, kNSFilePosixPermissions, "is not a mode");
    changes.mode = static_cast<mode_t>(*bits & 07777);
  }
  if (const Value* date = attributes.find(kNSFileModificationDate)) {
    Result<struct timespec> time = TimeFromDate(*date, path);
    if (!time.ok()) return time.error();
    changes.modificationTime = *time;
  }
  Result<std::optional<bool>> immutable = Flag(attributes, kNSFileImmutable, path);
  if (!immutable.ok()) return immutable.error();
  changes.immutable = *immutable;
  Result<std::optional<bool>> appendOnly = Flag(attributes, kNSFileAppendOnly, path);
  if (!appendOnly.ok()) return appendOnly.error();
  changes.appendOnly = *appendOnly;
  return changes;
}

ItemFlags FlagsFromStatx(const struct statx& stx) {
  auto has = [&](uint64_t flag) { return (stx.stx_attributes_mask & flag) && (stx.stx_attributes & flag); };
  return ItemFlags{has(STATX_ATTR_IMMUTABLE), has(STATX_ATTR_APPEND)};
}

// The same at path, opened without following a link and without blocking.
Status SetFlags(const std::string& path, ItemFlags wanted) {
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
  if (!fd) return Error::FromErrno(path);
  return SetFlagsOfDescriptor(fd.get(), wanted, path);
}

}  // namespace

Status SetFlagsOfDescriptor(int fd, ItemFlags wanted, const std::string& path) {
  struct stat st;
  if (::fstat(fd, &st) != 0) return Error::FromErrno(path);
  // On a device the request would reach the driver.
  if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode)) return Error(EOPNOTSUPP, path);
  int flags = 0;
  if (::ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0) return Error::FromErrno(path);
  flags = wanted.immutable ? (flags | FS_IMMUTABLE_FL) : (flags & ~FS_IMMUTABLE_FL);
  flags = wanted.appendOnly ? (flags | FS_APPEND_FL) : (flags & ~FS_APPEND_FL);
  if (::ioctl(fd, FS_IOC_SETFLAGS, &flags) != 0) return Error::FromErrno(path);
  return Status::Ok();
}

Result<ItemFlags> FlagsOfDescriptor(int fd, const std::string& path) {
  struct statx stx;
  if (::statx(fd, "", AT_EMPTY_PATH, STATX_TYPE, &stx) != 0) return Error::FromErrno(path);
  return FlagsFromStatx(stx);
}

Result<ItemOwnership> OwnershipAfter(const Dictionary& attributes, const struct stat& current,
                                     const std::string& pathForErrors, std::span<const std::string_view> onlyKeys) {
  Result<AttributeChanges> changes = PlanChanges(AttributeLookup{attributes, onlyKeys}, pathForErrors);
  if (!changes.ok()) return changes.error();
  return ItemOwnership{changes->owner.value_or(current.st_uid), changes->group.value_or(current.st_gid),
                       changes->mode.value_or(current.st_mode & 07777)};
}

Status SetAttributes(const Dictionary& attributes, const std::string& path, LinkAtPath linkAtPath) {
  Result<AttributeChanges> changes = PlanChanges(AttributeLookup{attributes, {}}, path);
  if (!changes.ok()) return changes.error();
  if (changes->empty()) return Status::Ok();

  struct statx stx;
  if (::statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, STATX_TYPE | STATX_MODE, &stx) != 0) {
    return Error::FromErrno(path);
  }
  if (S_ISLNK(stx.stx_mode) && (linkAtPath == LinkAtPath::kRefuse || changes->changesMoreThanOwnership())) {
    return Error(ELOOP, path);
  }

  ItemFlags current = FlagsFromStatx(stx);
  const ItemFlags wanted{changes->immutable.value_or(current.immutable),
                         changes->appendOnly.value_or(current.appendOnly)};
  // Immutable and append-only items refuse every other change.
  if (current.any() && changes->changesInode()) {
    Status unlocked = SetFlags(path, ItemFlags{});
    if (!unlocked.ok()) return unlocked;
    current = ItemFlags{};
  }
  // Each call below refuses or stays on a link that was swapped in since
  // the statx above: nothing is followed.
  if (changes->owner || changes->group) {
    Status owned = ChangeOwnerOfItem(path, changes->owner.value_or(static_cast<uid_t>(-1)),
                                     changes->group.value_or(static_cast<gid_t>(-1)));
    if (!owned.ok()) return owned;
  }
  if (changes->mode) {
    Status moded = ChangeModeOfItem(path, *changes->mode);
    if (!moded.ok()) return moded;
  }
  if (changes->modificationTime) {
    const struct timespec times[2] = {{0, UTIME_OMIT}, *changes->modificationTime};
    if (::utimensat(AT_FDCWD, path.c_str(), times, AT_SYMLINK_NOFOLLOW) != 0) return Error::FromErrno(path);
  }
  if (wanted != current) return SetFlags(path, wanted);
  return Status::Ok();
}

Result<std::optional<ItemFlags>> SetAttributesOfDescriptorExceptFlags(const Dictionary& attributes, int fd,
                                                                      const std::string& pathForErrors,
                                                                      std::span<const std::string_view> onlyKeys,
                                                                      bool unlockForMore) {
  const std::string& path = pathForErrors;
  Result<AttributeChanges> changes = PlanChanges(AttributeLookup{attributes, onlyKeys}, path);
  if (!changes.ok()) return changes.error();
  if (changes->empty() && !unlockForMore) return std::optional<ItemFlags>();
  struct statx stx;
  if (::statx(fd, "", AT_EMPTY_PATH, STATX_TYPE | STATX_MODE | STATX_NLINK | STATX_UID | STATX_GID | STATX_MTIME,
              &stx) != 0) {
    return Error::FromErrno(path);
  }
  if (!S_ISREG(stx.stx_mode) && !S_ISDIR(stx.stx_mode)) return Error(EOPNOTSUPP, path);
  // What already holds is not set again (a restore over content that is
  // mostly right costs little). A change of owner clears the set-id bits,
  // so the mode is set after one whatever it was.
  if (changes->owner == stx.stx_uid) changes->owner.reset();
  if (changes->group == stx.stx_gid) changes->group.reset();
  if (!changes->owner && !changes->group && changes->mode == (stx.stx_mode & 07777)) changes->mode.reset();
  if (changes->modificationTime && changes->modificationTime->tv_sec == stx.stx_mtime.tv_sec &&
      changes->modificationTime->tv_nsec == static_cast<long>(stx.stx_mtime.tv_nsec)) {
    changes->modificationTime.reset();
  }
  // A file linked elsewhere too would hand over an inode that lives there:
  // it may go to root, never to anyone else.
  const bool handedOver = (changes->owner && *changes->owner != stx.stx_uid && *changes->owner != 0) ||
                          (changes->group && *changes->group != stx.stx_gid && *changes->group != 0);
  if (S_ISREG(stx.stx_mode) && stx.stx_nlink > 1 && handedOver) {
    return Error(EMLINK, path + " has more than one link and is never given another owner");
  }
  const ItemFlags current = FlagsFromStatx(stx);
  const ItemFlags wanted{changes->immutable.value_or(current.immutable),
                         changes->appendOnly.value_or(current.appendOnly)};
  // Immutable and append-only items refuse every other change, the
  // caller's too: the flags go last.
  const bool unlock = current.any() && (changes->changesInode() || unlockForMore);
  if (unlock) {
    if (Status unlocked = SetFlagsOfDescriptor(fd, ItemFlags{}, path); !unlocked.ok()) return unlocked.error();
  }
  // Owner before mode: a change of owner clears the set-id bits.
  if ((changes->owner || changes->group) &&
      ::fchown(fd, changes->owner.value_or(static_cast<uid_t>(-1)), changes->group.value_or(static_cast<gid_t>(-1))) != 0) {
    return Error::FromErrno(path);
  }
  if (changes->mode && ::fchmod(fd, *changes->mode) != 0) return Error::FromErrno(path);
  if (changes->modificationTime) {
    const struct timespec times[2] = {{0, UTIME_OMIT}, *changes->modificationTime};
    if (::futimens(fd, times) != 0) return Error::FromErrno(path);
  }
  if (wanted != (unlock ? ItemFlags{} : current)) return std::optional<ItemFlags>(wanted);
  return std::optional<ItemFlags>();
}

Status SetAttributesOfDescriptor(const Dictionary& attributes, int fd, const std::string& pathForErrors,
                                 std::span<const std::string_view> onlyKeys) {
  Result<std::optional<ItemFlags>> last =
      SetAttributesOfDescriptorExceptFlags(attributes, fd, pathForErrors, onlyKeys, false);
  if (!last.ok()) return last.error();
  if (*last) return SetFlagsOfDescriptor(fd, **last, pathForErrors);
  return Status::Ok();
}

}  // namespace vtr
