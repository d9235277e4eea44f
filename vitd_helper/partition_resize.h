// Resizing the boot disk's data partition while the system runs.
//
// The disk is "/dev/rdisk0s1" (a block device of the whole disk, or a disk
// image file read in 4096-byte blocks) with the Zarn signature "nraZ" in its
// MBR and a GPT of at most eight entries; the data partition is the entry
// named "Data". The shrink driver gives half of the data volume's free
// space back to the disk; the expand driver grows the partition over every
// block the other partitions leave. Both end in adjust_partition, which
// keeps the file system never larger than its partition: a shrink resizes
// the mounted file system first and then the table, a growth the table
// first and then the file system. The table is written with its CRCs and
// its backup copy (one copy whole and flushed before the other is touched),
// the kernel told the partition's new size after, and a layout that would
// move any partition's start, the data partition's own included (its data
// would not move), is refused before anything changes.
//
// Every message goes to the log (VTRLog), except the volume-manager
// library's own, which go to standard error. Called one command at a time.
#ifndef VTR_VITD_HELPER_PARTITION_RESIZE_H_
#define VTR_VITD_HELPER_PARTITION_RESIZE_H_

#include <cstdint>
#include <memory>
#include <string>

#include "platform/unique_fd.h"

namespace vtr {

// Where the resize finds the machine: the raw disk, the data volume whose
// usage the shrink asks, and the proc directory (opened before any chroot)
// whose mount table names the mounted file systems.
struct DataPartitionDisk {
  std::string rawDevice = "/dev/rdisk0s1";
  std::string dataVolume = "/private/var";
  std::shared_ptr<const UniqueFd> procDirectory;
};
// The daemon sets its disk once at start; without a proc directory no
// file system is found mounted.
void SetDataPartitionDisk(DataPartitionDisk disk);

// newSize = total - free / 2 of the "DiskUsage" answer; 0 on success, -1.
int ShrinkDataPartition();
// newSize = the usable blocks less those of every entry but the one at
// table position 1; adjust_partition's result (0 success, 1 failure).
int ExpandDataPartition();
// Gives the "Data" partition (a new "New" partition when there is none)
// requiredSize bytes, rounded up to whole blocks; 0 on success (also when
// nothing changes), 1 on failure.
int adjust_partition(uint64_t requiredSize);

}  // namespace vtr

#endif  // VTR_VITD_HELPER_PARTITION_RESIZE_H_
