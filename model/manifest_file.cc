#include "model/manifest_file.h"

#include <sys/stat.h>

#include "platform/file_manager.h"
#include "platform/item_io.h"

namespace vtr {

Result<std::unique_ptr<ManifestFileWriter>> ManifestFileWriter::Create(const std::string& path, mode_t mode) {
  return Make(AtomicFile::Create(path, mode), path);
}

Result<std::unique_ptr<ManifestFileWriter>> ManifestFileWriter::CreateIn(UniqueFd dir, const std::string& path,
                                                                         mode_t mode) {
  return Make(AtomicFile::CreateIn(std::move(dir), path, mode), path);
}

Result<std::unique_ptr<ManifestFileWriter>> ManifestFileWriter::Make(Result<AtomicFile> file, const std::string& path) {
  if (!file.ok()) return file.error();
  struct stat st;
  if (!StatOf(file->fd(), &st)) return Error::FromErrno(path);
  return std::unique_ptr<ManifestFileWriter>(
      new ManifestFileWriter(std::move(*file), static_cast<int64_t>(st.st_dev), static_cast<uint64_t>(st.st_ino)));
}

ManifestFileWriter::ManifestFileWriter(AtomicFile file, int64_t device, uint64_t inode)
    : file_(std::move(file)), device_(device), inode_(inode), stream_(file_.fd()), writer_(&stream_) {}

bool ManifestFileWriter::isOwnFile(const VTRFileMetadata& record) const {
  const Dictionary* attributes = record.getFileAttributes();
  if (attributes == nullptr) return false;
  const Value* device = attributes->find(kNSFileSystemNumber);
  const Value* inode = attributes->find(kNSFileSystemFileNumber);
  return device != nullptr && inode != nullptr && device->integer() == device_ && inode->unsignedInteger() == inode_;
}

Status ManifestFileWriter::add(const std::string& key, const VTRFileMetadata& record) {
  if (failure_.ok() && !isOwnFile(record)) failure_ = writer_.add(key, record.dict());
  return failure_;
}

VTRManifest::Handler ManifestFileWriter::handler() {
  return [this](const VTRFileMetadata& record, const std::string& key) {
    (void)add(key, record);
    return true;
  };
}

Status ManifestFileWriter::commit() {
  if (failure_.ok()) failure_ = writer_.finish();
  if (failure_.ok()) failure_ = file_.commit();
  return failure_;
}

}  // namespace vtr
