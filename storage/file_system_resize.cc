#include "storage/file_system_resize.h"

#include <fcntl.h>
#include <linux/btrfs.h>
#include <linux/magic.h>
#include <sys/ioctl.h>
#include <sys/vfs.h>
#include <unistd.h>
#include <xfs/xfs.h>

#include <cstdio>

#include "platform/little_endian.h"
#include "platform/unique_fd.h"

// The ext4 online resize request, as the kernel defines it (fs/ext4/ext4.h)
// and resize2fs uses it; no installed header carries it.
#ifndef EXT4_IOC_RESIZE_FS
#define EXT4_IOC_RESIZE_FS _IOW('f', 16, __u64)
#endif

namespace vtr {
namespace {

Result<UniqueFd> OpenMountPoint(const std::string& mountPoint) {
  UniqueFd fd(::open(mountPoint.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return Error::FromErrno(mountPoint);
  return fd;
}

// btrfs: the size of device 1, the one a single-device file system has.
Result<uint64_t> BtrfsDeviceBytes(int fd) {
  struct btrfs_ioctl_dev_info_args info {};
  info.devid = 1;
  if (::ioctl(fd, BTRFS_IOC_DEV_INFO, &info) != 0) return Error::FromErrno("BTRFS_IOC_DEV_INFO");
  return info.total_bytes;
}

Result<struct xfs_fsop_geom> XfsGeometry(int fd) {
  struct xfs_fsop_geom geometry {};
  if (::ioctl(fd, XFS_IOC_FSGEOMETRY, &geometry) != 0) return Error::FromErrno("XFS_IOC_FSGEOMETRY");
  return geometry;
}

// ext4's block count and block size, from the superblock 1024 bytes into
// the device.
Result<uint64_t> Ext4BytesFromSuperblock(const std::string& device) {
  UniqueFd fd(::open(device.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  if (!fd) return Error::FromErrno(device);
  uint8_t super[1024];
  if (::pread(fd.get(), super, sizeof super, 1024) != static_cast<ssize_t>(sizeof super)) {
    return Error(EIO, device + ": no superblock");
  }
  auto u32 = [&](size_t at) { return LoadU32(super + at); };
  if (LoadU16(super + 0x38) != 0xEF53) return Error(EINVAL, device + ": not ext4");
  const bool wide = (u32(0x60) & 0x80) != 0;  // INCOMPAT_64BIT: the count has a high half
  const uint64_t blocks = u32(0x04) | (wide ? uint64_t{u32(0x150)} << 32 : 0);
  return blocks * (uint64_t{1024} << u32(0x18));
}

}  // namespace

Result<MountedFileSystem> DescribeMountedFileSystem(const std::string& mountPoint, const std::string& sourceDevice) {
  Result<UniqueFd> fd = OpenMountPoint(mountPoint);
  if (!fd.ok()) return fd.error();
  struct statfs st;
  if (::fstatfs(fd->get(), &st) != 0) return Error::FromErrno(mountPoint);
  MountedFileSystem fs;
  switch (st.f_type) {
    case BTRFS_SUPER_MAGIC: {
      fs.type = "btrfs";
      Result<uint64_t> bytes = BtrfsDeviceBytes(fd->get());
      if (!bytes.ok()) return bytes.error();
      fs.bytes = *bytes;
      break;
    }
    case EXT4_SUPER_MAGIC: {  // also ext2 and ext3, which this driver mounts too
      fs.type = "ext4";
      // statfs leaves the file system's own overhead out: the superblock
      // tells the whole block count.
      Result<uint64_t> bytes = sourceDevice.empty() ? Result<uint64_t>(Error(ENOENT, "no device"))
                                                    : Ext4BytesFromSuperblock(sourceDevice);
      fs.bytes = bytes.ok() ? *bytes : static_cast<uint64_t>(st.f_blocks) * static_cast<uint64_t>(st.f_bsize);
      break;
    }
    case XFS_SUPER_MAGIC: {
      fs.type = "xfs";
      Result<struct xfs_fsop_geom> geometry = XfsGeometry(fd->get());
      if (!geometry.ok()) return geometry.error();
      fs.bytes = geometry->datablocks * uint64_t{geometry->blocksize};
      break;
    }
    default:
      fs.type = "other";
      fs.bytes = static_cast<uint64_t>(st.f_blocks) * static_cast<uint64_t>(st.f_bsize);
  }
  return fs;
}

Status ResizeMountedFileSystem(const std::string& mountPoint, uint64_t newBytes) {
  Result<UniqueFd> fd = OpenMountPoint(mountPoint);
  if (!fd.ok()) return fd.error();
  struct statfs st;
  if (::fstatfs(fd->get(), &st) != 0) return Error::FromErrno(mountPoint);
  switch (st.f_type) {
    case BTRFS_SUPER_MAGIC: {
      struct btrfs_ioctl_vol_args args {};
      std::snprintf(args.name, sizeof args.name, "1:%llu", static_cast<unsigned long long>(newBytes));
      if (::ioctl(fd->get(), BTRFS_IOC_RESIZE, &args) != 0) return Error::FromErrno("BTRFS_IOC_RESIZE");
      return Status::Ok();
    }
    case EXT4_SUPER_MAGIC: {
      const uint64_t blockSize = static_cast<uint64_t>(st.f_bsize);
      __u64 blocks = newBytes / blockSize;
      // f_blocks is below the block count (it leaves the overhead out): a
      // size under it is a shrink for certain; the kernel refuses the rest.
      if (blocks < static_cast<uint64_t>(st.f_blocks)) {
        return Error(EOPNOTSUPP, "an ext4 file system cannot shrink while it is mounted");
      }
      if (::ioctl(fd->get(), EXT4_IOC_RESIZE_FS, &blocks) != 0) {
        if (errno == EPERM) return Error(EPERM, "growing an ext4 file system online needs CAP_SYS_RESOURCE");
        return Error::FromErrno("EXT4_IOC_RESIZE_FS");
      }
      return Status::Ok();
    }
    case XFS_SUPER_MAGIC: {
      Result<struct xfs_fsop_geom> geometry = XfsGeometry(fd->get());
      if (!geometry.ok()) return geometry.error();
      struct xfs_growfs_data grow {};
      grow.newblocks = newBytes / geometry->blocksize;
      grow.imaxpct = geometry->imaxpct;
      if (grow.newblocks < geometry->datablocks) {
        return Error(EOPNOTSUPP, "an xfs file system cannot shrink");
      }
      if (::ioctl(fd->get(), XFS_IOC_FSGROWFSDATA, &grow) != 0) return Error::FromErrno("XFS_IOC_FSGROWFSDATA");
      return Status::Ok();
    }
    default:
      return Error(EOPNOTSUPP, "the file system on " + mountPoint + " cannot be resized while mounted");
  }
}

}  // namespace vtr
