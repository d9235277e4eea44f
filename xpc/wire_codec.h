// The wire format of the message service: frames in both directions, each a
// u32 little-endian body length N (1 <= N <= kMaxFrameBodyBytes) and N bytes
// holding exactly one encoded object, which for a message is a dictionary.
//
// An encoded object is a one-byte tag (XpcObject::Type's number) and its
// payload, integers little-endian, no padding: null none; bool one byte 0 or
// 1; int64, uint64, double (IEEE 754 binary64) and date (signed nanoseconds
// since 1970) 8 bytes; data and string a u32 length and the bytes (a string
// holds no NUL); uuid 16 bytes; array a u32 count and the objects;
// dictionary a u32 count, then per entry a key (u32 length, bytes, no NUL)
// and an object.
//
// Decoding treats its input as hostile: it checks every length and count
// against the bytes that remain before using or reserving anything, so it
// allocates at most a fixed multiple of the body's size, and it recurses at
// most kMaxMessageDepth levels. Every function here is thread-safe.
#ifndef VTR_XPC_WIRE_CODEC_H_
#define VTR_XPC_WIRE_CODEC_H_

#include <cstddef>
#include <cstdint>
#include <span>

#include "platform/result.h"
#include "xpc/xpc_object.h"

namespace vtr {

inline constexpr size_t kFrameHeaderBytes = 4;
inline constexpr uint32_t kMaxFrameBodyBytes = 16u << 20;
// Arrays and dictionaries nest at most this deep; the message's top
// dictionary is level 1.
inline constexpr int kMaxMessageDepth = 64;

// The body length a frame header announces, or an Error when it is 0 or
// larger than kMaxFrameBodyBytes (code EMSGSIZE).
Result<uint32_t> DecodeFrameLength(std::span<const uint8_t, kFrameHeaderBytes> header);

// The message held by a frame body. An Error (a protocol error, its message
// saying which rule broke and where) for an unknown tag, a bool byte other
// than 0/1, a truncated payload, bytes left over, a NUL in a key or string,
// a key repeated within one dictionary, nesting deeper than kMaxMessageDepth,
// or a top-level object that is not a dictionary.
Result<XpcObject> DecodeMessage(std::span<const uint8_t> body);

// A whole frame (header and body) holding message. Refuses, with an Error,
// what the peer would refuse to decode: a message that is not a dictionary,
// a NUL in a key or string, nesting deeper than kMaxMessageDepth, a body
// larger than kMaxFrameBodyBytes.
Result<XpcBytes> EncodeFrame(const XpcObject& message);

}  // namespace vtr

#endif  // VTR_XPC_WIRE_CODEC_H_
