// UTF-8 validation and repair for text that arrives from outside.
#ifndef VTR_PLATFORM_UTF8_H_
#define VTR_PLATFORM_UTF8_H_

#include <string>
#include <string_view>

namespace vtr {

// True when text is well-formed UTF-8: shortest forms only, no surrogate
// code points, nothing above U+10FFFF.
bool IsValidUtf8(std::string_view text);

// text with every ill-formed sequence replaced by U+FFFD, for messages that
// must show text that is not valid UTF-8.
std::string ToValidUtf8(std::string_view text);

}  // namespace vtr

#endif  // VTR_PLATFORM_UTF8_H_
