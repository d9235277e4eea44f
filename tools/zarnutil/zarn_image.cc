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
  if (zarnInitMediaGeometry(&image.props, *blockCount * *blockSize, *blockSize) != 0) return std::nullopt;
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

bool WriteHeaderCopies(const ZarnImage& image, const ZarnHeaderBuffer& header) {
  std::vector<uint8_t> block(image.props.blockSize, 0);
  std::copy(header.begin(), header.end(), block.begin());
  if (!WriteAt(image.fd.get(), block, 0)) {
    PrintError(image.path, Error::FromErrno("writing the main header"));
    return false;
  }
  if (image.props.chunkSize < image.props.blockSize) {
    std::fprintf(stderr, "zarnutil: %s: chunk 0 is smaller than a block: no backup header written\n",
                 image.path.c_str());
  } else if (!WriteAt(image.fd.get(), block, image.props.chunkSize - image.props.blockSize)) {
    PrintError(image.path, Error::FromErrno("writing the backup header"));
    return false;
  }
  if (::fsync(image.fd.get()) != 0) {
    PrintError(image.path, Error::FromErrno("fsync"));
    return false;
  }
  return true;
}

}  // namespace vtr
