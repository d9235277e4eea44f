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
    validator_.start(length_);
  }
  const size_t n = std::min(input.size() - used, size_t{length_} - validator_.received());
  const std::span<const uint8_t> body = input.subspan(used, n);
  if (Status valid = validator_.feed(body); !valid.ok()) return valid.error();
  if (validator_.received() == length_) {
    if (Status whole = validator_.finish(); !whole.ok()) return whole.error();
  }
  if (keepBodies_) body_.insert(body_.end(), body.begin(), body.end());
  return used + n;
}

XpcBytes FrameAssembler::takeFrame() {
  XpcBytes body = std::move(body_);
  body_ = XpcBytes();
  headerFill_ = 0;
  haveLength_ = false;
  length_ = 0;
  validator_.start(0);
  return body;
}

}  // namespace vtr
