// Reading a file metadata record from disk, and the record's getters.
#include "model/file_metadata.h"

#include <sys/xattr.h>

#include <cstring>

#include "model/file_hash.h"
#include "model/log.h"
#include "platform/file_manager.h"

namespace vtr {

Value VTRFileMetadata::fileHashWithPath(const std::string& path) {
  bool isDirectory = false;
  if (!FileExists(path, &isDirectory)) {
    VTRLog("File does not exist at %@", path);
    return Value();
  }
  if (isDirectory) return Value::Data(Bytes());
  std::optional<Bytes> hash = fileHash(path);
  if (!hash) {
    VTRLog("Maybe it's an Nimbrel file (%@)?", path);
    return Value::Data(Bytes());
  }
  return Value::Data(std::move(*hash));
}

Value VTRFileMetadata::fileAttributesWithPath(const std::string& path) {
  Result<Value> attributes = AttributesOfItem(path);
  if (!attributes.ok()) {
    VTRLog("Get file attributes failed for %@ with error - %@", path, attributes.error());
    return Value();
  }
  return std::move(*attributes);
}

std::optional<std::vector<std::string>> VTRFileMetadata::extendedAttributeKeysWithPath(const std::string& path) {
  const ssize_t size = ::llistxattr(path.c_str(), nullptr, 0);
  if (size < 0) {
    VTRLog("Could not extract extended attributes from %@.", path);
    return std::nullopt;
  }
  std::vector<std::string> names;
  if (size == 0) return names;
  // The kernel bounds the list (64 KiB), so the size it reports can be taken.
  std::vector<char> list(static_cast<size_t>(size));
  const ssize_t listed = ::llistxattr(path.c_str(), list.data(), list.size());
  if (listed < 1) {
    VTRLog("Could not extract extended attributes from %@. File is expected to have extended attributes.", path);
    return std::nullopt;
  }
  for (size_t offset = 0; offset < static_cast<size_t>(listed);) {
    const size_t length = ::strnlen(list.data() + offset, static_cast<size_t>(listed) - offset);
    names.emplace_back(list.data() + offset, length);
    offset += length + 1;
  }
  return names;
}

Value VTRFileMetadata::valueForExtendedAttributesKey(const std::string& key, const std::string& path) {
  const ssize_t size = ::lgetxattr(path.c_str(), key.c_str(), nullptr, 0);
  if (size < 0) {
    VTRLog("Could not extract extended file attributes from %@, returned %d", path, static_cast<int>(size));
    return Value();
  }
  Bytes value(static_cast<size_t>(size));
  const ssize_t read = ::lgetxattr(path.c_str(), key.c_str(), value.data(), value.size());
  if (read >= 0) {
    value.resize(static_cast<size_t>(read));
  } else {
    VTRLog("Coud not extract extended file attributes from %@. File is expected to have extended attributes.", path);
  }
  return Value::Data(std::move(value));
}

Value VTRFileMetadata::extendedAttributesWithPath(const std::string& path) {
  std::optional<std::vector<std::string>> names = extendedAttributeKeysWithPath(path);
  if (!names) {
    VTRLog("Could not get attribute keys from file %@", path);
    return Value();
  }
  DictionaryBuilder attributes;
  attributes.reserve(names->size());
  for (std::string& name : *names) {
    Value value = valueForExtendedAttributesKey(name, path);
    // A record never holds an absent value: a name removed since it was
    // listed is left out.
    if (!value.isNil()) attributes.add(std::move(name), std::move(value));
  }
  return attributes.build();
}

Value VTRFileMetadata::targetFileWithPath(const std::string& path) {
  Result<std::string> target = DestinationOfSymbolicLink(path);
  if (!target.ok()) {
    VTRLog("Could not get destination of symbolic link %@ with error - %@", path, target.error());
    return Value();
  }
  return Value::String(std::move(*target));
}

std::optional<VTRFileMetadata> VTRFileMetadata::initWithPath(const std::string& path) {
  Value attributes = fileAttributesWithPath(path);
  if (attributes.isNil()) {
    VTRLog("Cannot get file attribute for %@", path);
    return std::nullopt;
  }
  Value extendedAttributes = extendedAttributesWithPath(path);
  Value hash = Value::Data(Bytes());
  Value target = Value::String(std::string());
  const Value type = attributes.get(kNSFileType);
  if (type.string() != nullptr && *type.string() == kNSFileTypeSymbolicLink) {
    target = targetFileWithPath(path);
  } else {
    hash = fileHashWithPath(path);
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
