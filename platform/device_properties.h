// Answers the device gives about itself, as the platform's device-property
// query would.
#ifndef VTR_PLATFORM_DEVICE_PROPERTIES_H_
#define VTR_PLATFORM_DEVICE_PROPERTIES_H_

#include <fcntl.h>

#include <optional>
#include <string>

#include "platform/value.h"

namespace vtr {

inline constexpr char kEfiVariablesFolder[] = "/sys/firmware/efi/efivars";

// "SigningFuse": whether the device is fused for production signing. Read
// from the UEFI Secure Boot state, the variable
// SecureBoot-8be4df61-93ca-11d2-aa0d-00e098032b8c in efivarsFolder: 4
// attribute bytes, then one byte, 1 fused and 0 not. No variable, one
// shorter than 5 bytes or a value byte other than 0 and 1: no answer.
// The folder is an absolute path resolved beneath rootFd (AT_FDCWD: as it
// stands).
std::optional<bool> SigningFuse(const std::string& efivarsFolder = kEfiVariablesFolder, int rootFd = AT_FDCWD);

// "DiskUsage": a dictionary of the data volume's numbers in bytes, from
// statvfs of dataVolume: kDiskUsageTotalDataCapacity = f_blocks x f_frsize,
// kDiskUsageTotalDataAvailable = f_bavail x f_frsize (what an unprivileged
// writer may still use). No answer when the volume cannot be asked.
inline constexpr char kDiskUsageTotalDataCapacity[] = "TotalDataCapacity";
inline constexpr char kDiskUsageTotalDataAvailable[] = "TotalDataAvailable";
std::optional<Value> DiskUsage(const std::string& dataVolume = "/private/var");

}  // namespace vtr

#endif  // VTR_PLATFORM_DEVICE_PROPERTIES_H_
