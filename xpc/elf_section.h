// Reading one named section out of an ELF file with libelf, for the
// entitlements a client's executable carries. Thread-safe (libelf is
// initialised once; each call has its own handle).
#ifndef VTR_XPC_ELF_SECTION_H_
#define VTR_XPC_ELF_SECTION_H_

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>
#include <vector>

#include "platform/result.h"

namespace vtr {

// The contents of the section called name in the ELF file open on fd (read
// with pread; the file offset is not used). nullopt when the file has no
// such section. An Error when the file is not ELF or is malformed, when the
// name stands on more than one section, when the section occupies no file
// bytes, or when it is larger than maxBytes.
Result<std::optional<std::vector<uint8_t>>> ReadElfSection(int fd, std::string_view name, size_t maxBytes);

}  // namespace vtr

#endif  // VTR_XPC_ELF_SECTION_H_
