// FrameAssembler: cuts a byte stream into frame bodies as the bytes arrive,
// for readers that cannot wait for a whole frame (a non-blocking socket).
//
// The header is checked as soon as its four bytes are in, so a bad length
// is refused before any body byte is stored, and the body is validated as it
// arrives (MessageValidator), so a broken message is refused at its first
// bad byte. The body buffer grows only with the bytes actually received,
// never to the length a header announces, so a peer that announces 16 MiB
// and sends ten bytes costs ten bytes. An assembler told not to keep bodies
// stores none at all: its frames are validated and dropped.
// Not thread-safe; one assembler per stream.
#ifndef VTR_XPC_FRAME_ASSEMBLER_H_
#define VTR_XPC_FRAME_ASSEMBLER_H_

#include <array>
#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/result.h"
#include "xpc/message_validator.h"
#include "xpc/wire_codec.h"

namespace vtr {

class FrameAssembler {
 public:
  explicit FrameAssembler(bool keepBodies = true) : keepBodies_(keepBodies) {}

  // Takes bytes from input up to the end of the current frame at most and
  // returns how many it took. Once a frame is complete it takes nothing more
  // until takeFrame(). An Error when a header announces a bad length; the
  // assembler is then spent and must not be fed again.
  Result<size_t> consume(std::span<const uint8_t> input);

  bool frameComplete() const { return haveLength_ && validator_.received() == length_; }
  // The completed body (empty when bodies are not kept); the assembler
  // starts over on the next frame. Only valid when frameComplete().
  XpcBytes takeFrame();
  // What decoding the completed frame would allocate (MessageValidator).
  uint64_t decodeCost() const { return validator_.decodeCost(); }

  // Bytes held for the frame in progress (header and body).
  size_t bufferedBytes() const { return headerFill_ + body_.size(); }
  // True between the first byte of a frame and its completion.
  bool midFrame() const { return (headerFill_ > 0 || validator_.received() > 0) && !frameComplete(); }

 private:
  std::array<uint8_t, kFrameHeaderBytes> header_{};
  size_t headerFill_ = 0;
  bool haveLength_ = false;
  uint32_t length_ = 0;
  bool keepBodies_;
  XpcBytes body_;
  MessageValidator validator_;
};

}  // namespace vtr

#endif  // VTR_XPC_FRAME_ASSEMBLER_H_
