#include "platform/plist_document.h"

#include <cstring>

#include "platform/plist_binary_reader.h"

namespace vtr {

using bplist::BinaryPlistReader;
using bplist::ObjectHeader;

Result<std::unique_ptr<PlistDocument>> PlistDocument::Open(std::span<const uint8_t> bytes,
                                                           const PlistLimits& limits) {
  const bool binary = bytes.size() >= bplist::kMagicSize &&
                      std::memcmp(bytes.data(), bplist::kMagic.data(), bplist::kMagicSize) == 0;
  if (!binary) {
    Result<Value> value = ReadXmlPropertyList(bytes, limits);
    if (!value.ok()) return value.error();
    return std::unique_ptr<PlistDocument>(new PlistDocument(nullptr, std::move(*value)));
  }
  auto reader = std::make_unique<BinaryPlistReader>(bytes, limits);
  if (Status s = reader->open(); !s.ok()) return s.error();
  if (Status s = reader->validate(); !s.ok()) return s.error();
  return std::unique_ptr<PlistDocument>(new PlistDocument(std::move(reader), Value()));
}

PlistDocument::PlistDocument(std::unique_ptr<BinaryPlistReader> binary, Value xml)
    : binary_(std::move(binary)), xml_(std::move(xml)) {}

PlistDocument::~PlistDocument() = default;

PlistNode PlistDocument::top() const { return binary_ ? PlistNode(binary_.get(), binary_->top()) : PlistNode(xml_); }

PlistNode::PlistNode(BinaryPlistReader* reader, uint64_t index) {
  // The document was validated whole when it was opened: headers read and
  // scalars decode.
  const ObjectHeader h = *reader->header(index);
  switch (h.type()) {
    case bplist::kDictType:
      type_ = Value::Type::kDictionary;
      break;
    case bplist::kArrayType:
      type_ = Value::Type::kArray;
      break;
    case bplist::kDataType:
      type_ = Value::Type::kData;
      break;
    default: {
      // A scalar: decoded now and held. Only the expansion bound can refuse
      // it, and then the node reads as nil.
      Result<Value> scalar = reader->decode(index);
      if (scalar.ok()) value_ = std::move(*scalar);
      return;
    }
  }
  reader_ = reader;
  index_ = index;
}

uint64_t PlistNode::count() const {
  if (reader_ != nullptr) return type_ == Value::Type::kData ? 0 : reader_->header(index_)->count;
  if (const Array* array = value_.array()) return array->size();
  if (const Dictionary* dictionary = value_.dictionary()) return dictionary->size();
  return 0;
}

std::string PlistNode::keyAt(uint64_t i) const {
  if (reader_ == nullptr) return (value_.dictionary()->begin() + static_cast<ptrdiff_t>(i))->first;
  return *reader_->keyText(reader_->reference(*reader_->header(index_), i));
}

PlistNode PlistNode::valueAt(uint64_t i) const {
  if (reader_ == nullptr) return PlistNode((value_.dictionary()->begin() + static_cast<ptrdiff_t>(i))->second);
  const ObjectHeader h = *reader_->header(index_);
  return PlistNode(reader_, reader_->reference(h, i + h.count));
}

PlistNode PlistNode::get(std::string_view key) const {
  if (!isDictionary()) return PlistNode();
  if (reader_ == nullptr) return PlistNode(value_.get(key));
  const uint64_t n = count();
  for (uint64_t i = 0; i < n; ++i) {
    if (keyAt(i) == key) return valueAt(i);
  }
  return PlistNode();
}

void PlistNode::forEachEntry(const std::function<bool(const std::string&, const PlistNode&)>& visit) const {
  if (!isDictionary()) return;
  const uint64_t n = count();
  for (uint64_t i = 0; i < n; ++i) {
    if (!visit(keyAt(i), valueAt(i))) return;
  }
}

Result<Value> PlistNode::value() const { return reader_ != nullptr ? reader_->decode(index_) : value_; }

std::optional<std::span<const uint8_t>> PlistNode::data() const {
  if (reader_ != nullptr) {
    if (type_ != Value::Type::kData) return std::nullopt;
    return reader_->dataBytes(*reader_->header(index_));
  }
  const Bytes* bytes = value_.data();
  if (bytes == nullptr) return std::nullopt;
  return std::span<const uint8_t>(*bytes);
}

}  // namespace vtr
