#include "platform/base64.h"

#include <algorithm>

namespace vtr {

void AppendBase64(std::span<const uint8_t> bytes, std::string* out) {
  static constexpr char kDigits[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  for (size_t i = 0; i < bytes.size(); i += 3) {
    const size_t n = std::min<size_t>(3, bytes.size() - i);
    uint32_t group = uint32_t{bytes[i]} << 16;
    if (n > 1) group |= uint32_t{bytes[i + 1]} << 8;
    if (n > 2) group |= bytes[i + 2];
    out->push_back(kDigits[group >> 18 & 0x3f]);
    out->push_back(kDigits[group >> 12 & 0x3f]);
    out->push_back(n > 1 ? kDigits[group >> 6 & 0x3f] : '=');
    out->push_back(n > 2 ? kDigits[group & 0x3f] : '=');
  }
}

}  // namespace vtr
