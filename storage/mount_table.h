// The mounted file systems as this process sees them (/proc/self/mountinfo:
// mount points relative to its root, so a chrooted helper sees only the
// mounts inside its root, at their paths there), and the GPT identity of the
// partition a file system is mounted from.
#ifndef VTR_STORAGE_MOUNT_TABLE_H_
#define VTR_STORAGE_MOUNT_TABLE_H_

#include <string>
#include <vector>

#include "platform/result.h"

namespace vtr {

struct MountEntry {
  std::string mountPoint;  // e.g. "/private/var"
  std::string type;        // e.g. "btrfs"
  std::string source;      // what it is mounted from, e.g. "/dev/loop0p2"
};

// The mounts listed in self/mountinfo of the proc directory open as procFd,
// in the order the kernel lists them (escaped characters decoded).
Result<std::vector<MountEntry>> ReadMountTable(int procFd);

// The unique GUID (libblkid's PART_ENTRY_UUID, lowercase text) of the GPT
// entry that describes the partition device at devicePath. libblkid finds
// the whole disk through /sys and reads its table itself. ENOENT when the
// device has no such entry; another error when it cannot be probed.
Result<std::string> PartitionUuidOf(const std::string& devicePath);

// The mounts of mounts that come from a device (a source under /dev/),
// each with its partition's GUID as PartitionUuidOf reads it, in order.
struct PartitionMount {
  MountEntry mount;
  Result<std::string> uuid;
};
std::vector<PartitionMount> PartitionMounts(const std::vector<MountEntry>& mounts);

}  // namespace vtr

#endif  // VTR_STORAGE_MOUNT_TABLE_H_
