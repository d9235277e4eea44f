#include "tools/zarnutil/zarn_image.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <vector>

#include "platform/block_geometry.h"
#include "storage/zarn_acquire.h"
#include "storage/zarn_header.h"
#include "tools/common/tool_conventions.h"
#include "tools/zarnutil/library_messages.h"

namespace vtr {
namespace {

void PrintError(const std::string& path, const Error& error) {
  std::fprintf(stderr, "zarnutil: %s: %s\n", path.c_str(), error.description().c_str());
}

bool WriteAt(int fd, const std::vector<uint8_t>& bytes, uint64_t offset) {
  size_t done = 0;
  while (done < bytes.size()) {
    const ssize_t n = ::pwrite(fd, bytes.data() + done, bytes.size() - done, static_cast<off_t>(offset + done));
    if (n < 0 && errno == EINTR) continue;
    if (n == 0) errno = EIO;
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

}  // namespace

std::optional<ZarnImage> OpenZarnImage(const std::string& path, bool writable, uint32_t imageBlockSize,
                                       int* exitStatus) {
  *exitStatus = tools::kExitNoInput;
  ZarnImage image;
  image.path = path;
  image.imageBlockSize = imageBlockSize;
  image.fd.reset(::open(path.c_str(), (writable ? O_RDWR : O_RDONLY) | O_CLOEXEC));
  if (!image.fd) {
    PrintError(path, Error::FromErrno("open"));
    return std::nullopt;
  }
  *exitStatus = tools::kExitBadInput;
  Result<uint32_t> blockSize = BlockSizeOf(image.fd.get(), imageBlockSize);
  if (!blockSize.ok()) {
    PrintError(path, blockSize.error());
    return std::nullopt;
  }
  Result<uint64_t> blockCount = BlockCountOf(image.fd.get(), imageBlockSize);
  if (!blockCount.ok()) {
    PrintError(path, blockCount.error());
    return std::nullopt;
  }
  const uint64_t mediaSize = *blockCount * *blockSize;
  if (mediaSize == 0) {
    std::fprintf(stderr, "zarnutil: %s: the medium is empty (0 bytes): there is no room for a Zarn header\n",
                 path.c_str());
    return std::nullopt;
  }
  // The library only warns of a medium too small ("media too small"); the
  // tool refuses it in its own words below.
  LibraryMessages geometryMessages;
  const bool measured = zarnInitMediaGeometry(&image.props, mediaSize, *blockSize) == 0;
  std::vector<std::string> lines = geometryMessages.finish();
  std::erase(lines, "media too small");
  ReplayLibraryMessages(lines);
  if (!measured) return std::nullopt;
  if (image.props.chunkSize <= image.props.blockSize) {
    std::fprintf(stderr,
                 "zarnutil: %s: the medium (%llu bytes) is too small for a Zarn header: its chunks would be %llu "
                 "bytes, no larger than a block (%u bytes), so chunk 0 cannot hold the main and backup copies\n",
                 path.c_str(), static_cast<unsigned long long>(mediaSize),
                 static_cast<unsigned long long>(image.props.chunkSize),
                 image.props.blockSize);
    return std::nullopt;
  }
  return image;
}

bool AcquireHeader(const ZarnImage& image, ZarnHeaderBuffer* header) {
  return zarnAcquireHeader(image.fd.get(), &image.props, header->data(), image.imageBlockSize) == 0;
}

bool HasHeaderCopy(const ZarnImage& image) {
  ZarnHeaderBuffer header{};
  if (::pread(image.fd.get(), header.data(), header.size(), 0) != static_cast<ssize_t>(header.size())) return false;
  return zarnValidateHeader(header.data()) != -2;
}

uint64_t BackupHeaderOffset(const ZarnImage& image) { return image.props.chunkSize - image.props.blockSize; }

bool WriteHeaderCopy(const ZarnImage& image, const ZarnHeaderBuffer& header, uint64_t offset) {
  const char* which = offset == 0 ? "the main header" : "the backup header";
  std::vector<uint8_t> block(std::max<size_t>(image.props.blockSize, header.size()), 0);
  std::copy(header.begin(), header.end(), block.begin());
  block.resize(image.props.blockSize);
  if (offset + block.size() > image.props.mediaSize) {
    std::fprintf(stderr, "zarnutil: %s: %s would lie past the end of the medium; nothing written\n",
                 image.path.c_str(), which);
    return false;
  }
  if (!WriteAt(image.fd.get(), block, offset)) {
    PrintError(image.path, Error::FromErrno(std::string("writing ") + which));
    return false;
  }
  if (::fsync(image.fd.get()) != 0) {
    PrintError(image.path, Error::FromErrno("fsync"));
    return false;
  }
  return true;
}

bool WriteHeaderCopies(const ZarnImage& image, const ZarnHeaderBuffer& header) {
  // One copy is whole and synced before the other is touched.
  return WriteHeaderCopy(image, header, 0) && WriteHeaderCopy(image, header, BackupHeaderOffset(image));
}

}  // namespace vtr
