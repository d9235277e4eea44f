#include "platform/device_properties.h"

#include <fcntl.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include "platform/read_fully.h"
#include "platform/unique_fd.h"

namespace vtr {

std::optional<bool> SigningFuse(const std::string& efivarsFolder, int rootFd) {
  std::string path = efivarsFolder + "/SecureBoot-8be4df61-93ca-11d2-aa0d-00e098032b8c";
  if (rootFd != AT_FDCWD) path = path.substr(path.find_first_not_of('/'));
  UniqueFd fd(::openat(rootFd, path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!fd) return std::nullopt;
  Result<std::string> bytes = ReadFully(fd.get(), 64);
  if (!bytes.ok() || bytes->size() < 5) return std::nullopt;
  const unsigned char value = static_cast<unsigned char>((*bytes)[4]);
  if (value > 1) return std::nullopt;
  return value == 1;
}

std::optional<Value> DiskUsage(const std::string& dataVolume) {
  struct statvfs st;
  if (::statvfs(dataVolume.c_str(), &st) != 0) return std::nullopt;
  const auto bytes = [&](uint64_t blocks) { return Value::Integer(static_cast<int64_t>(blocks * st.f_frsize)); };
  return Value::DictionaryOf({{kDiskUsageTotalDataCapacity, bytes(st.f_blocks)},
                              {kDiskUsageTotalDataAvailable, bytes(st.f_bavail)}});
}

}  // namespace vtr
