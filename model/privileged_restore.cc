// Privilege follows the signature: a record that makes a regular file
// privileged is laid only onto content that hashes to the record's SHA-1,
// on an inode that a lease proves nobody can write or that the helper made
// itself, so that nothing the client still holds (a writable descriptor, a
// shared mapping, another link) reaches what is granted.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "model/file_hash.h"
#include "model/log.h"
#include "model/restore_steps.h"
#include "platform/file_manager.h"
#include "platform/fresh_file.h"
#include "platform/item_io.h"
#include "platform/writer_lease.h"

namespace vtr {
namespace {

constexpr std::string_view kSecurityNamespace = "security.";

bool HasSecurityAttribute(const Dictionary* extendedAttributes) {
  if (extendedAttributes == nullptr) return false;
  for (const auto& entry : *extendedAttributes) {
    if (std::string_view(entry.first).starts_with(kSecurityNamespace)) return true;
  }
  return false;
}

// Why the file open as item cannot be the record's content before anything
// is copied, or nullptr: the record must hold a SHA-1, and the size it
// records (signed like the hash) bounds the copy.
const char* ContentRefusal(const VTRFileMetadata& record, const struct stat& st) {
  const Bytes* hash = record.getHash();
  if (hash == nullptr || hash->size() != kFileHashDigestBytes) return "the record holds no content hash";
  const Dictionary* attributes = record.getFileAttributes();
  const Value* size = attributes != nullptr ? attributes->find(kNSFileSize) : nullptr;
  if (size != nullptr && size->unsignedInteger() != static_cast<uint64_t>(st.st_size)) {
    return "its size is not the record's";
  }
  return nullptr;
}

// Closes the staged file open as fd to everyone but the helper before its
// content is judged: owner and group the helper's, no access list, and the
// record's mode without set-id bits and without write for group or others
// (nothing is granted yet, and a record that gives the file to root then
// seldom needs its mode set a second time). An open for writing that passed
// its permission check while the file was still mobile's and has not yet
// taken its write access (which a lease cannot see) must be caught by the
// lease while the content is hashed, not after the grant.
bool CloseToOthers(int fd, mode_t mode) {
  return ::fchown(fd, ThisUser(), ::getegid()) == 0 && ::fchmod(fd, mode & 0755) == 0 && DropAccessLists(fd);
}

// The mode the record leaves the file open as fd (status st before)
// closed to others: 0600 when the record's cannot be read.
mode_t ClosedMode(const Dictionary& all, const struct stat& st, const std::string& path) {
  Result<ItemOwnership> ownership = OwnershipAfter(all, st, path, AttributesAllowedToSet());
  return ownership.ok() ? ownership->mode & 0755 : 0600;
}

// Gives the item open as fd the owner, group and mode the record leaves it
// (from its status before anything was done): owner before mode, as a
// change of owner clears set-id bits.
Status LayOwnership(int fd, const Dictionary& all, const struct stat& st, const std::string& path) {
  Result<ItemOwnership> ownership = OwnershipAfter(all, st, path, AttributesAllowedToSet());
  if (!ownership.ok()) return ownership.error();
  // What already holds is not set again: each change of an inode is a
  // journal entry, and most records give root what closing gave it.
  struct stat now;
  if (!StatOf(fd, &now)) return Error::FromErrno(path);
  const bool owned = now.st_uid == ownership->uid && now.st_gid == ownership->gid;
  if (!owned && ::fchown(fd, ownership->uid, ownership->gid) != 0) return Error::FromErrno(path);
  if ((!owned || (now.st_mode & 07777) != ownership->mode) && ::fchmod(fd, ownership->mode) != 0) {
    return Error::FromErrno(path);
  }
  return Status::Ok();
}

void LogRefusal(const std::string& path, const char* why) {
  VTRLogError("Not granting privilege to %@: %@", path, std::string(why));
}

// Takes back what the record gave the staged file open as item (status st
// before): its owner, group and mode, and the "security." attributes.
void TakeBack(const VTRFileMetadata& record, int item, const struct stat& st) {
  (void)::fchown(item, st.st_uid, st.st_gid);
  (void)::fchmod(item, st.st_mode & 0777);
  if (const Dictionary* extendedAttributes = record.getExtendedAttributes()) {
    for (const auto& entry : *extendedAttributes) {
      if (std::string_view(entry.first).starts_with(kSecurityNamespace)) (void)RemoveExtendedAttributeOf(item, entry.first);
    }
  }
}

// The record laid onto the staged file itself, when a lease proves that no
// process can write it and it has one link: its content is hashed where it
// lies and the record laid on it while the lease holds; if a writer came to
// wait meanwhile (it passed its permission check as mobile's) or a link was
// made, the grant is taken back before the lease goes. nullopt when no
// proof could be had (the copy is made then); else the answer, after its
// message.
std::optional<bool> RestoreInPlace(const VTRFileMetadata& record, const Dictionary& all, int item,
                                   const struct stat& st, const std::string& path) {
  if (st.st_nlink != 1) return std::nullopt;
  WriterLease lease(item);
  if (!lease.held()) return std::nullopt;
  // No writer can write while the lease holds: a new one waits on it.
  if (!CloseToOthers(item, ClosedMode(all, st, path))) {
    TakeBack(record, item, st);
    return std::nullopt;
  }
  const std::optional<Bytes> digest = fileHashOfDescriptor(item, path, PageCache::kKeep);
  if (!digest || *digest != *record.getHash()) {
    TakeBack(record, item, st);
    if (digest) LogRefusal(path, "its content does not hash to the record's");
    return false;
  }
  // Asked before the grant as well as after: a writer that was let in when
  // the kernel's lease-break time ran out (while a large file was hashed)
  // must never meet a granted file, and a break that starts after this
  // runs out long after the grant was checked again.
  // A writer that took its write access meanwhile but has not come to
  // the lease yet will wait on it, and the check after the grant sees it.
  if (!lease.unbroken()) {
    TakeBack(record, item, st);
    return std::nullopt;
  }
  // What the record leaves out is what the file had before it was closed.
  const Dictionary* extendedAttributes = record.getExtendedAttributes();
  Status given = LayOwnership(item, all, st, path);
  Result<std::optional<ItemFlags>> last =
      given.ok() ? SetAttributesOfDescriptorExceptFlags(all, item, path, AttributesAllowedToSet(),
                                                        extendedAttributes != nullptr && !extendedAttributes->empty())
                 : Result<std::optional<ItemFlags>>(given.error());
  if (!last.ok()) {
    TakeBack(record, item, st);
    LogAttributesNotSet(path, last.error(), all);
    return false;
  }
  (void)SetRecordExtendedAttributesOf(extendedAttributes, item, path);
  struct stat now;
  if (!lease.stillAlone() || !StatOf(item, &now) || now.st_nlink != 1) {
    TakeBack(record, item, st);
    return std::nullopt;
  }
  if (*last) {
    if (Status flagged = SetFlagsOfDescriptor(item, **last, path); !flagged.ok()) {
      LogAttributesNotSet(path, flagged.error(), all);
      return false;
    }
  }
  return true;
}

}  // namespace

bool DropAccessLists(int fd) {
  // Asked before it is removed: a removal is a journal entry even where
  // there is nothing to remove, and most files have no list.
  auto drop = [fd](const char* name) {
    if (GetExtendedAttributeOf(fd, name, nullptr, 0) < 0 && (errno == ENODATA || errno == EOPNOTSUPP)) return true;
    return RemoveExtendedAttributeOf(fd, name) == 0 || errno == ENODATA || errno == EOPNOTSUPP;
  };
  struct stat st;
  return StatOf(fd, &st) && drop("system.posix_acl_access") &&
         (!S_ISDIR(st.st_mode) || drop("system.posix_acl_default"));
}

bool GrantsPrivilege(const VTRFileMetadata& record, const struct stat& st, const ClientAccount& client) {
  static const Dictionary kNone;
  const Dictionary* attributes = record.getFileAttributes();
  Result<ItemOwnership> after =
      OwnershipAfter(attributes != nullptr ? *attributes : kNone, st, "", AttributesAllowedToSet());
  if (!after.ok()) return true;
  return after->uid != client.uid || after->gid != client.gid || (after->mode & (S_ISUID | S_ISGID)) != 0 ||
         HasSecurityAttribute(record.getExtendedAttributes());
}

bool RestoreOntoVerifiedCopy(const VTRFileMetadata& record, int dirFd, const std::string& name, int item,
                             const struct stat& st, const std::string& path) {
  static const Dictionary kNone;
  const Dictionary& all = record.getFileAttributes() != nullptr ? *record.getFileAttributes() : kNone;
  if (const char* refusal = ContentRefusal(record, st)) {
    LogRefusal(path, refusal);
    return false;
  }
  if (std::optional<bool> inPlace = RestoreInPlace(record, all, item, st, path)) return *inPlace;
  Result<FreshFile> copy = FreshFile::MakeIn(dirFd, path);
  if (!copy.ok() || !DropAccessLists(copy->fd())) {
    LogAttributesNotSet(path, copy.ok() ? Error::FromErrno(path) : copy.error(), all);
    return false;
  }
  const std::optional<Bytes> digest = copyHashing(item, static_cast<uint64_t>(st.st_size), copy->fd());
  if (!digest) {
    LogAttributesNotSet(path, Error::FromErrno(path), all);
    return false;
  }
  if (*digest != *record.getHash()) {
    LogRefusal(path, "its content does not hash to the record's");
    return false;
  }
  // The copy takes what the item would have been given (owner before mode:
  // a change of owner clears set-id bits), then the rest of the record;
  // its extended attributes before the flags that would forbid them.
  Status given = LayOwnership(copy->fd(), all, st, path);
  Result<std::optional<ItemFlags>> last =
      given.ok() ? SetAttributesOfDescriptorExceptFlags(all, copy->fd(), path, AttributesAllowedToSet(), false)
                 : Result<std::optional<ItemFlags>>(given.error());
  if (!last.ok()) {
    LogAttributesNotSet(path, last.error(), all);
    return false;
  }
  // A failed extended attribute is logged and does not fail the record.
  (void)SetRecordExtendedAttributesOf(record.getExtendedAttributes(), copy->fd(), path);
  // The staged inode loses this name. A flag that keeps it from losing it
  // is lifted only when this is its one link (it goes with the name).
  Status placed = copy->install(name);
  if (!placed.ok() && placed.error().code() == EPERM && st.st_nlink == 1) {
    Result<ItemFlags> flags = FlagsOfDescriptor(item, path);
    if (flags.ok() && flags->any() && SetFlagsOfDescriptor(item, ItemFlags{}, path).ok()) placed = copy->install(name);
  }
  if (placed.ok() && *last) placed = SetFlagsOfDescriptor(copy->fd(), **last, path);
  if (!placed.ok()) {
    LogAttributesNotSet(path, placed.error(), all);
    return false;
  }
  return true;
}

}  // namespace vtr
