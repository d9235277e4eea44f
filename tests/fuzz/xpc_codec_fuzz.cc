// Decodes arbitrary bytes as a frame body. Whatever decodes must encode back
// to exactly the same bytes (the format has one encoding per object) and
// decode again to an equal object; the streaming validator must accept
// whatever decodes and refuse whatever does not, but for duplicate keys
// (which it cannot see); nothing may crash, leak or run away.
#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <span>
#include <string>

#include "xpc/frame_assembler.h"
#include "xpc/message_validator.h"
#include "xpc/wire_codec.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::span<const uint8_t> body(data, size);
  vtr::Result<vtr::XpcObject> decoded = vtr::DecodeMessage(body);
  vtr::MessageValidator validator;
  validator.start(static_cast<uint32_t>(size));
  const bool valid = size > 0 && validator.feed(body).ok() && validator.finish().ok();
  if (valid != decoded.ok() &&
      (decoded.ok() || decoded.error().message().find("duplicate key") == std::string::npos)) {
    std::abort();
  }
  if (!decoded.ok()) return 0;

  vtr::Result<vtr::XpcBytes> frame = vtr::EncodeFrame(*decoded);
  if (!frame.ok()) std::abort();
  std::span<const uint8_t> again(frame->data() + vtr::kFrameHeaderBytes, frame->size() - vtr::kFrameHeaderBytes);
  if (!std::equal(again.begin(), again.end(), body.begin(), body.end())) std::abort();

  // The frame goes through the assembler as a reader would see it.
  vtr::FrameAssembler assembler;
  vtr::Result<size_t> used = assembler.consume(*frame);
  if (!used.ok() || *used != frame->size() || !assembler.frameComplete()) std::abort();
  vtr::Result<vtr::XpcObject> redecoded = vtr::DecodeMessage(assembler.takeFrame());
  if (!redecoded.ok() || !(*redecoded == *decoded)) std::abort();
  return 0;
}
