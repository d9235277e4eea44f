// Reading a file metadata record from disk, and the record's getters.
#include "model/file_metadata.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cstring>

#include "model/file_hash.h"
#include "model/log.h"
#include "platform/file_manager.h"
#include "platform/file_tree.h"
#include "platform/item_io.h"
#include "platform/unique_fd.h"

namespace vtr {
namespace {

// What a record reads of an item, by the type its attributes give.
enum class ItemKind { kRegular, kDirectory, kSymbolicLink, kOther };

ItemKind KindOfType(const Value& type) {
  const std::string* name = type.string();
  if (name == nullptr) return ItemKind::kOther;
  if (*name == kNSFileTypeRegular) return ItemKind::kRegular;
  if (*name == kNSFileTypeDirectory) return ItemKind::kDirectory;
  if (*name == kNSFileTypeSymbolicLink) return ItemKind::kSymbolicLink;
  return ItemKind::kOther;
}

// The directory holding the item at path, open, and the item's name in it
// (links above the item are followed, as in any path). A path whose last
// component names no entry ("/", ".", "..") is a directory itself: it is
// opened and named ".". Errors name path.
Result<ParentAndName> OpenItemDirectory(const std::string& path) {
  Result<ParentAndName> parent = OpenParent(path);
  if (parent.ok()) return parent;
  if (parent.error().code() != EINVAL || path.empty()) return Error(parent.error().code(), path);
  UniqueFd self = OpenAt(AT_FDCWD, path, O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (!self) return Error::FromErrno(path);
  return ParentAndName{std::move(self), "."};
}

// A regular file or directory opened for the reads of its record, relative
// to its directory and never through a link; its extended attributes and
// content are then read through the descriptor, so that nothing renamed or
// swapped meanwhile changes what is read. Links and special files are not
// opened (a device could act on an open).
struct OpenedItem {
  UniqueFd fd;
  int openError = 0;  // errno of a failed open
};

OpenedItem OpenForRecord(int dirFd, const std::string& name, ItemKind kind) {
  OpenedItem item;
  if (kind == ItemKind::kRegular) {
    item.fd = OpenFileForHashAt(dirFd, name);
  } else if (kind == ItemKind::kDirectory) {
    item.fd = OpenAt(dirFd, name, kDirectoryFlags | O_NONBLOCK);
  } else {
    return item;
  }
  if (!item.fd) item.openError = errno;
  return item;
}

// Where an item's extended attributes are read: its own descriptor when it
// is open, else its name in its directory. The path is for messages, and is
// the way in on kernels without the *xattrat calls only where allowed: a
// file or directory that was meant to be opened is never reached by path.
struct XattrSource {
  int fd;
  int dirFd;
  const std::string& name;
  const std::string& path;
  bool mayUsePath;
};

ssize_t ListXattrs(const XattrSource& item, char* list, size_t size) {
  if (item.fd >= 0) return ListExtendedAttributesOf(item.fd, list, size);
  return ListExtendedAttributesAt(item.dirFd, item.name, list, size, item.mayUsePath ? &item.path : nullptr);
}

ssize_t GetXattr(const XattrSource& item, const std::string& key, void* value, size_t size) {
  if (item.fd >= 0) return GetExtendedAttributeOf(item.fd, key, value, size);
  return GetExtendedAttributeAt(item.dirFd, item.name, key, value, size, item.mayUsePath ? &item.path : nullptr);
}

std::optional<std::vector<std::string>> ExtendedAttributeKeys(const XattrSource& item) {
  const ssize_t size = ListXattrs(item, nullptr, 0);
  if (size < 0) {
    VTRLogError("Could not extract extended attributes from %@.", item.path);
    return std::nullopt;
  }
  std::vector<std::string> names;
  if (size == 0) return names;
  // The kernel bounds the list (64 KiB), so the size it reports can be taken.
  std::vector<char> list(static_cast<size_t>(size));
  const ssize_t listed = ListXattrs(item, list.data(), list.size());
  if (listed < 1) {
    VTRLogError("Could not extract extended attributes from %@. File is expected to have extended attributes.",
           item.path);
    return std::nullopt;
  }
  for (size_t offset = 0; offset < static_cast<size_t>(listed);) {
    const size_t length = ::strnlen(list.data() + offset, static_cast<size_t>(listed) - offset);
    names.emplace_back(list.data() + offset, length);
    offset += length + 1;
  }
  return names;
}

Value ExtendedAttributeValue(const std::string& key, const XattrSource& item) {
  const ssize_t size = GetXattr(item, key, nullptr, 0);
  if (size < 0) {
    VTRLogError("Could not extract extended file attributes from %@, returned %d", item.path, static_cast<int>(size));
    return Value();
  }
  Bytes value(static_cast<size_t>(size));
  const ssize_t read = GetXattr(item, key, value.data(), value.size());
  if (read >= 0) {
    value.resize(static_cast<size_t>(read));
  } else {
    VTRLogError("Coud not extract extended file attributes from %@. File is expected to have extended attributes.",
           item.path);
  }
  return Value::Data(std::move(value));
}

Value ExtendedAttributes(const XattrSource& item) {
  std::optional<std::vector<std::string>> names = ExtendedAttributeKeys(item);
  if (!names) {
    VTRLogError("Could not get attribute keys from file %@", item.path);
    return Value();
  }
  DictionaryBuilder attributes;
  attributes.reserve(names->size());
  for (std::string& name : *names) {
    Value value = ExtendedAttributeValue(name, item);
    // A record never holds an absent value: a name removed since it was
    // listed is left out.
    if (!value.isNil()) attributes.add(std::move(name), std::move(value));
  }
  return attributes.build();
}

Value FileAttributes(const Result<Value>& attributes, const std::string& path) {
  if (!attributes.ok()) {
    VTRLogError("Get file attributes failed for %@ with error - %@", path, attributes.error());
    return Value();
  }
  return *attributes;
}

Value TargetFile(const Result<std::string>& target, const std::string& path) {
  if (!target.ok()) {
    VTRLogError("Could not get destination of symbolic link %@ with error - %@", path, target.error());
    return Value();
  }
  return Value::String(*target);
}

// The hash of an item that is no link: nil (it vanished) after "File does
// not exist at %@"; empty data for a directory, and after "Maybe it's an
// Nimbrel file (%@)?" for content that cannot be read.
Value HashOfItem(ItemKind kind, const OpenedItem& item, const std::string& path) {
  if (item.openError == ENOENT) {
    VTRLogError("File does not exist at %@", path);
    return Value();
  }
  if (kind == ItemKind::kDirectory) return Value::Data(Bytes());
  std::optional<Bytes> hash = fileHashOfDescriptor(item.fd.get(), path);
  if (!hash) {
    VTRLog("Maybe it's an Nimbrel file (%@)?", path);
    return Value::Data(Bytes());
  }
  return Value::Data(std::move(*hash));
}

}  // namespace

std::optional<VTRFileMetadata> VTRFileMetadata::initWithPath(const std::string& path) {
  Result<ParentAndName> item = OpenItemDirectory(path);
  if (!item.ok()) {
    FileAttributes(item.error(), path);
    VTRLogError("Cannot get file attribute for %@", path);
    return std::nullopt;
  }
  return initWithItemAt(item->parent.get(), item->name, path);
}

std::optional<VTRFileMetadata> VTRFileMetadata::initWithItemAt(int dirFd, const std::string& name,
                                                               const std::string& path) {
  Value attributes = FileAttributes(AttributesOfItemAt(dirFd, name, path), path);
  if (attributes.isNil()) {
    VTRLogError("Cannot get file attribute for %@", path);
    return std::nullopt;
  }
  const ItemKind kind = KindOfType(attributes.get(kNSFileType));
  const OpenedItem item = OpenForRecord(dirFd, name, kind);
  // Only what was never meant to be opened (a link, a special file) may be
  // reached by path, and only on kernels without the *xattrat calls.
  const bool opened = kind == ItemKind::kRegular || kind == ItemKind::kDirectory;
  Value extendedAttributes = ExtendedAttributes(XattrSource{item.fd.get(), dirFd, name, path, !opened});
  Value hash = Value::Data(Bytes());
  Value target = Value::String(std::string());
  if (kind == ItemKind::kSymbolicLink) {
    target = TargetFile(DestinationOfSymbolicLinkAt(dirFd, name, path), path);
  } else {
    hash = HashOfItem(kind, item, path);
    if (hash.isNil()) return std::nullopt;  // vanished; already logged
  }

  // In this order, up to the first absent value.
  DictionaryBuilder record;
  record.reserve(4);
  record.add(kVTRManifestFileAttributes, std::move(attributes));
  if (!extendedAttributes.isNil()) {
    record.add(kVTRManifestFileExtendedAttributes, std::move(extendedAttributes));
    record.add(kVTRManifestFileHash, std::move(hash));
    if (!target.isNil()) record.add(kVTRManifestSymbolicLinkTargetFile, std::move(target));
  }
  return VTRFileMetadata(record.build());
}

const Bytes* VTRFileMetadata::getHash() const { return dict_.get(kVTRManifestFileHash).data(); }

const Dictionary* VTRFileMetadata::getFileAttributes() const {
  return dict_.get(kVTRManifestFileAttributes).dictionary();
}

const Dictionary* VTRFileMetadata::getExtendedAttributes() const {
  return dict_.get(kVTRManifestFileExtendedAttributes).dictionary();
}

const std::string* VTRFileMetadata::getFileType() const {
  const Dictionary* attributes = getFileAttributes();
  const Value* type = attributes != nullptr ? attributes->find(kNSFileType) : nullptr;
  return type != nullptr ? type->string() : nullptr;
}

const std::string* VTRFileMetadata::getTargetFile() const {
  return dict_.get(kVTRManifestSymbolicLinkTargetFile).string();
}

uint64_t VTRFileMetadata::getFileSize() const {
  const std::string* type = getFileType();
  if (type == nullptr || *type != kNSFileTypeRegular) return 0;
  const Value* size = getFileAttributes()->find(kNSFileSize);
  return size != nullptr ? size->unsignedInteger().value_or(0) : 0;
}

}  // namespace vtr
