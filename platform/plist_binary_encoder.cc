#include "platform/plist_binary_encoder.h"

#include <bit>
#include <cstring>

#include "platform/format.h"

namespace vtr::bplist {
namespace {

Error Invalid(const std::string& what) { return Error::Invalid("binary property list: " + what); }

bool IsContainer(const Value& v) { return v.type() == Value::Type::kArray || v.type() == Value::Type::kDictionary; }

bool IsAscii(std::string_view text) {
  uint64_t highBits = 0;
  size_t i = 0;
  for (; i + 8 <= text.size(); i += 8) {
    uint64_t word;
    std::memcpy(&word, text.data() + i, 8);
    highBits |= word;
  }
  for (; i < text.size(); ++i) highBits |= static_cast<uint8_t>(text[i]);
  return (highBits & 0x8080808080808080u) == 0;
}

void AppendBigEndian(std::vector<uint8_t>* out, uint64_t v, size_t size) {
  for (size_t shift = 8 * size; shift > 0; shift -= 8) out->push_back(static_cast<uint8_t>(v >> (shift - 8)));
}

// An integer object of the smallest width: 1, 2, 4 or 8 bytes.
void AppendUnsignedInteger(std::vector<uint8_t>* out, uint64_t v) {
  const uint8_t size = BytesNeeded(v);
  out->push_back(static_cast<uint8_t>(kIntType << 4 | std::countr_zero(size)));
  AppendBigEndian(out, v, size);
}

void AppendDouble(std::vector<uint8_t>* out, uint8_t marker, double d) {
  uint64_t bits;
  std::memcpy(&bits, &d, sizeof bits);
  out->push_back(marker);
  AppendBigEndian(out, bits, 8);
}

}  // namespace

ObjectEncoder::ObjectEncoder(OutputStream* out, uint8_t refSize, size_t cacheCapacity)
    : out_(out), refSize_(refSize), cache_(cacheCapacity) {}

Status ObjectEncoder::begin() {
  base_ = out_->position();
  return out_->write(kMagic.data(), kMagicSize);
}

void ObjectEncoder::startObject(uint8_t type, uint64_t count) {
  scratch_.clear();
  if (count < kExtendedCount) {
    scratch_.push_back(static_cast<uint8_t>(type << 4 | count));
  } else {
    scratch_.push_back(static_cast<uint8_t>(type << 4 | kExtendedCount));
    AppendUnsignedInteger(&scratch_, count);
  }
}

uint8_t* ObjectEncoder::appendReferences(uint64_t count) {
  const size_t at = scratch_.size();
  scratch_.resize(at + count * refSize_);
  return scratch_.data() + at;
}

Result<uint64_t> ObjectEncoder::emit(std::span<const uint8_t> payload) {
  // Once the stream failed, even objects found in the cache are refused.
  if (!failure_.ok()) return failure_.error();
  // Checked first, so that the cache never remembers an index not written.
  if (refSize_ < 8 && objectCount_ >> (8 * refSize_) != 0) {
    return Invalid(Format("too many objects for %d-byte references", refSize_));
  }
  const bool cacheable = scratch_.size() + payload.size() <= ObjectCache::kMaxEncodingSize;
  if (cacheable) {
    scratch_.insert(scratch_.end(), payload.begin(), payload.end());
    payload = {};
    if (const uint64_t found = cache_.findOrAdd(scratch_, objectCount_); found != objectCount_) return found;
  }
  const uint64_t offset = out_->position() - base_;
  for (uint64_t delta = offset - lastOffset_;; delta >>= 7) {
    if (delta < 0x80) {
      offsetDeltas_.push_back(static_cast<uint8_t>(delta));
      break;
    }
    offsetDeltas_.push_back(static_cast<uint8_t>(0x80 | (delta & 0x7F)));
  }
  lastOffset_ = offset;
  const uint64_t index = objectCount_++;
  failure_ = out_->write(scratch_.data(), scratch_.size());
  if (failure_.ok() && !payload.empty()) failure_ = out_->write(payload.data(), payload.size());
  if (!failure_.ok()) return failure_.error();
  return index;
}

Result<uint64_t> ObjectEncoder::writeString(std::string_view text) {
  if (IsAscii(text)) {
    startObject(kAsciiType, text.size());
    return emit({reinterpret_cast<const uint8_t*>(text.data()), text.size()});
  }
  utf16_.clear();
  uint64_t units = 0;
  if (!AppendUtf16BigEndianFromUtf8(text, &utf16_, &units)) return Invalid("string is not valid UTF-8");
  startObject(kUtf16Type, units);
  return emit(utf16_);
}

Result<uint64_t> ObjectEncoder::writeScalar(const Value& value) {
  scratch_.clear();
  switch (value.type()) {
    case Value::Type::kNil:
      return Invalid("a nil value cannot be written");
    case Value::Type::kBoolean:
      scratch_.push_back(*value.boolean() ? kTrue : kFalse);
      break;
    case Value::Type::kInteger: {
      const int64_t i = *value.integer();
      if (i >= 0) {
        AppendUnsignedInteger(&scratch_, static_cast<uint64_t>(i));
      } else {
        scratch_.push_back(kIntType << 4 | 3);
        AppendBigEndian(&scratch_, static_cast<uint64_t>(i), 8);
      }
      break;
    }
    case Value::Type::kUnsigned:
      // Always 16 bytes, so that reading it back gives an unsigned value again.
      scratch_.push_back(kIntType << 4 | 4);
      AppendBigEndian(&scratch_, 0, 8);
      AppendBigEndian(&scratch_, *value.unsignedInteger(), 8);
      break;
    case Value::Type::kReal:
      AppendDouble(&scratch_, kRealType << 4 | 3, *value.real());
      break;
    case Value::Type::kDate:
      AppendDouble(&scratch_, kDateMarker, value.date()->secondsSince2001);
      break;
    case Value::Type::kString:
      return writeString(*value.string());
    case Value::Type::kData:
      startObject(kDataType, value.data()->size());
      return emit(*value.data());
    case Value::Type::kArray:
    case Value::Type::kDictionary:
      return Invalid("internal error: container written as a scalar");
  }
  return emit({});
}

Result<uint64_t> ObjectEncoder::writeContainer(const Pending& pending) {
  const uint64_t* refs = refs_.data() + pending.refsStart;
  if (const Array* array = pending.value->array()) {
    startObject(kArrayType, array->size());
    uint8_t* p = appendReferences(array->size());
    for (size_t i = 0; i < array->size(); ++i, p += refSize_) StoreBigEndian(p, refs[i], refSize_);
    return emit({});
  }
  // Child indexes alternate key, value.
  return writeDictionary(
      pending.value->dictionary()->size(), [refs](uint64_t i) { return refs[2 * i]; },
      [refs](uint64_t i) { return refs[2 * i + 1]; });
}

Result<uint64_t> ObjectEncoder::write(const Value& value) {
  if (!IsContainer(value)) return writeScalar(value);
  stack_.clear();
  refs_.clear();
  stack_.push_back({&value, 0, 0});
  while (true) {
    Pending& top = stack_.back();
    const Value* child = nullptr;
    if (const Array* array = top.value->array()) {
      if (top.next < array->size()) child = &(*array)[top.next++];
    } else if (const Dictionary* dict = top.value->dictionary(); top.next < 2 * dict->size()) {
      const auto& entry = dict->begin()[top.next / 2];
      if (top.next++ % 2 == 0) {
        Result<uint64_t> key = writeString(entry.first);
        if (!key.ok()) return key;
        refs_.push_back(*key);
        continue;
      }
      child = &entry.second;
    }

    if (child && IsContainer(*child)) {
      stack_.push_back({child, 0, refs_.size()});
      continue;
    }
    Result<uint64_t> index = child ? writeScalar(*child) : writeContainer(top);
    if (!index.ok()) return index;
    if (!child) {
      refs_.resize(top.refsStart);
      stack_.pop_back();
      if (stack_.empty()) return index;
    }
    refs_.push_back(*index);
  }
}

Status ObjectEncoder::end(uint64_t top) {
  const uint64_t tableOffset = out_->position() - base_;
  const uint8_t offsetSize = BytesNeeded(tableOffset);
  std::vector<uint8_t> buffer;
  buffer.reserve(64 << 10);
  uint64_t offset = 0;
  for (size_t i = 0; i < offsetDeltas_.size();) {
    uint64_t delta = 0;
    for (int shift = 0;; shift += 7) {
      const uint8_t b = offsetDeltas_[i++];
      delta |= uint64_t{b & 0x7Fu} << shift;
      if (b < 0x80) break;
    }
    offset += delta;
    buffer.resize(buffer.size() + offsetSize);
    StoreBigEndian(buffer.data() + buffer.size() - offsetSize, offset, offsetSize);
    if (buffer.size() >= (64 << 10) - 8) {
      if (Status s = out_->write(buffer.data(), buffer.size()); !s.ok()) return s;
      buffer.clear();
    }
  }
  buffer.insert(buffer.end(), 5, 0);  // unused
  buffer.push_back(0);                // sort version
  buffer.push_back(offsetSize);
  buffer.push_back(refSize_);
  AppendBigEndian(&buffer, objectCount_, 8);
  AppendBigEndian(&buffer, top, 8);
  AppendBigEndian(&buffer, tableOffset, 8);
  if (Status s = out_->write(buffer.data(), buffer.size()); !s.ok()) return s;
  return out_->flush();
}

}  // namespace vtr::bplist
