// The binary property-list reader (see plist_binary_reader.h).
#include <algorithm>
#include <cstring>
#include <optional>
#include <unordered_map>
#include <vector>

#include "platform/format.h"
#include "platform/plist.h"
#include "platform/plist_binary_reader.h"

namespace vtr::bplist {
namespace {

// Derived bounds when the caller leaves them at 0: a multiple of the input
// size, never below a floor that every small honest file stays far under.
constexpr uint64_t kNodeFloor = uint64_t{1} << 20;
constexpr uint64_t kByteFloor = uint64_t{64} << 20;
constexpr uint64_t kExpansionFactor = 16;

// Each object's state byte: how often the object is referenced (capped
// at 2, all that matters) and whether it is being decoded right now.
constexpr uint8_t kReferenceCountMask = 0x03;
constexpr uint8_t kOnPath = 0x80;
constexpr uint8_t kValidated = 0x40;

// Dictionaries and arrays reserve at most this many slots up front; a file
// cannot make every level of a deep stack reserve its claimed count.
constexpr uint64_t kMaxReserve = 256;

// Shared scalars remembered from one decode call to the next.
constexpr size_t kMaxScalarsRemembered = 4096;

uint64_t SaturatingAdd(uint64_t a, uint64_t b) { return a > UINT64_MAX - b ? UINT64_MAX : a + b; }
uint64_t SaturatingMultiply(uint64_t a, uint64_t b) { return b != 0 && a > UINT64_MAX / b ? UINT64_MAX : a * b; }

Error Invalid(const std::string& what) { return Error::Invalid("binary property list: " + what); }

}  // namespace

BinaryPlistReader::BinaryPlistReader(std::span<const uint8_t> bytes, const PlistLimits& limits)
    : bytes_(bytes), limits_(limits) {
  const uint64_t size = bytes.size();
  maxNodes_ = limits.maxExpandedNodes ? limits.maxExpandedNodes
                                      : std::max(kNodeFloor, SaturatingMultiply(kExpansionFactor, size));
  maxBytes_ = limits.maxExpandedBytes ? limits.maxExpandedBytes
                                      : std::max(kByteFloor, SaturatingMultiply(kExpansionFactor, size));
}

Status BinaryPlistReader::open() {
  if (Status s = readTrailer(); !s.ok()) return s;
  return checkObjects();
}

Error BinaryPlistReader::objectError(uint64_t index, const std::string& what) const {
  return Invalid(Format("object %llu: %@", static_cast<unsigned long long>(index), what));
}

Error BinaryPlistReader::objectError(const ObjectHeader& h, const std::string& what) const {
  return Invalid(Format("object %llu at offset %llu: %@", static_cast<unsigned long long>(h.index),
                        static_cast<unsigned long long>(h.offset), what));
}

Status BinaryPlistReader::readTrailer() {
  const uint64_t size = bytes_.size();
  if (size > limits_.maxInputBytes) {
    return Invalid(Format("input of %llu bytes exceeds the limit of %llu bytes", static_cast<unsigned long long>(size),
                          static_cast<unsigned long long>(limits_.maxInputBytes)));
  }
  if (size < kMagicSize + kTrailerSize) return Invalid("input too short");
  if (std::memcmp(bytes_.data(), kMagic.data(), kMagicSize) != 0) return Invalid("bad magic");
  const uint8_t* t = bytes_.data() + size - kTrailerSize;
  trailer_.sortVersion = t[5];
  trailer_.offsetIntSize = t[6];
  trailer_.objectRefSize = t[7];
  trailer_.numObjects = ReadBigEndian(t + 8, 8);
  trailer_.topObject = ReadBigEndian(t + 16, 8);
  trailer_.offsetTableOffset = ReadBigEndian(t + 24, 8);

  auto validSize = [](uint8_t n) { return n == 1 || n == 2 || n == 4 || n == 8; };
  if (!validSize(trailer_.offsetIntSize)) return Invalid(Format("bad offset size %d", trailer_.offsetIntSize));
  if (!validSize(trailer_.objectRefSize)) return Invalid(Format("bad reference size %d", trailer_.objectRefSize));
  if (trailer_.numObjects == 0) return Invalid("no objects");
  if (trailer_.topObject >= trailer_.numObjects) return Invalid("top object out of range");
  const uint64_t tableEnd = size - kTrailerSize;
  const uint64_t tableOffset = trailer_.offsetTableOffset;
  if (tableOffset <= kMagicSize || tableOffset > tableEnd ||
      trailer_.numObjects > (tableEnd - tableOffset) / trailer_.offsetIntSize) {
    return Invalid("offset table outside the file");
  }
  return Status::Ok();
}

// Reads the offset of object index and its marker and count; fails unless the
// whole object lies between the magic and the offset table.
Result<ObjectHeader> BinaryPlistReader::header(uint64_t index) const {
  ObjectHeader h;
  h.index = index;
  const uint64_t end = trailer_.offsetTableOffset;
  h.offset = ReadBigEndian(&bytes_[end + index * trailer_.offsetIntSize], trailer_.offsetIntSize);
  if (h.offset < kMagicSize || h.offset >= end) return objectError(index, "offset outside the object area");
  h.marker = bytes_[h.offset];
  h.content = h.offset + 1;
  const uint8_t low = h.marker & 0x0F;

  // Fixed-size objects.
  uint64_t fixedSize = 0;
  switch (h.type()) {
    case 0x0:
      if (h.marker != kNull && h.marker != kFalse && h.marker != kTrue) return objectError(h, "unknown marker");
      break;
    case kIntType:
      if (low > 4) return objectError(h, "bad integer size");
      fixedSize = uint64_t{1} << low;
      break;
    case kRealType:
      if (low != 2 && low != 3) return objectError(h, "bad real size");
      fixedSize = uint64_t{1} << low;
      break;
    case kDateMarker >> 4:
      if (h.marker != kDateMarker) return objectError(h, "bad date size");
      fixedSize = 8;
      break;
    case kDataType:
    case kAsciiType:
    case kUtf16Type:
    case kArrayType:
    case kDictType:
      break;
    case kUidType:
      return objectError(h, "UID objects are not supported");
    default:
      return objectError(h, "unknown marker");
  }
  if (h.type() <= 0x3) {
    if (fixedSize > end - h.content) return objectError(h, "object runs past the object area");
    return h;
  }

  // Objects with a count, possibly held in a following integer object.
  h.count = low;
  if (low == kExtendedCount) {
    if (h.content >= end) return objectError(h, "count runs past the object area");
    const uint8_t intMarker = bytes_[h.content];
    if ((intMarker >> 4) != kIntType || (intMarker & 0x0F) > 3) return objectError(h, "bad extended count");
    const uint64_t intSize = uint64_t{1} << (intMarker & 0x0F);
    if (intSize > end - h.content - 1) return objectError(h, "count runs past the object area");
    h.count = ReadBigEndian(&bytes_[h.content + 1], intSize);
    h.content += 1 + intSize;
  }
  uint64_t unit = 1;
  if (h.type() == kUtf16Type) unit = 2;
  if (h.type() == kArrayType) unit = trailer_.objectRefSize;
  if (h.type() == kDictType) unit = 2 * uint64_t{trailer_.objectRefSize};
  if (h.count > (end - h.content) / unit) {
    return objectError(h, Format("count %llu runs past the object area", static_cast<unsigned long long>(h.count)));
  }
  return h;
}

// Checks every object's header and every reference, and counts references.
Status BinaryPlistReader::checkObjects() {
  const uint64_t n = trailer_.numObjects;
  state_.assign(n, 0);
  auto count = [this](uint64_t index) {
    if ((state_[index] & kReferenceCountMask) < 2) ++state_[index];
  };
  count(trailer_.topObject);
  for (uint64_t i = 0; i < n; ++i) {
    Result<ObjectHeader> h = header(i);
    if (!h.ok()) return h.error();
    if (!h->isContainer()) continue;
    const uint64_t refs = h->type() == kDictType ? 2 * h->count : h->count;
    for (uint64_t slot = 0; slot < refs; ++slot) {
      const uint64_t ref = reference(*h, slot);
      if (ref >= n) {
        return objectError(*h, Format("reference %llu out of range", static_cast<unsigned long long>(ref)));
      }
      count(ref);
    }
  }
  return Status::Ok();
}

Status BinaryPlistReader::charge(uint64_t nodes, uint64_t bytes, uint64_t index) {
  nodes_ = SaturatingAdd(nodes_, nodes);
  expandedBytes_ = SaturatingAdd(expandedBytes_, bytes);
  if (nodes_ > maxNodes_) {
    return objectError(index,
                       Format("expanded result exceeds %llu objects", static_cast<unsigned long long>(maxNodes_)));
  }
  if (expandedBytes_ > maxBytes_) {
    return objectError(index, Format("expanded result exceeds %llu bytes", static_cast<unsigned long long>(maxBytes_)));
  }
  return Status::Ok();
}

Result<Value> BinaryPlistReader::decodeScalar(const ObjectHeader& h) const {
  const uint8_t* p = &bytes_[h.content];
  const uint8_t low = h.marker & 0x0F;
  switch (h.type()) {
    case 0x0:
      if (h.marker == kNull) return Value();
      return Value::Boolean(h.marker == kTrue);
    case kIntType: {
      // 1, 2 and 4 bytes are unsigned, 8 bytes two's complement.
      if (low <= 2) return Value::Integer(static_cast<int64_t>(ReadBigEndian(p, size_t{1} << low)));
      if (low == 3) return Value::Integer(static_cast<int64_t>(ReadBigEndian(p, 8)));
      // 16 bytes: an unsigned 64-bit value, or a sign-extended negative one.
      const uint64_t high = ReadBigEndian(p, 8);
      const uint64_t value = ReadBigEndian(p + 8, 8);
      if (high == 0) return Value::Unsigned(value);
      if (high == UINT64_MAX && static_cast<int64_t>(value) < 0) return Value::Integer(static_cast<int64_t>(value));
      return objectError(h, "integer does not fit in 64 bits");
    }
    case kRealType:
      if (low == 2) {
        float f;
        const uint32_t bits = static_cast<uint32_t>(ReadBigEndian(p, 4));
        std::memcpy(&f, &bits, sizeof f);
        return Value::Real(f);
      } else {
        double d;
        const uint64_t bits = ReadBigEndian(p, 8);
        std::memcpy(&d, &bits, sizeof d);
        return Value::Real(d);
      }
    case kDateMarker >> 4: {
      double d;
      const uint64_t bits = ReadBigEndian(p, 8);
      std::memcpy(&d, &bits, sizeof d);
      return Value::DateValue(Date{d});
    }
    case kDataType:
      return Value::Data(p, h.count);
    case kAsciiType:
    case kUtf16Type: {
      Result<std::string> text = decodeText(h);
      if (!text.ok()) return text.error();
      return Value::String(std::move(*text));
    }
    default:
      return objectError(h, "unexpected object type");
  }
}

Result<std::string> BinaryPlistReader::decodeText(const ObjectHeader& h) const {
  std::string scratch;
  Result<std::string_view> text = textView(h, &scratch);
  if (!text.ok()) return text.error();
  if (text->data() == scratch.data()) return scratch;
  return std::string(*text);
}

Result<std::string> BinaryPlistReader::keyText(uint64_t index) const {
  Result<ObjectHeader> h = header(index);
  if (!h.ok()) return h.error();
  return decodeText(*h);
}

// Decodes object index where it is referenced: its value when it is a scalar
// or a shared object already decoded, or nothing after pushing a frame for a
// container, whose value comes when the frame finishes.
Result<std::optional<Value>> BinaryPlistReader::reach(uint64_t index) {
  uint8_t& state = state_[index];
  if (state & kOnPath) return objectError(index, "contains itself");
  if ((state & kReferenceCountMask) > 1) {
    if (auto it = memo_.find(index); it != memo_.end()) {
      if (Status s = charge(it->second.nodes, it->second.bytes, index); !s.ok()) return s.error();
      return std::optional<Value>(it->second.value);
    }
  }
  Result<ObjectHeader> h = header(index);
  if (!h.ok()) return h.error();
  if (h->isContainer()) {
    if (stack_.size() >= limits_.maxDepth) {
      return objectError(*h, Format("nested deeper than %u levels", limits_.maxDepth));
    }
    Frame& frame = stack_.emplace_back();
    frame.header = *h;
    frame.nodesBefore = nodes_;
    frame.bytesBefore = expandedBytes_;
    const size_t reserve = std::min(h->count, kMaxReserve);
    if (h->type() == kDictType) {
      frame.entries.reserve(reserve);
    } else {
      frame.items.reserve(reserve);
    }
    state |= kOnPath;
    if (Status s = charge(1, 0, index); !s.ok()) return s.error();
    return std::optional<Value>();
  }
  Result<Value> v = decodeScalar(*h);
  if (!v.ok()) return v.error();
  const uint64_t bytes = v->string() ? v->string()->size() : v->data() ? v->data()->size() : 0;
  if (Status s = charge(1, bytes, index); !s.ok()) return s.error();
  if ((state & kReferenceCountMask) > 1) memo_[index] = Memo{*v, 1, bytes};
  return std::optional<Value>(std::move(v.value()));
}

Result<std::string> BinaryPlistReader::decodeKey(uint64_t index) {
  // Keys are decoded where they stand, never remembered: a Value shared by
  // every record would be copied (and counted) once per record.
  Result<ObjectHeader> h = header(index);
  if (!h.ok()) return h.error();
  if (h->type() != kAsciiType && h->type() != kUtf16Type) return objectError(index, "dictionary key is not a string");
  Result<std::string> text = decodeText(*h);
  if (!text.ok()) return text.error();
  if (Status s = charge(1, text->size(), index); !s.ok()) return s.error();
  return text;
}

// The value of a container whose elements are all decoded; remembers it when
// it is shared.
Result<Value> BinaryPlistReader::finish(Frame& frame) {
  const uint64_t index = frame.header.index;
  Value value;
  if (frame.header.type() == kDictType) {
    std::optional<Value> dict = frame.entries.buildUnique();
    if (!dict) return objectError(frame.header, "duplicate dictionary key");
    value = std::move(*dict);
  } else {
    value = Value::ArrayOf(std::move(frame.items));
  }
  state_[index] &= ~kOnPath;
  if ((state_[index] & kReferenceCountMask) > 1) {
    memo_[index] = Memo{value, nodes_ - frame.nodesBefore, expandedBytes_ - frame.bytesBefore};
    containersRemembered_.push_back(index);
  }
  return value;
}

Result<Value> BinaryPlistReader::decode(uint64_t index) {
  nodes_ = 0;
  expandedBytes_ = 0;
  Result<Value> value = decodeFromTop(index);
  // A failed decode leaves its open containers marked; the next call starts
  // clean. Shared containers are remembered for one call only; shared
  // scalars (the keys and common numbers of every record) for the next
  // calls too, up to a bound.
  for (const Frame& frame : stack_) state_[frame.header.index] &= ~kOnPath;
  stack_.clear();
  for (uint64_t container : containersRemembered_) memo_.erase(container);
  containersRemembered_.clear();
  if (memo_.size() > kMaxScalarsRemembered) memo_.clear();
  return value;
}

Result<Value> BinaryPlistReader::decodeFromTop(uint64_t index) {
  Result<std::optional<Value>> top = reach(index);
  if (!top.ok()) return top.error();
  if (*top) return std::move(**top);
  while (true) {
    Frame* frame = &stack_.back();
    std::optional<Value> child;
    if (frame->next == frame->header.count) {
      Result<Value> done = finish(*frame);
      if (!done.ok()) return done.error();
      stack_.pop_back();
      if (stack_.empty()) return done;
      frame = &stack_.back();
      child = std::move(done.value());
    } else {
      uint64_t slot = frame->next++;
      if (frame->header.type() == kDictType) {
        Result<std::string> key = decodeKey(reference(frame->header, slot));
        if (!key.ok()) return key.error();
        frame->key = std::move(key.value());
        slot += frame->header.count;  // values follow all the keys
      }
      Result<std::optional<Value>> reached = reach(reference(frame->header, slot));
      if (!reached.ok()) return reached.error();
      if (!*reached) continue;  // a container: its frame is on top now
      child = std::move(**reached);
    }
    if (frame->header.type() == kDictType) {
      frame->entries.add(std::move(frame->key), std::move(*child));
    } else {
      frame->items.push_back(std::move(*child));
    }
  }
}

Result<std::string_view> BinaryPlistReader::textView(const ObjectHeader& h, std::string* scratch) const {
  const uint8_t* p = &bytes_[h.content];
  if (h.type() == kAsciiType) {
    for (uint64_t i = 0; i < h.count; ++i) {
      if (p[i] >= 0x80) return objectError(h, "non-ASCII byte in an ASCII string");
    }
    return std::string_view(reinterpret_cast<const char*>(p), h.count);
  }
  if (h.type() != kUtf16Type) return objectError(h, "dictionary key is not a string");
  scratch->clear();
  if (!AppendUtf8FromUtf16BigEndian({p, 2 * h.count}, scratch)) return objectError(h, "invalid UTF-16 string");
  return std::string_view(*scratch);
}

Status BinaryPlistReader::checkUniqueKeys(const ObjectHeader& dict, std::vector<std::pair<size_t, uint64_t>>& keys) const {
  // Keys are told apart by a hash of their text; only keys whose hashes meet
  // are compared whole. ASCII keys, nearly all of them, are hashed in place.
  keys.clear();
  std::string scratch;
  for (uint64_t slot = 0; slot < dict.count; ++slot) {
    const uint64_t index = reference(dict, slot);
    Result<ObjectHeader> h = header(index);
    if (!h.ok()) return h.error();
    Result<std::string_view> text = textView(*h, &scratch);
    if (!text.ok()) return text.error();
    keys.emplace_back(std::hash<std::string_view>{}(*text), index);
  }
  std::sort(keys.begin(), keys.end());
  for (size_t i = 1; i < keys.size(); ++i) {
    if (keys[i].first != keys[i - 1].first) continue;
    if (keys[i].second == keys[i - 1].second || *keyText(keys[i].second) == *keyText(keys[i - 1].second)) {
      return objectError(dict, "duplicate dictionary key");
    }
  }
  return Status::Ok();
}

Status BinaryPlistReader::validate() {
  struct Visit {
    ObjectHeader header;
    uint64_t next = 0;
  };
  std::vector<Visit> path;
  std::vector<std::pair<size_t, uint64_t>> keys;  // scratch of checkUniqueKeys
  std::string text;                                // scratch of textView
  // Checks a scalar at once; puts a container on the path.
  auto enter = [&](uint64_t index) -> Status {
    uint8_t& state = state_[index];
    if (state & kOnPath) return objectError(index, "contains itself");
    if (state & kValidated) return Status::Ok();
    Result<ObjectHeader> h = header(index);
    if (!h.ok()) return h.error();
    if (!h->isContainer()) {
      // Data is whole once its header is; text is checked in place;
      // everything else must decode.
      if (h->type() == kAsciiType || h->type() == kUtf16Type) {
        if (Result<std::string_view> checked = textView(*h, &text); !checked.ok()) return checked.error();
      } else if (h->type() != kDataType) {
        if (Result<Value> value = decodeScalar(*h); !value.ok()) return value.error();
      }
      state |= kValidated;
      return Status::Ok();
    }
    if (path.size() >= limits_.maxDepth) {
      return objectError(*h, Format("nested deeper than %u levels", limits_.maxDepth));
    }
    if (h->type() == kDictType) {
      if (Status unique = checkUniqueKeys(*h, keys); !unique.ok()) return unique;
    }
    state |= kOnPath;
    path.push_back(Visit{*h});
    return Status::Ok();
  };
  Status status = enter(trailer_.topObject);
  while (status.ok() && !path.empty()) {
    Visit& visit = path.back();
    const uint64_t slot = visit.next++;
    if (slot == visit.header.count) {
      state_[visit.header.index] = (state_[visit.header.index] & ~kOnPath) | kValidated;
      path.pop_back();
      continue;
    }
    const bool dict = visit.header.type() == kDictType;
    status = enter(reference(visit.header, dict ? slot + visit.header.count : slot));
  }
  for (const Visit& visit : path) state_[visit.header.index] &= ~kOnPath;
  return status;
}

}  // namespace vtr::bplist

namespace vtr {

Result<Value> ReadBinaryPropertyList(std::span<const uint8_t> bytes, const PlistLimits& limits) {
  bplist::BinaryPlistReader reader(bytes, limits);
  if (Status s = reader.open(); !s.ok()) return s.error();
  return reader.decode(reader.top());
}

}  // namespace vtr
