// Reading a directory: the one lister of the helper and its tools, on
// getdents64 with every record's length checked against what the kernel
// returned.
#ifndef VTR_PLATFORM_DIRECTORY_LISTING_H_
#define VTR_PLATFORM_DIRECTORY_LISTING_H_

#include <cstdint>
#include <string>
#include <vector>

#include "platform/result.h"

namespace vtr {

struct DirectoryEntry {
  std::string name;
  uint8_t type;  // DT_* as the file system reports it (DT_UNKNOWN when it does not)
};

// The entries of the directory open as dirFd, without "." and "..", sorted
// by name. Read through a descriptor of its own, so dirFd's offset does not
// move. An Error naming pathForErrors when the directory cannot be read or a
// record is malformed.
Result<std::vector<DirectoryEntry>> ReadDirectory(int dirFd, const std::string& pathForErrors);

}  // namespace vtr

#endif  // VTR_PLATFORM_DIRECTORY_LISTING_H_
