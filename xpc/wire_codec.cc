#include "xpc/wire_codec.h"

#include <cstring>
#include <optional>
#include <string>
#include <utility>

#include "platform/format.h"
#include "platform/little_endian.h"

namespace vtr {
namespace {

// The smallest encodings, used to bound a count by the bytes left: an
// object is at least its tag, a dictionary entry at least a key length and
// a tag.
constexpr size_t kMinObjectBytes = 1;
constexpr size_t kMinEntryBytes = 4 + 1;

// Reads one object tree from a body, stopping at the first broken rule.
class Decoder {
 public:
  explicit Decoder(std::span<const uint8_t> body) : in_(body) {}

  Result<XpcObject> message() {
    if (in_.empty()) return fail("empty body");
    if (in_[0] != static_cast<uint8_t>(XpcObject::Type::kDictionary)) {
      return fail(Format("top-level object has tag 0x%02x, not a dictionary", in_[0]));
    }
    std::optional<XpcObject> top = object(1);
    if (!top) return error_;
    if (pos_ != in_.size()) return fail(Format("%zu bytes left over after the message", in_.size() - pos_));
    return std::move(*top);
  }

 private:
  std::optional<XpcObject> object(int depth) {
    const uint8_t* tag = take(1, "tag");
    if (!tag) return std::nullopt;
    switch (static_cast<XpcObject::Type>(*tag)) {
      case XpcObject::Type::kNull:
        return XpcObject::Null();
      case XpcObject::Type::kBool:
        return boolean();
      case XpcObject::Type::kInt64:
        return fixed64("int64", [](uint64_t v) { return XpcObject::Int64(static_cast<int64_t>(v)); });
      case XpcObject::Type::kUint64:
        return fixed64("uint64", [](uint64_t v) { return XpcObject::Uint64(v); });
      case XpcObject::Type::kDouble:
        return fixed64("double", [](uint64_t v) {
          double d;
          std::memcpy(&d, &v, sizeof d);
          return XpcObject::Double(d);
        });
      case XpcObject::Type::kDate:
        return fixed64("date", [](uint64_t v) { return XpcObject::Date(static_cast<int64_t>(v)); });
      case XpcObject::Type::kData:
        return data();
      case XpcObject::Type::kString: {
        std::optional<std::string> text = string("string");
        if (!text) return std::nullopt;
        return XpcObject::String(std::move(*text));
      }
      case XpcObject::Type::kUuid:
        return uuid();
      case XpcObject::Type::kArray:
        return array(depth);
      case XpcObject::Type::kDictionary:
        return dictionary(depth);
    }
    failAt(pos_ - 1, Format("unknown tag 0x%02x", *tag));
    return std::nullopt;
  }

  std::optional<XpcObject> boolean() {
    const uint8_t* byte = take(1, "bool");
    if (!byte) return std::nullopt;
    if (*byte > 1) {
      failAt(pos_ - 1, Format("bool byte 0x%02x is neither 0 nor 1", *byte));
      return std::nullopt;
    }
    return XpcObject::Bool(*byte == 1);
  }

  template <typename Make>
  std::optional<XpcObject> fixed64(const char* what, Make make) {
    const uint8_t* p = take(8, what);
    if (!p) return std::nullopt;
    return make(LoadU64(p));
  }

  std::optional<XpcObject> data() {
    std::optional<uint32_t> length = u32("data length");
    if (!length) return std::nullopt;
    const uint8_t* p = take(*length, "data");
    if (!p) return std::nullopt;
    return XpcObject::Data(XpcBytes(p, p + *length));
  }

  std::optional<XpcObject> uuid() {
    const uint8_t* p = take(16, "uuid");
    if (!p) return std::nullopt;
    XpcUuid bytes;
    std::memcpy(bytes.data(), p, bytes.size());
    return XpcObject::Uuid(bytes);
  }

  // A string or key: u32 length and bytes without NUL.
  std::optional<std::string> string(const char* what) {
    std::optional<uint32_t> length = u32(what);
    if (!length) return std::nullopt;
    size_t start = pos_;
    const uint8_t* p = take(*length, what);
    if (!p) return std::nullopt;
    if (const void* nul = std::memchr(p, 0, *length)) {
      failAt(start + static_cast<size_t>(static_cast<const uint8_t*>(nul) - p), Format("NUL byte in a %s", what));
      return std::nullopt;
    }
    return std::string(reinterpret_cast<const char*>(p), *length);
  }

  bool enter(int depth) {
    if (depth <= kMaxMessageDepth) return true;
    failAt(pos_ - 1, Format("nesting deeper than %d", kMaxMessageDepth));
    return false;
  }

  // A count of items of at least minBytes each, checked against what is left.
  std::optional<uint32_t> count(const char* what, size_t minBytes) {
    std::optional<uint32_t> n = u32(what);
    if (!n) return std::nullopt;
    if (*n > remaining() / minBytes) {
      failAt(pos_ - 4, Format("%s %u exceeds the %zu bytes left", what, *n, remaining()));
      return std::nullopt;
    }
    return n;
  }

  std::optional<XpcObject> array(int depth) {
    if (!enter(depth)) return std::nullopt;
    std::optional<uint32_t> n = count("array count", kMinObjectBytes);
    if (!n) return std::nullopt;
    XpcArray items;
    items.reserve(*n);
    for (uint32_t i = 0; i < *n; ++i) {
      std::optional<XpcObject> item = object(depth + 1);
      if (!item) return std::nullopt;
      items.push_back(std::move(*item));
    }
    return XpcObject::Array(std::move(items));
  }

  std::optional<XpcObject> dictionary(int depth) {
    if (!enter(depth)) return std::nullopt;
    size_t start = pos_ - 1;
    std::optional<uint32_t> n = count("dictionary count", kMinEntryBytes);
    if (!n) return std::nullopt;
    std::vector<XpcDictionary::Entry> entries;
    entries.reserve(*n);
    for (uint32_t i = 0; i < *n; ++i) {
      std::optional<std::string> key = string("key");
      if (!key) return std::nullopt;
      std::optional<XpcObject> value = object(depth + 1);
      if (!value) return std::nullopt;
      entries.emplace_back(std::move(*key), std::move(*value));
    }
    std::optional<XpcDictionary> dict = XpcDictionary::FromUniqueEntries(std::move(entries));
    if (!dict) {
      failAt(start, "duplicate key in a dictionary");
      return std::nullopt;
    }
    return XpcObject::Dictionary(std::move(*dict));
  }

  std::optional<uint32_t> u32(const char* what) {
    const uint8_t* p = take(4, what);
    if (!p) return std::nullopt;
    return LoadU32(p);
  }

  size_t remaining() const { return in_.size() - pos_; }

  // The next n bytes, or null (and a truncation error) when fewer remain.
  const uint8_t* take(size_t n, const char* what) {
    if (n > remaining()) {
      failAt(pos_, Format("truncated %s: %zu bytes needed, %zu left", what, n, remaining()));
      return nullptr;
    }
    const uint8_t* p = in_.data() + pos_;
    pos_ += n;
    return p;
  }

  void failAt(size_t offset, const std::string& what) { error_ = Error::Invalid(Format("%s at offset %zu", what, offset)); }
  Error fail(const std::string& what) { return Error::Invalid(what); }

  std::span<const uint8_t> in_;
  size_t pos_ = 0;
  Error error_;
};

// Writes one object tree, refusing what a decoder would refuse.
class Encoder {
 public:
  Status frame(const XpcObject& message) {
    if (message.type() != XpcObject::Type::kDictionary) {
      return Error::Invalid(Format("a message must be a dictionary, not %s", XpcTypeName(message.type())));
    }
    out_.resize(kFrameHeaderBytes);
    if (Status status = object(message, 1); !status) return status;
    size_t body = out_.size() - kFrameHeaderBytes;
    if (body > kMaxFrameBodyBytes) {
      return Error(EMSGSIZE, Format("message of %zu bytes exceeds the frame limit of %u", body, kMaxFrameBodyBytes));
    }
    for (size_t i = 0; i < kFrameHeaderBytes; ++i) out_[i] = static_cast<uint8_t>(body >> (8 * i));
    return Status::Ok();
  }

  XpcBytes take() { return std::move(out_); }

 private:
  Status object(const XpcObject& value, int depth) {
    out_.push_back(static_cast<uint8_t>(value.type()));
    switch (value.type()) {
      case XpcObject::Type::kNull:
        return Status::Ok();
      case XpcObject::Type::kBool:
        out_.push_back(*value.boolValue() ? 1 : 0);
        return Status::Ok();
      case XpcObject::Type::kInt64:
        return u64(static_cast<uint64_t>(*value.int64Value()));
      case XpcObject::Type::kUint64:
        return u64(*value.uint64Value());
      case XpcObject::Type::kDouble: {
        double d = *value.doubleValue();
        uint64_t bits;
        std::memcpy(&bits, &d, sizeof bits);
        return u64(bits);
      }
      case XpcObject::Type::kDate:
        return u64(static_cast<uint64_t>(*value.dateValue()));
      case XpcObject::Type::kData:
        return bytes(*value.data());
      case XpcObject::Type::kString:
        return text(*value.string(), "string");
      case XpcObject::Type::kUuid: {
        XpcUuid uuid = *value.uuidValue();
        out_.insert(out_.end(), uuid.begin(), uuid.end());
        return Status::Ok();
      }
      case XpcObject::Type::kArray:
        return array(*value.array(), depth);
      case XpcObject::Type::kDictionary:
        return dictionary(*value.dictionary(), depth);
    }
    return Error::Invalid("unknown object type");
  }

  Status array(const XpcArray& items, int depth) {
    if (Status status = enter(depth, items.size()); !status) return status;
    for (const XpcObject& item : items) {
      if (Status status = object(item, depth + 1); !status) return status;
    }
    return Status::Ok();
  }

  Status dictionary(const XpcDictionary& dict, int depth) {
    if (Status status = enter(depth, dict.size()); !status) return status;
    for (const auto& [key, value] : dict) {
      if (Status status = text(key, "key"); !status) return status;
      if (Status status = object(value, depth + 1); !status) return status;
    }
    return Status::Ok();
  }

  Status enter(int depth, size_t count) {
    if (depth > kMaxMessageDepth) return Error::Invalid(Format("message nests deeper than %d", kMaxMessageDepth));
    return u32(count);
  }

  Status text(const std::string& value, const char* what) {
    if (value.find('\0') != std::string::npos) return Error::Invalid(Format("NUL byte in a %s", what));
    return bytes(std::span(reinterpret_cast<const uint8_t*>(value.data()), value.size()));
  }

  Status bytes(std::span<const uint8_t> value) {
    if (Status status = u32(value.size()); !status) return status;
    out_.insert(out_.end(), value.begin(), value.end());
    return Status::Ok();
  }

  Status u32(size_t value) {
    if (value > kMaxFrameBodyBytes) {
      return Error(EMSGSIZE, Format("a length of %zu exceeds the frame limit of %u", value, kMaxFrameBodyBytes));
    }
    for (int i = 0; i < 4; ++i) out_.push_back(static_cast<uint8_t>(value >> (8 * i)));
    return Status::Ok();
  }

  Status u64(uint64_t value) {
    for (int i = 0; i < 8; ++i) out_.push_back(static_cast<uint8_t>(value >> (8 * i)));
    return Status::Ok();
  }

  XpcBytes out_;
};

}  // namespace

Result<uint32_t> DecodeFrameLength(std::span<const uint8_t, kFrameHeaderBytes> header) {
  uint32_t length = LoadU32(header.data());
  if (length == 0) return Error::Invalid("frame length 0");
  if (length > kMaxFrameBodyBytes) {
    return Error(EMSGSIZE, Format("frame length %u exceeds the limit of %u", length, kMaxFrameBodyBytes));
  }
  return length;
}

Result<XpcObject> DecodeMessage(std::span<const uint8_t> body) { return Decoder(body).message(); }

Result<XpcBytes> EncodeFrame(const XpcObject& message) {
  Encoder encoder;
  if (Status status = encoder.frame(message); !status) return status.error();
  return encoder.take();
}

}  // namespace vtr
