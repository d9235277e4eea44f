// Base64 (the standard alphabet, padded), as property lists and the tools'
// JSON output carry data.
#ifndef VTR_PLATFORM_BASE64_H_
#define VTR_PLATFORM_BASE64_H_

#include <cstdint>
#include <span>
#include <string>

namespace vtr {

// Appends the base64 text of bytes to out, "=" padded, on one line.
void AppendBase64(std::span<const uint8_t> bytes, std::string* out);

}  // namespace vtr

#endif  // VTR_PLATFORM_BASE64_H_
