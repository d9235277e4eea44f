#include "storage/mount_table.h"

#include <blkid/blkid.h>
#include <fcntl.h>

#include <memory>
#include <sstream>

#include "platform/read_fully.h"
#include "platform/unique_fd.h"

namespace vtr {
namespace {

// mountinfo writes space, tab, newline and backslash as \ and three octal
// digits.
std::string Unescape(const std::string& field) {
  std::string out;
  for (size_t i = 0; i < field.size(); ++i) {
    if (field[i] == '\\' && i + 3 < field.size()) {
      const std::string digits = field.substr(i + 1, 3);
      if (digits.find_first_not_of("01234567") == std::string::npos) {
        out += static_cast<char>(std::stoi(digits, nullptr, 8));
        i += 3;
        continue;
      }
    }
    out += field[i];
  }
  return out;
}

}  // namespace

Result<std::vector<MountEntry>> ReadMountTable(int procFd) {
  UniqueFd file(::openat(procFd, "self/mountinfo", O_RDONLY | O_CLOEXEC));
  if (!file) return Error::FromErrno("mountinfo");
  Result<std::string> text = ReadFully(file.get(), size_t{64} << 20);
  if (!text.ok()) return text.error();
  std::vector<MountEntry> mounts;
  std::istringstream lines(*text);
  std::string line;
  while (std::getline(lines, line)) {
    // ID PARENT MAJ:MIN ROOT MOUNT-POINT OPTIONS [OPTIONAL...] - TYPE SOURCE SUPER-OPTIONS
    std::istringstream fields(line);
    std::string id, parent, device, root, mountPoint, options, field;
    if (!(fields >> id >> parent >> device >> root >> mountPoint >> options)) continue;
    while (fields >> field && field != "-") {
    }
    MountEntry entry;
    if (field != "-" || !(fields >> entry.type >> entry.source)) continue;
    entry.mountPoint = Unescape(mountPoint);
    entry.source = Unescape(entry.source);
    mounts.push_back(std::move(entry));
  }
  return mounts;
}

Result<std::string> PartitionUuidOf(const std::string& devicePath) {
  UniqueFd device(::open(devicePath.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
  if (!device) return Error::FromErrno(devicePath);
  std::unique_ptr<blkid_struct_probe, void (*)(blkid_probe)> probe(blkid_new_probe(), blkid_free_probe);
  if (!probe || blkid_probe_set_device(probe.get(), device.get(), 0, 0) != 0) {
    return Error(EIO, devicePath + ": libblkid cannot probe it");
  }
  blkid_probe_enable_superblocks(probe.get(), 0);
  blkid_probe_enable_partitions(probe.get(), 1);
  blkid_probe_set_partitions_flags(probe.get(), BLKID_PARTS_ENTRY_DETAILS);
  if (blkid_do_safeprobe(probe.get()) < 0) return Error(EIO, devicePath + ": libblkid probe failed");
  const char* value = nullptr;
  if (blkid_probe_lookup_value(probe.get(), "PART_ENTRY_UUID", &value, nullptr) != 0 || value == nullptr) {
    return Error(ENOENT, devicePath + ": no partition entry UUID");
  }
  return std::string(value);
}

std::vector<PartitionMount> PartitionMounts(const std::vector<MountEntry>& mounts) {
  std::vector<PartitionMount> found;
  for (const MountEntry& mount : mounts) {
    if (mount.source.rfind("/dev/", 0) == 0) found.push_back(PartitionMount{mount, PartitionUuidOf(mount.source)});
  }
  return found;
}

}  // namespace vtr
