// Property-list files: format dispatch, reading a file safely and writing one
// atomically. The codecs themselves live in plist_binary_*.cc and
// plist_xml_*.cc.
#include "platform/plist.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

#include "platform/atomic_file.h"
#include "platform/format.h"
#include "platform/unique_fd.h"

namespace vtr {
namespace {

constexpr std::string_view kBinaryMagic = "bplist00";

bool HasBinaryMagic(std::span<const uint8_t> bytes) {
  return bytes.size() >= kBinaryMagic.size() &&
         std::memcmp(bytes.data(), kBinaryMagic.data(), kBinaryMagic.size()) == 0;
}

// Reads fd to its end, failing once more than limit bytes arrive (the file
// may have grown since it was measured as expected bytes long).
Result<Bytes> ReadAtMost(int fd, uint64_t limit, uint64_t expected, const std::string& path) {
  // One byte more than expected, so that reaching the end costs no regrowth.
  Bytes bytes(static_cast<size_t>(std::min(expected, limit)) + 1);
  size_t used = 0;
  for (;;) {
    if (used == bytes.size()) {
      if (used > limit) {
        return Error::Invalid(Format("%s: property list grew past the limit of %llu bytes while being read", path,
                                     static_cast<unsigned long long>(limit)));
      }
      bytes.resize(static_cast<size_t>(std::min<uint64_t>(limit + 1, uint64_t{used} * 2)));
    }
    const ssize_t n = ::read(fd, bytes.data() + used, bytes.size() - used);
    if (n < 0) {
      if (errno == EINTR) continue;
      return Error::FromErrno(path);
    }
    if (n == 0) break;
    used += static_cast<size_t>(n);
  }
  bytes.resize(used);
  return bytes;
}

}  // namespace

Result<Value> ReadPropertyList(std::span<const uint8_t> bytes, const PlistLimits& limits) {
  if (HasBinaryMagic(bytes)) return ReadBinaryPropertyList(bytes, limits);
  return ReadXmlPropertyList(bytes, limits);
}

Result<Value> ReadPropertyListFile(const std::string& path, const PlistLimits& limits) {
  // O_NONBLOCK keeps a FIFO planted at path from blocking the open; it has no
  // effect on the regular file that is required.
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_CLOEXEC | O_NONBLOCK));
  if (!fd) return Error::FromErrno(path);
  struct stat st;
  if (::fstat(fd.get(), &st) != 0) return Error::FromErrno(path);
  if (!S_ISREG(st.st_mode)) return Error::Invalid(Format("%s: not a regular file", path));
  if (static_cast<uint64_t>(st.st_size) > limits.maxInputBytes) {
    return Error::Invalid(Format("%s: property list of %lld bytes is larger than the limit of %llu bytes", path,
                                 static_cast<long long>(st.st_size),
                                 static_cast<unsigned long long>(limits.maxInputBytes)));
  }
  Result<Bytes> bytes = ReadAtMost(fd.get(), limits.maxInputBytes, static_cast<uint64_t>(st.st_size), path);
  if (!bytes.ok()) return bytes.error();
  Result<Value> value = ReadPropertyList(*bytes, limits);
  if (!value.ok()) return Error(value.error().code(), Format("%s: %s", path, value.error().message()));
  return value;
}

Status WritePropertyListFile(const std::string& path, const Value& value, PlistFormat format, mode_t mode) {
  if (format == PlistFormat::kBinary) {
    Result<Bytes> bytes = EncodeBinaryPropertyList(value);
    if (!bytes.ok()) return bytes.error();
    return WriteFileAtomically(path, *bytes, mode);
  }
  Result<std::string> xml = EncodeXmlPropertyList(value);
  if (!xml.ok()) return xml.error();
  return WriteFileAtomically(path, std::span(reinterpret_cast<const uint8_t*>(xml->data()), xml->size()), mode);
}

}  // namespace vtr
