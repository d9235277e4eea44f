#include "xpc/message_validator.h"

#include <algorithm>
#include <cstring>
#include <string>

#include "platform/format.h"
#include "xpc/xpc_object.h"

namespace vtr {
namespace {

// The smallest encodings: an object is at least its tag, a dictionary entry
// at least a key length and a tag.
constexpr uint32_t kMinObjectBytes = 1;
constexpr uint32_t kMinEntryBytes = 4 + 1;
// What one heap block costs beyond its bytes: the allocator's header and a
// shared_ptr's control block, or a container's own fields.
constexpr uint64_t kBlockCost = 64;
constexpr uint64_t kObjectCost = sizeof(XpcObject);
// A dictionary entry's key (a std::string in a pair), counted twice since
// building a dictionary sorts a copy of its entries.
constexpr uint64_t kEntryCost = 2 * (sizeof(XpcDictionary::Entry) - sizeof(XpcObject));

}  // namespace

void MessageValidator::start(uint32_t bodyLength) {
  *this = MessageValidator();
  length_ = bodyLength;
}

Status MessageValidator::fail(const std::string& rule) const {
  return Error::Invalid(Format("%s at offset %u", rule, offset_));
}

Status MessageValidator::feed(std::span<const uint8_t> bytes) {
  if (bytes.size() > left()) return fail("bytes past the end of the body");
  while (!bytes.empty()) {
    // Skipped payloads and text pass in runs, not byte by byte.
    if (state_ == State::kSkip || state_ == State::kText) {
      const uint32_t n = static_cast<uint32_t>(std::min<size_t>(pending_, bytes.size()));
      if (state_ == State::kText && std::memchr(bytes.data(), 0, n) != nullptr) {
        return fail(textIsKey_ ? "a NUL byte in a key" : "a NUL byte in a string");
      }
      bytes = bytes.subspan(n);
      offset_ += n;
      pending_ -= n;
      if (pending_ == 0) {
        if (state_ == State::kText && textIsKey_) {
          state_ = State::kTag;  // the entry's value follows its key
        } else {
          objectDone();
        }
      }
      continue;
    }
    if (Status s = step(bytes.front()); !s.ok()) return s;
    bytes = bytes.subspan(1);
    ++offset_;
  }
  return Status::Ok();
}

Status MessageValidator::step(uint8_t byte) {
  switch (state_) {
    case State::kTag:
      return beginObject(byte);
    case State::kBool:
      if (byte > 1) return fail(Format("bool byte 0x%02x", byte));
      objectDone();
      return Status::Ok();
    case State::kLength:
      lengthValue_ |= uint32_t{byte} << (8 * lengthFill_);
      if (++lengthFill_ == 4) return beginLength(lengthValue_);
      return Status::Ok();
    case State::kDone:
      return fail("bytes left over after the message");
    case State::kSkip:
    case State::kText:
      break;
  }
  return Status::Ok();
}

Status MessageValidator::beginObject(uint8_t tag) {
  if (offset_ == 0 && tag != static_cast<uint8_t>(XpcObject::Type::kDictionary)) {
    return fail("a top-level object that is not a dictionary");
  }
  cost_ += kObjectCost;
  // The payload of a fixed-size object is the bytes after the tag.
  const auto skip = [this](uint32_t n) {
    if (n > left() - 1) return fail("a truncated payload");
    state_ = State::kSkip;
    pending_ = n;
    return Status::Ok();
  };
  switch (static_cast<XpcObject::Type>(tag)) {
    case XpcObject::Type::kNull:
      objectDone();
      return Status::Ok();
    case XpcObject::Type::kBool:
      state_ = State::kBool;
      return Status::Ok();
    case XpcObject::Type::kInt64:
    case XpcObject::Type::kUint64:
    case XpcObject::Type::kDouble:
    case XpcObject::Type::kDate:
      return skip(8);
    case XpcObject::Type::kUuid:
      return skip(16);
    case XpcObject::Type::kData:
    case XpcObject::Type::kString:
    case XpcObject::Type::kArray:
    case XpcObject::Type::kDictionary:
      break;
    default:
      return fail(Format("unknown tag 0x%02x", tag));
  }
  const auto type = static_cast<XpcObject::Type>(tag);
  lengthOf_ = type == XpcObject::Type::kData     ? LengthOf::kData
              : type == XpcObject::Type::kString ? LengthOf::kString
              : type == XpcObject::Type::kArray  ? LengthOf::kArrayCount
                                                 : LengthOf::kDictionaryCount;
  state_ = State::kLength;
  lengthValue_ = 0;
  lengthFill_ = 0;
  return Status::Ok();
}

Status MessageValidator::beginLength(uint32_t length) {
  const uint32_t rest = left() - 1;  // after this length's last byte
  switch (lengthOf_) {
    case LengthOf::kData:
    case LengthOf::kString:
    case LengthOf::kKey:
      if (length > rest) return fail("a length past the end of the body");
      cost_ += lengthOf_ == LengthOf::kKey ? kEntryCost + length : kBlockCost + length;
      textIsKey_ = lengthOf_ == LengthOf::kKey;
      state_ = lengthOf_ == LengthOf::kData ? State::kSkip : State::kText;
      pending_ = length;
      if (length == 0) {
        if (textIsKey_) {
          state_ = State::kTag;
        } else {
          objectDone();
        }
      }
      return Status::Ok();
    case LengthOf::kArrayCount:
    case LengthOf::kDictionaryCount: {
      const bool dictionary = lengthOf_ == LengthOf::kDictionaryCount;
      if (uint64_t{length} * (dictionary ? kMinEntryBytes : kMinObjectBytes) > rest) {
        return fail("a count larger than the bytes left");
      }
      if (depth_ == kMaxMessageDepth) return fail(Format("nesting deeper than %d", kMaxMessageDepth));
      cost_ += kBlockCost;
      levels_[static_cast<size_t>(depth_++)] = Level{length, dictionary};
      if (length == 0) {
        --depth_;
        objectDone();
      } else {
        expectNextInContainer();
      }
      return Status::Ok();
    }
  }
  return Status::Ok();
}

void MessageValidator::expectNextInContainer() {
  if (levels_[static_cast<size_t>(depth_ - 1)].dictionary) {
    state_ = State::kLength;
    lengthOf_ = LengthOf::kKey;
    lengthValue_ = 0;
    lengthFill_ = 0;
  } else {
    state_ = State::kTag;
  }
}

void MessageValidator::objectDone() {
  while (depth_ > 0) {
    Level& level = levels_[static_cast<size_t>(depth_ - 1)];
    if (--level.remaining > 0) {
      expectNextInContainer();
      return;
    }
    --depth_;  // the container itself is done: it counts in its own parent
  }
  state_ = State::kDone;
}

Status MessageValidator::finish() const {
  if (state_ != State::kDone || offset_ != length_) return fail("a body that ends before its message");
  return Status::Ok();
}

}  // namespace vtr
