#include "xpc/frame_assembler.h"

#include <algorithm>
#include <utility>

namespace vtr {

Result<size_t> FrameAssembler::consume(std::span<const uint8_t> input) {
  size_t used = 0;
  if (!haveLength_) {
    size_t n = std::min(input.size(), kFrameHeaderBytes - headerFill_);
    std::copy_n(input.begin(), n, header_.begin() + headerFill_);
    headerFill_ += n;
    used += n;
    if (headerFill_ < kFrameHeaderBytes) return used;
    Result<uint32_t> length = DecodeFrameLength(header_);
    if (!length) return length.error();
    length_ = *length;
    haveLength_ = true;
  }
  size_t n = std::min(input.size() - used, size_t{length_} - body_.size());
  body_.insert(body_.end(), input.begin() + used, input.begin() + used + n);
  return used + n;
}

XpcBytes FrameAssembler::takeFrame() {
  XpcBytes body = std::move(body_);
  body_ = XpcBytes();
  headerFill_ = 0;
  haveLength_ = false;
  length_ = 0;
  return body;
}

}  // namespace vtr
