#include "vitd_helper/partition_resize.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>
#include <uuid/uuid.h>

#include <chrono>
#include <cstring>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "model/log.h"
#include "platform/block_geometry.h"
#include "platform/device_properties.h"
#include "storage/file_system_resize.h"
#include "storage/gpt_disk.h"
#include "storage/mount_table.h"
#include "storage/zarn_adjust.h"
#include "storage/zarn_geometry.h"
#include "vitd_helper/failure_journal.h"

namespace vtr {
namespace {

DataPartitionDisk& Disk() {
  static DataPartitionDisk disk;
  return disk;
}

// The partition the resize works on (the disk also names "System" and
// "Update", which it never looks up).
constexpr char kDataName[] = "Data";

// How long the table write waits for a writer holding the disk's lock.
constexpr auto kLockPatience = std::chrono::seconds(2);

struct GptRead {
  GptImage image;
  ZarnMediaProperties props;
  uint64_t blockCount = 0;
  // The table position of "Data", -1 when no entry bears the name.
  int dataPosition = -1;

  uint32_t entryCount() const { return image.entryCount(); }
  // Entries the table can hold of those the header counts.
  uint32_t tableEntries() const { return std::min<uint32_t>(entryCount(), kGptTableEntries); }
  uint64_t blocksOf(uint32_t i) const { return image.lastLba(i) - image.firstLba(i) + 1; }
};

// The raw device opened with flags, or -1 after a message.
int OpenRawDevice(int flags) {
  const char* path = Disk().rawDevice.c_str();
  const int fd = ::open(path, flags | O_CLOEXEC);
  if (fd < 0) {
    JournalFailure("Cannot open the boot disk", path, Error::FromErrno(""));
    VTRLogError("failed to open %s", path);
    return -1;
  }
  struct stat st;
  if (::fstat(fd, &st) != 0) {
    JournalFailure("Cannot stat the boot disk", path, Error::FromErrno(""));
    VTRLogError("failed to stat %s", path);
    ::close(fd);
    return -1;
  }
  // A block device of the whole disk, or a disk image.
  if (!S_ISBLK(st.st_mode) && !S_ISREG(st.st_mode)) {
    VTRLogError("%s is not a suitable device (try /dev/rdisk*)", path);
    ::close(fd);
    return -1;
  }
  return fd;
}

bool ReadGpt(GptRead* gpt) {
  const char* path = Disk().rawDevice.c_str();
  const int fd = OpenRawDevice(O_RDONLY);
  if (fd < 0) return false;
  UniqueFd closer(fd);
  Result<uint32_t> blockSize = BlockSizeOf(fd);
  if (!blockSize.ok()) {
    VTRLogError("ioctl DKIOCGETBLOCKSIZE failed");
    JournalFailure("Cannot read the block size of", path, blockSize.error());
    return false;
  }
  Result<uint64_t> blockCount = BlockCountOf(fd);
  if (!blockCount.ok()) {
    VTRLogError("ioctl DKIOCGETBLOCKCOUNT failed");
    JournalFailure("Cannot read the block count of", path, blockCount.error());
    return false;
  }
  if (zarnInitMediaGeometry(&gpt->props, *blockCount * *blockSize, *blockSize) != 0) {
    VTRLogError("Device %s not suitable", path);
    return false;
  }
  gpt->blockCount = *blockCount;
  Result<bool> signature = ReadZarnSignature(fd, *blockSize);
  if (!signature.ok()) {
    VTRLogError("Failed to read MBR from %s", path);
    JournalFailure("Cannot read the protective MBR of", path, signature.error());
    return false;
  }
  if (!*signature) {
    VTRLogError("%s not managed by Zarn", path);
    return false;
  }
  Result<GptImage> image = ReadGptImage(fd, *blockSize);
  if (!image.ok()) {
    VTRLogError("Failed to read GPT header and table from %s", path);
    JournalFailure("Cannot read the GPT of", path, image.error());
    return false;
  }
  // The new table is made from the primary copy and written backup first:
  // from a torn primary (a power cut during an earlier write) it would
  // replace the one sound copy with what the tear left.
  Result<GptValidity> copies = CheckGpt(fd, *blockSize, *blockCount);
  if (!copies.ok() || !copies->primaryHeaderCrc || !copies->primaryTableCrc) {
    VTRLogError("The primary GPT of %s does not match its CRCs; the sound backup copy is left as it is", path);
    return false;
  }
  gpt->image = *image;
  gpt->dataPosition = gpt->image.positionOf(kDataName);
  return true;
}

// The mount point of the file system whose partition entry carries uuidText.
std::optional<std::string> FindMountedFileSystem(const std::string& uuidText) {
  std::vector<MountEntry> mounts;
  Result<std::vector<MountEntry>> table =
      Disk().procDirectory ? ReadMountTable(Disk().procDirectory->get()) : Error(ENOENT, "no proc directory");
  if (table.ok()) {
    mounts = std::move(*table);
  } else {
    VTRLogError("failed to get filesystem information");
  }
  VTRLog("scanning %d filesystems for %s", table.ok() ? static_cast<int>(mounts.size()) : -1, uuidText);
  uuid_t wanted;
  uuid_parse(uuidText.c_str(), wanted);
  for (const auto& [mount, uuid] : PartitionMounts(mounts)) {
    const std::string bsdName = mount.source.substr(mount.source.rfind('/') + 1);
    if (!uuid.ok()) {
      if (uuid.error().code() == ENOENT) {
        VTRLogError("device matching %s has no UUID (unexpected)", bsdName);
      } else {
        VTRLogError("failed to find an IOService owning %s (unexpected)", bsdName);
      }
      continue;
    }
    uuid_t found;
    if (uuid_parse(uuid->c_str(), found) != 0) {
      VTRLogError("failed to get string from UUID property (unexpected)");
      continue;
    }
    const bool match = uuid_compare(found, wanted) == 0;
    VTRLog("UUID %s %smatch", *uuid, match ? "" : "does not ");
    if (match) {
      VTRLog("matched %s on %s", mount.source, mount.mountPoint);
      return mount.mountPoint;
    }
  }
  return std::nullopt;
}

// Resizes the file system mounted at mountPoint; 0, or 1 after its message.
int HfsResize(const std::string& mountPoint, uint64_t newBytes) {
  Status resized = ResizeMountedFileSystem(mountPoint, newBytes);
  if (resized.ok()) return 0;
  // A refusal the helper can explain is said in words first.
  if (resized.error().code() == EOPNOTSUPP || resized.error().code() == EPERM) {
    VTRLogError("%s", resized.error().message());
  }
  VTRLogError("HFS resize failed. errno=%d", resized.error().code());
  return 1;
}

// The raw device opened for writing with the shared lock partitioning tools
// respect; a writer holding the disk exclusively makes it fail, after a
// short wait, rather than block.
int OpenRawDeviceLocked() {
  const int fd = OpenRawDevice(O_RDWR);
  if (fd < 0) return -1;
  const auto deadline = std::chrono::steady_clock::now() + kLockPatience;
  while (::flock(fd, LOCK_SH | LOCK_NB) != 0) {
    if (errno != EWOULDBLOCK || std::chrono::steady_clock::now() > deadline) {
      JournalFailure("Cannot lock the boot disk", Disk().rawDevice, Error::FromErrno(""));
      ::close(fd);
      return -1;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
  return fd;
}

// Index of an existing entry whose start the new layout moves, or -1. The
// entry being resized counts too: its file system begins where it begins,
// and a start moved under it would point before its first block.
int MovedEntry(const GptImage& before, const GptImage& after) {
  for (uint32_t i = 0; i < std::min<uint32_t>(before.entryCount(), kGptTableEntries); ++i) {
    if (before.firstLba(i) != after.firstLba(i)) return static_cast<int>(i);
  }
  return -1;
}

// One number of the "DiskUsage" answer; 0 when it is missing.
int64_t DiskUsageNumber(const Value& answer, const char* key) { return answer.get(key).integer().value_or(0); }

}  // namespace

void SetDataPartitionDisk(DataPartitionDisk disk) { Disk() = std::move(disk); }

int ShrinkDataPartition() {
  std::optional<Value> usage = DiskUsage(Disk().dataVolume);
  if (!usage) {
    JournalFailure("Cannot read the usage of the data volume", Disk().dataVolume, Error::FromErrno(""));
    VTRLogError("Cannot get disk usage.");
    return -1;
  }
  const int64_t freeSize = DiskUsageNumber(*usage, kDiskUsageTotalDataAvailable);
  const int64_t totalSize = DiskUsageNumber(*usage, kDiskUsageTotalDataCapacity);
  const int64_t newSize = totalSize - freeSize / 2;
  VTRLog("freeSize = %lld(bytes), totalSize = %lld(bytes), newSize = %lld(bytes)\n\n", freeSize, totalSize, newSize);
  return adjust_partition(static_cast<uint64_t>(newSize)) == 0 ? 0 : -1;
}

int ExpandDataPartition() {
  GptRead gpt;
  int64_t blocks = 0;
  if (ReadGpt(&gpt)) {
    const int64_t first = static_cast<int64_t>(gpt.image.firstUsableLba());
    const int64_t last = static_cast<int64_t>(gpt.image.lastUsableLba());
    VTRLog("gpt.pth.first_lba = %lld, last_lba = %lld", first, last);
    blocks = last - first + 1;
    for (uint32_t i = 0; i < gpt.tableEntries(); ++i) {
      const int64_t size = static_cast<int64_t>(gpt.blocksOf(i));
      VTRLog("Partition %d: first = %lld, last = %lld, lbaNumber = %lld", static_cast<int>(i),
             static_cast<int64_t>(gpt.image.firstLba(i)), static_cast<int64_t>(gpt.image.lastLba(i)), size);
      // The data partition is expected at table position 1.
      if (i != 1) blocks -= size;
    }
  }
  VTRLog("Block numbers that could be used as data partition = %lld", blocks);
  const int64_t newSize = blocks * static_cast<int64_t>(gpt.props.blockSize);
  VTRLog("newSize = %lld(bytes)", newSize);
  return adjust_partition(static_cast<uint64_t>(newSize));
}

int adjust_partition(uint64_t requiredSize) {
  VTRLog("entering %s", "adjust_partition");
  GptRead gpt;
  if (!ReadGpt(&gpt)) return 1;
  const uint32_t count = gpt.entryCount();
  const uint32_t which = gpt.dataPosition >= 0 ? static_cast<uint32_t>(gpt.dataPosition) : count;
  const uint32_t blockSize = gpt.props.blockSize;
  const uint64_t blocks = requiredSize / blockSize + (requiredSize % blockSize != 0 ? 1 : 0);
  VTRLog("partition: requiredSize=%llu", blocks);

  // Does it fit? Silent in the day file when it does not; the journal says so.
  uint64_t sum = which == count ? blocks : 0;
  for (uint32_t i = 0; i < gpt.tableEntries(); ++i) sum += i == which ? blocks : gpt.blocksOf(i);
  if (const uint64_t usable = gpt.image.lastUsableLba() - gpt.image.firstUsableLba() + 1; sum > usable) {
    JournalFailure("The partitions would not fit on", Disk().rawDevice,
                   Error(ENOSPC, std::to_string(sum) + " blocks wanted, " + std::to_string(usable) + " usable"));
    return 1;
  }

  if (blocks == 0) {
    VTRLogError("deletion of partition %d disallowed", 1);
    return 1;
  }
  if (which < count && blocks == gpt.blocksOf(which)) {
    VTRLog("no change in size");
    return 0;
  }
  const char* verb = which == count ? "create" : "adjust";
  if (which > 7 || which > count) {
    VTRLogError("bad partion number");
    VTRLogError("failed to %s partition %d", verb, static_cast<int>(which));
    return 1;
  }

  std::optional<std::string> mountPoint;
  if (which < count) mountPoint = FindMountedFileSystem(gpt.image.uuidOf(which));
  if (!mountPoint && which < count) {
    VTRLogError("filesystem must be mounted (mountPoint=%s,which=%d,nPartitions=%d,newSize=%llu)",
                static_cast<const char*>(nullptr), static_cast<int>(which), static_cast<int>(count), blocks);
    VTRLogError("failed to %s partition %d", verb, static_cast<int>(which));
    return 1;
  }
  const uint64_t newBytes = blocks * blockSize;
  const uint64_t currentBytes = which < count ? gpt.blocksOf(which) * blockSize : 0;

  // The new layout, worked out before anything changes: a failure or a
  // layout that moves any partition's start, the resized one's included
  // (its data would stay where it is), stops here, with the file system
  // untouched.
  GptImage adjusted = gpt.image;
  if (zarnAdjustPartition(&gpt.props, adjusted.header.data(), adjusted.table.data(), which, newBytes) != 0) {
    VTRLogError("adjustment failed");
    VTRLogError("failed to %s partition %d", verb, static_cast<int>(which));
    return 1;
  }
  if (const int moved = MovedEntry(gpt.image, adjusted); moved >= 0) {
    VTRLogError("the new layout would move the start of partition %d, whose data would not move with it", moved);
    VTRLogError("failed to %s partition %d", verb, static_cast<int>(which));
    return 1;
  }

  if (mountPoint && newBytes < currentBytes) {
    VTRLog("shrinking HFS filesystem on %s from %llu to %llu", *mountPoint, currentBytes, newBytes);
    if (HfsResize(*mountPoint, newBytes) != 0) {
      VTRLogError("can't shrink partition %d, currently mounted on %s", static_cast<int>(which), *mountPoint);
      VTRLogError("failed to %s partition %d", verb, static_cast<int>(which));
      return 1;
    }
  }
  if (which == count) {
    VTRLog("Creating new partition instead of adjusting existing one");
  } else {
    VTRLog("Resizing existing partition with GPT index %d", static_cast<int>(which));
  }
  VTRLog("About to adjust with settings partitionIndex:%d size:%llu MB", static_cast<int>(which), newBytes >> 20);

  const char* path = Disk().rawDevice.c_str();
  const int fd = OpenRawDeviceLocked();
  if (fd < 0) {
    VTRLogError("Failed to open %s to write new GPT header out to disk.\n", path);
    return 1;
  }
  UniqueFd closer(fd);
  if (Status written = WriteGptWithBackup(fd, blockSize, gpt.blockCount, adjusted); !written.ok()) {
    const int error = written.error().code();
    VTRLogError("failed to write GPT header and table to %s (return %d). errno=%d : %s", path, -1, error,
                std::strerror(error));
    return 1;
  }
  VTRLog("Wrote GPT header back to disk");
  const uint64_t first = adjusted.firstLba(which);
  const uint64_t length = (adjusted.lastLba(which) - first + 1) * blockSize;
  Status told = TellKernelPartition(fd, static_cast<int>(which) + 1, first * blockSize, length, which == count);
  closer.reset();
  ::sync();
  if (!told.ok()) {
    VTRLogError("Could not tell the kernel the new size of partition %d: %@", static_cast<int>(which) + 1,
                told.error());
    return 1;
  }

  if (mountPoint && currentBytes <= newBytes) {
    VTRLog("expanding HFS filesystem on %s to %llu", *mountPoint, newBytes);
    if (HfsResize(*mountPoint, newBytes) != 0) {
      VTRLogError("can't expanding HFS filesystem on %s", *mountPoint);
      return 1;
    }
  }
  return 0;
}

}  // namespace vtr
