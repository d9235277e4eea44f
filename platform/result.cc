#include "platform/result.h"

#include <cstring>

namespace vtr {

std::string Error::description() const {
  if (code_ == 0) return message_;
  std::string reason = std::strerror(code_);
  if (message_.empty()) return reason;
  return message_ + ": " + reason;
}

}  // namespace vtr
