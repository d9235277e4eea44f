#include "platform/block_geometry.h"

#include <fcntl.h>
#include <unistd.h>

#include <gtest/gtest.h>

#include <string>

#include "platform/unique_fd.h"
#include "storage/zarn_acquire.h"
#include "storage/zarn_header.h"
#include "tests/storage/zarn_test_support.h"
#include "tests/support/loop_device.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

UniqueFd OpenFile(const std::string& path, int flags = O_RDONLY) {
  return UniqueFd(::open(path.c_str(), flags | O_CLOEXEC));
}

TEST(BlockGeometryTest, ImageFilesUseTheCallersBlockSize) {
  testing::TempDir dir;
  const std::string path = dir / "disk.img";
  testing::WriteFile(path, std::string(10000, 'x'));
  UniqueFd fd = OpenFile(path);
  ASSERT_TRUE(fd.valid());
  EXPECT_EQ(BlockSizeOf(fd.get()).value(), 4096u);
  EXPECT_EQ(BlockCountOf(fd.get()).value(), 2u);  // a partial block is not counted
  EXPECT_EQ(BlockSizeOf(fd.get(), 512).value(), 512u);
  EXPECT_EQ(BlockCountOf(fd.get(), 512).value(), 19u);
  EXPECT_EQ(BlockSizeOf(fd.get(), 0).error().code(), EINVAL);
  EXPECT_EQ(BlockCountOf(fd.get(), kMaxImageBlockSize + 1).error().code(), EINVAL);
}

TEST(BlockGeometryTest, OtherDescriptorsFailLikeTheRequest) {
  testing::TempDir dir;
  UniqueFd directory = OpenFile(dir.path(), O_RDONLY | O_DIRECTORY);
  EXPECT_EQ(BlockSizeOf(directory.get()).error().code(), ENOTTY);
  EXPECT_EQ(BlockCountOf(directory.get()).error().code(), ENOTTY);
  UniqueFd null = OpenFile("/dev/null");
  EXPECT_EQ(BlockSizeOf(null.get()).error().code(), ENOTTY);
  EXPECT_EQ(BlockSizeOf(-1).error().code(), EBADF);
}

TEST(BlockGeometryTest, LoopDeviceGeometryAndHeader) {
  if (!testing::IsRoot()) GTEST_SKIP() << "needs root to attach a loop device";
  testing::TempDir dir;
  const std::string file = dir / "backing.img";
  {
    UniqueFd fd = OpenFile(file, O_RDWR | O_CREAT);
    ASSERT_TRUE(fd.valid());
    ASSERT_EQ(::ftruncate(fd.get(), 64 << 20), 0);
  }
  testing::LoopDevice loop(file, 4096);
  if (loop.path().empty()) GTEST_SKIP() << "losetup could not attach a loop device";

  UniqueFd device = OpenFile(loop.path(), O_RDWR);
  ASSERT_TRUE(device.valid());
  // The image block size given is ignored for a block device.
  EXPECT_EQ(BlockSizeOf(device.get(), 512).value(), 4096u);
  EXPECT_EQ(BlockCountOf(device.get(), 512).value(), 16384u);

  // A header written through the device is acquired back through it.
  const ZarnMediaProperties props = testing::Geometry(64 << 20);
  testing::Header header = testing::FreshHeader(props);
  ASSERT_EQ(::pwrite(device.get(), header.data(), header.size(), 0), static_cast<ssize_t>(header.size()));
  ASSERT_EQ(::fsync(device.get()), 0);
  testing::Header read{};
  EXPECT_EQ(zarnAcquireHeader(device.get(), &props, read.data()), 0);
  EXPECT_EQ(read, header);
}

}  // namespace
}  // namespace vtr
