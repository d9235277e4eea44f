// Using a file metadata record: laying it onto an item, comparing two.
#include <fcntl.h>
#include <sys/stat.h>

#include <array>
#include <cstring>
#include <string_view>

#include "model/file_metadata.h"
#include "model/log.h"
#include "model/restore_steps.h"
#include "platform/file_manager.h"
#include "platform/file_tree.h"
#include "platform/item_io.h"
#include "platform/unique_fd.h"

namespace vtr {
namespace {

// The attributes a restore may set. The protection class is set in a step
// of its own.
constexpr std::array<std::string_view, 12> kAllowedToSet = {
    kNSFileBusy,
    kNSFileHFSCreatorCode,
    kNSFileHFSTypeCode,
    kNSFileImmutable,
    kNSFileCreationDate,
    kNSFileExtensionHidden,
    kNSFileGroupOwnerAccountID,
    kNSFileGroupOwnerAccountName,
    kNSFileModificationDate,
    kNSFileOwnerAccountID,
    kNSFileOwnerAccountName,
    kNSFilePosixPermissions,
};

// A number of the attributes read as a C int, the way the system reads ids
// and modes off its number objects: missing or not a number reads as 0.
int32_t Int32Attribute(const Dictionary* attributes, const char* key) {
  const Value* value = attributes != nullptr ? attributes->find(key) : nullptr;
  if (value == nullptr) return 0;
  if (std::optional<int64_t> i = value->integer()) return static_cast<int32_t>(*i);
  if (std::optional<uint64_t> u = value->unsignedInteger()) return static_cast<int32_t>(*u);
  return 0;
}

// Sets the record's extended attributes in name order with set(name,
// value) (0 or -1 as setxattr answers); false, after its message, at the
// first that cannot be set.
template <typename Setter>
bool SetExtendedAttributesWith(const Dictionary* attributes, const std::string& path, const Setter& set) {
  if (attributes == nullptr) return true;
  for (const auto& [name, value] : *attributes) {
    if (name.empty() || name.find('\0') != std::string::npos) {
      VTRLogError("Got Non-string key");
      return false;
    }
    const Bytes* data = value.data();
    if (data == nullptr) {
      VTRLogError("Got non-data value");
      return false;
    }
    if (set(name, *data) != 0) {
      VTRJournalError("Cannot set the extended attribute %@ of %@: %s", name, path, std::strerror(errno));
      VTRLogError("Could not set extended attributes on %@", path);
      return false;
    }
  }
  return true;
}

// Sets the record's extended attributes in name order; false at the first
// that cannot be set.
bool SetExtendedAttributes(const Dictionary* attributes, const std::string& path) {
  return SetExtendedAttributesWith(attributes, path, [&path](const std::string& name, const Bytes& data) {
    return SetExtendedAttributeOfPath(path, name, data.data(), data.size());
  });
}

// Extended attributes without the one that is not compared.
Dictionary ComparableExtendedAttributes(const Dictionary* attributes) {
  if (attributes == nullptr) return Dictionary();
  std::vector<Dictionary::Entry> entries;
  entries.reserve(attributes->size());
  for (const auto& entry : *attributes) {
    if (entry.first != kIgnoredExtendedAttribute) entries.push_back(entry);
  }
  return Dictionary(std::move(entries));
}

bool SameBytes(const Bytes* a, const Bytes* b) { return a != nullptr && b != nullptr && *a == *b; }
bool SameString(const std::string* a, const std::string* b) { return a != nullptr && b != nullptr && *a == *b; }

}  // namespace

Dictionary VTRFileMetadata::fileAttributesAllowSet(const Dictionary& attributes) {
  std::vector<Dictionary::Entry> allowed;
  for (const auto& entry : attributes) {
    for (std::string_view key : kAllowedToSet) {
      if (entry.first == key) allowed.push_back(entry);
    }
  }
  return Dictionary(std::move(allowed));
}

bool VTRFileMetadata::restoreAttribuesToPath(const std::string& path) const {
  const Dictionary* attributes = getFileAttributes();
  const std::string* type = getFileType();
  bool attributesSet = false;
  if (type != nullptr && *type == kNSFileTypeSymbolicLink) {
    (void)ChangeOwnerOfItem(path, static_cast<uid_t>(Int32Attribute(attributes, kNSFileOwnerAccountID)),
                            static_cast<gid_t>(Int32Attribute(attributes, kNSFileGroupOwnerAccountID)));
    // Linux links have no mode of their own; the failure is expected.
    (void)ChangeModeOfItem(path, static_cast<mode_t>(Int32Attribute(attributes, kNSFilePosixPermissions)) & 07777);
  } else {
    const Dictionary allowed = attributes != nullptr ? fileAttributesAllowSet(*attributes) : Dictionary();
    Status set = SetAttributes(allowed, path, LinkAtPath::kRefuse);
    if (!set.ok()) {
      VTRLogError("Could not set file attributs at %@ with error - %@, attributes = %@", path, set.error(),
             Value::DictionaryOf(allowed));
      return false;
    }
    const Value* protection = attributes != nullptr ? attributes->find(kNSFileProtectionKey) : nullptr;
    Dictionary protectionOnly;
    if (protection != nullptr) protectionOnly = Dictionary({{kNSFileProtectionKey, *protection}});
    set = SetAttributes(protectionOnly, path, LinkAtPath::kRefuse);
    if (!set.ok()) {
      VTRLogError("Could not set file protection key at %@ with error - %@, attributes = %@", path, set.error(),
             protection != nullptr ? *protection : Value());
      return false;
    }
    attributesSet = true;
  }
  const bool extendedAttributesSet = SetExtendedAttributes(getExtendedAttributes(), path);
  return attributesSet || extendedAttributesSet;
}

bool VTRFileMetadata::restoreAttribuesToItemAt(int dirFd, const std::string& name, const std::string& path,
                                               const ClientAccount& client) const {
  const Dictionary* attributes = getFileAttributes();
  const std::string* type = getFileType();
  if (type != nullptr && *type == kNSFileTypeSymbolicLink) {
    // Only a link gets a link record, through a descriptor of the link
    // itself: a file put in its place (a hard link to another's file) is
    // neither handed over nor given attributes.
    UniqueFd link = OpenLinkItself(dirFd, name);
    struct stat st;
    if (!link || !StatOf(link.get(), &st) || !S_ISLNK(st.st_mode)) {
      LogAttributesNotSet(path, link ? Error(EINVAL, path + " is not a symbolic link") : Error::FromErrno(path),
                          attributes != nullptr ? *attributes : Dictionary());
      return false;
    }
    // A link's own owner; Linux gives links no mode. The result is not
    // checked, as on the platform.
    (void)ChangeOwnerOfLink(link.get(), static_cast<uid_t>(Int32Attribute(attributes, kNSFileOwnerAccountID)),
                            static_cast<gid_t>(Int32Attribute(attributes, kNSFileGroupOwnerAccountID)));
    return SetExtendedAttributesWith(getExtendedAttributes(), path, [&](const std::string& key, const Bytes& data) {
      return SetExtendedAttributeOfLink(link.get(), dirFd, name, key, data.data(), data.size());
    });
  }
  static const Dictionary kNone;
  const Dictionary& all = attributes != nullptr ? *attributes : kNone;
  // Only a regular file or a directory is opened: a device's open could
  // reach its driver, a fifo's block. What is decided is decided on the
  // opened item's own status.
  // The type is asked again of the opened item: a fifo swapped in between
  // opens (without blocking) but is no item to lay a record on.
  UniqueFd item;
  struct stat st;
  Status set = Status::Ok();
  auto openable = [](const struct stat& s) { return S_ISREG(s.st_mode) || S_ISDIR(s.st_mode); };
  if (!StatAt(dirFd, name, &st)) {
    set = Error::FromErrno(path);
  } else if (!openable(st)) {
    set = Error(S_ISLNK(st.st_mode) ? ELOOP : EOPNOTSUPP, path);
  } else if (item = OpenAt(dirFd, name, kReadItemFlags); !item || !StatOf(item.get(), &st)) {
    set = Error::FromErrno(path);
  } else if (!openable(st)) {
    set = Error(EOPNOTSUPP, path);
  } else if (S_ISREG(st.st_mode) && GrantsPrivilege(*this, st, client)) {
    return RestoreOntoVerifiedCopy(*this, dirFd, name, item.get(), st, path);
  }
  // The extended attributes go on before the flags that would forbid them
  // (lifted first when the item has them).
  const Dictionary* extendedAttributes = getExtendedAttributes();
  Result<std::optional<ItemFlags>> last =
      set.ok() ? SetAttributesOfDescriptorExceptFlags(all, item.get(), path, AttributesAllowedToSet(),
                                                      extendedAttributes != nullptr && !extendedAttributes->empty())
               : Result<std::optional<ItemFlags>>(set.error());
  if (!last.ok()) {
    LogAttributesNotSet(path, last.error(), all);
    return false;
  }
  // A folder given to another keeps no access list of mobile's.
  if (S_ISDIR(st.st_mode) && GrantsPrivilege(*this, st, client) && !DropAccessLists(item.get())) {
    LogAttributesNotSet(path, Error::FromErrno(path), all);
    return false;
  }
  // The protection class has no Linux counterpart: setting it succeeds
  // without effect, so its step cannot fail here. A failed extended
  // attribute is logged and does not fail the record.
  (void)SetRecordExtendedAttributesOf(extendedAttributes, item.get(), path);
  if (*last) {
    if (Status flagged = SetFlagsOfDescriptor(item.get(), **last, path); !flagged.ok()) {
      LogAttributesNotSet(path, flagged.error(), all);
      return false;
    }
  }
  return true;
}

std::span<const std::string_view> AttributesAllowedToSet() { return kAllowedToSet; }

bool SetRecordExtendedAttributesOf(const Dictionary* extendedAttributes, int fd, const std::string& path) {
  return SetExtendedAttributesWith(extendedAttributes, path, [fd](const std::string& key, const Bytes& data) {
    return SetExtendedAttributeOf(fd, key, data.data(), data.size());
  });
}

void LogAttributesNotSet(const std::string& path, const Error& error, const Dictionary& attributes) {
  VTRLogError("Could not set file attributs at %@ with error - %@, attributes = %@", path, error,
              Value::DictionaryOf(VTRFileMetadata::fileAttributesAllowSet(attributes)));
}

int VTRFileMetadata::compareWith(const VTRFileMetadata* other) const {
  if (other == nullptr) return kVTRFileOtherAbsent;
  const std::string* type = getFileType();
  if (!SameString(type, other->getFileType())) return kVTRFileTypeDiffers;
  if (*type == kNSFileTypeRegular && !SameBytes(getHash(), other->getHash())) return kVTRFileHashDiffers;
  if (*type == kNSFileTypeSymbolicLink && !SameString(getTargetFile(), other->getTargetFile())) {
    return kVTRFileTargetDiffers;
  }

  // Only ownership and mode count. The protection class is tolerated: the
  // walk runs over this record's keys, so a class present here never makes
  // the records differ.
  if (const Dictionary* attributes = getFileAttributes()) {
    const Dictionary* theirs = other->getFileAttributes();
    for (const char* key : {kNSFileGroupOwnerAccountID, kNSFileOwnerAccountID, kNSFilePosixPermissions}) {
      const Value* mine = attributes->find(key);
      if (mine == nullptr) continue;
      const Value* their = theirs != nullptr ? theirs->find(key) : nullptr;
      if (their == nullptr || !(*mine == *their)) return kVTRFileOwnershipDiffers;
    }
  }

  const Dictionary mine = ComparableExtendedAttributes(getExtendedAttributes());
  const Dictionary theirs = ComparableExtendedAttributes(other->getExtendedAttributes());
  if (mine.size() != theirs.size()) return kVTRFileExtendedAttributesDiffer;
  for (const auto& [name, value] : mine) {
    const Value* their = theirs.find(name);
    if (their == nullptr || !SameBytes(value.data(), their->data())) return kVTRFileExtendedAttributesDiffer;
  }
  return kVTRFileSame;
}

}  // namespace vtr
