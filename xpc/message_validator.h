// MessageValidator: checks, as its bytes arrive, that a frame body is one
// encoded message (wire_codec.h), without keeping the bytes or building a
// single object. It is what lets the helper drop a frame from a peer without
// the entitlement at a small fixed cost, and refuse before decoding a frame
// whose objects would cost more memory than their bytes justify.
//
// It checks every rule of the format that a fixed amount of state can: tags,
// bool bytes, lengths and counts against the bytes left in the body, NUL
// bytes in keys and strings, nesting deeper than kMaxMessageDepth, a top
// level that is not a dictionary, bytes left over. Duplicate keys need the
// keys themselves and are left to DecodeMessage.
//
// While it reads, it sums what decoding the message would allocate
// (decodeCost), an estimate never below what DecodeMessage takes.
// Not thread-safe; one validator per stream.
#ifndef VTR_XPC_MESSAGE_VALIDATOR_H_
#define VTR_XPC_MESSAGE_VALIDATOR_H_

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdint>
#include <span>
#include <string>

#include "platform/result.h"
#include "xpc/wire_codec.h"

namespace vtr {

class MessageValidator {
 public:
  // Starts a body of bodyLength bytes.
  void start(uint32_t bodyLength);
  // Takes the next bytes of the body (at most what is left of it). An Error,
  // saying which rule broke and at which offset, at the first broken rule;
  // the validator must then be started anew before it is fed again.
  Status feed(std::span<const uint8_t> bytes);
  // After the whole body: Ok when it held exactly one message.
  Status finish() const;

  // Bytes of the body fed so far.
  uint32_t received() const { return offset_; }
  // What decoding the bytes fed so far would allocate, in bytes.
  uint64_t decodeCost() const { return cost_; }

 private:
  enum class State : uint8_t { kTag, kBool, kSkip, kText, kLength, kDone };
  enum class LengthOf : uint8_t { kData, kString, kKey, kArrayCount, kDictionaryCount };
  struct Level {
    uint32_t remaining;  // entries (dictionary) or objects (array) still to come
    bool dictionary;
  };

  Status fail(const std::string& rule) const;
  // The byte at the current offset, in state_.
  Status step(uint8_t byte);
  Status beginObject(uint8_t tag);
  Status beginLength(uint32_t length);
  // One object finished: moves to what its container expects next.
  void objectDone();
  // What follows an entry's key or an array's slot.
  void expectNextInContainer();
  uint32_t left() const { return length_ - offset_; }

  uint32_t length_ = 0;
  uint32_t offset_ = 0;
  State state_ = State::kTag;
  LengthOf lengthOf_ = LengthOf::kData;
  uint32_t pending_ = 0;       // bytes still to skip or to check as text
  uint32_t lengthValue_ = 0;   // the u32 being read
  uint8_t lengthFill_ = 0;
  bool textIsKey_ = false;
  std::array<Level, kMaxMessageDepth> levels_{};
  int depth_ = 0;
  uint64_t cost_ = 0;
};

// Largest decodeCost decoded for a body of bodyLength bytes, by the helper
// and by its clients alike: four times the body, and at least a small floor
// that any ordinary message fits.
inline constexpr uint64_t kDecodeCostFactor = 4;
inline constexpr uint64_t kMinDecodeCostAllowed = 64 * 1024;
constexpr uint64_t MaxDecodeCost(uint32_t bodyLength) {
  return std::max<uint64_t>(uint64_t{bodyLength} * kDecodeCostFactor, kMinDecodeCostAllowed);
}

}  // namespace vtr

#endif  // VTR_XPC_MESSAGE_VALIDATOR_H_
