#include "tests/storage/zarn_test_support.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>

#include "platform/unique_fd.h"
#include "storage/zarn_header.h"

namespace vtr::testing {

std::string StderrOf(const std::function<void()>& body) {
  std::fflush(stderr);
  ::testing::internal::CaptureStderr();
  body();
  std::fflush(stderr);
  return ::testing::internal::GetCapturedStderr();
}

ZarnMediaProperties Geometry(uint64_t mediaSize, uint32_t blockSize) {
  ZarnMediaProperties props;
  StderrOf([&] { EXPECT_EQ(zarnInitMediaGeometry(&props, mediaSize, blockSize), 0); });
  return props;
}

Header FreshHeader(const ZarnMediaProperties& props) {
  Header header{};
  EXPECT_EQ(zarnCreateHeader(&props, header.data()), 0);
  zarnSetHeaderCRC(header.data());
  return header;
}

ssize_t FakeMedium::readAt(uint8_t* buffer, size_t length, uint64_t offset) const {
  reads.push_back(offset);
  auto it = blocks.find(offset);
  if (it == blocks.end()) return -1;
  const size_t n = std::min(length, it->second.size());
  std::copy_n(it->second.begin(), n, buffer);
  return static_cast<ssize_t>(n);
}

std::vector<uint8_t> BlockWith(const Header& header, uint32_t blockSize) {
  std::vector<uint8_t> block(std::max<size_t>(blockSize, header.size()), 0);
  std::copy(header.begin(), header.end(), block.begin());
  block.resize(blockSize);
  return block;
}

void WriteImage(const std::string& path, uint64_t size, const Header& main, uint64_t backupOffset,
                const Header& backup) {
  UniqueFd fd(::open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  ASSERT_TRUE(fd.valid());
  ASSERT_EQ(::ftruncate(fd.get(), static_cast<off_t>(size)), 0);
  ASSERT_EQ(::pwrite(fd.get(), main.data(), main.size(), 0), static_cast<ssize_t>(main.size()));
  if (backupOffset != 0) {
    ASSERT_EQ(::pwrite(fd.get(), backup.data(), backup.size(), static_cast<off_t>(backupOffset)),
              static_cast<ssize_t>(backup.size()));
  }
}

}  // namespace vtr::testing
