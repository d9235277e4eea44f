// FrameAssembler: cuts a byte stream into frame bodies as the bytes arrive,
// for readers that cannot wait for a whole frame (a non-blocking socket).
//
// The header is checked as soon as its four bytes are in, so a bad length
// is refused before any body byte is stored. The body buffer grows only with
// the bytes actually received, never to the length a header announces, so a
// peer that announces 16 MiB and sends ten bytes costs ten bytes.
// Not thread-safe; one assembler per stream.
#ifndef VTR_XPC_FRAME_ASSEMBLER_H_
#define VTR_XPC_FRAME_ASSEMBLER_H_

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/result.h"
#include "xpc/wire_codec.h"

namespace vtr {

class FrameAssembler {
 public:
  // Takes bytes from input up to the end of the current frame at most and
  // returns how many it took. Once a frame is complete it takes nothing more
  // until takeFrame(). An Error when a header announces a bad length; the
  // assembler is then spent and must not be fed again.
  Result<size_t> consume(std::span<const uint8_t> input);

  bool frameComplete() const { return haveLength_ && body_.size() == length_; }
  // The completed body; the assembler starts over on the next frame. Only
  // valid when frameComplete().
  XpcBytes takeFrame();

  // Bytes held for the frame in progress (header and body).
  size_t bufferedBytes() const { return headerFill_ + body_.size(); }
  // True between the first byte of a frame and its completion.
  bool midFrame() const { return bufferedBytes() > 0 && !frameComplete(); }

 private:
  std::array<uint8_t, kFrameHeaderBytes> header_{};
  size_t headerFill_ = 0;
  bool haveLength_ = false;
  uint32_t length_ = 0;
  XpcBytes body_;
};

}  // namespace vtr

#endif  // VTR_XPC_FRAME_ASSEMBLER_H_
