#include "xpc/xpc_object.h"

#include <algorithm>
#include <cstring>

namespace vtr {

XpcObject XpcObject::Bool(bool value) { return XpcObject(Storage(std::in_place_index<1>, value)); }
XpcObject XpcObject::Int64(int64_t value) { return XpcObject(Storage(std::in_place_index<2>, value)); }
XpcObject XpcObject::Uint64(uint64_t value) { return XpcObject(Storage(std::in_place_index<3>, Uint64Box{value})); }
XpcObject XpcObject::Double(double value) { return XpcObject(Storage(std::in_place_index<4>, value)); }
XpcObject XpcObject::Date(int64_t nanosecondsSince1970) {
  return XpcObject(Storage(std::in_place_index<5>, DateBox{nanosecondsSince1970}));
}
XpcObject XpcObject::Data(XpcBytes bytes) {
  return XpcObject(Storage(std::in_place_index<6>, std::make_shared<const XpcBytes>(std::move(bytes))));
}
XpcObject XpcObject::String(std::string bytes) {
  return XpcObject(Storage(std::in_place_index<7>, std::make_shared<const std::string>(std::move(bytes))));
}
XpcObject XpcObject::Uuid(const XpcUuid& uuid) { return XpcObject(Storage(std::in_place_index<8>, uuid)); }
XpcObject XpcObject::Array(XpcArray items) {
  return XpcObject(Storage(std::in_place_index<9>, std::make_shared<const XpcArray>(std::move(items))));
}
XpcObject XpcObject::Dictionary(XpcDictionary dictionary) {
  return XpcObject(Storage(std::in_place_index<10>, std::make_shared<const XpcDictionary>(std::move(dictionary))));
}
XpcObject XpcObject::Dictionary(std::initializer_list<std::pair<std::string, XpcObject>> entries) {
  return Dictionary(XpcDictionary(entries));
}

std::optional<bool> XpcObject::boolValue() const {
  if (type() != Type::kBool) return std::nullopt;
  return std::get<1>(storage_);
}
std::optional<int64_t> XpcObject::int64Value() const {
  if (type() != Type::kInt64) return std::nullopt;
  return std::get<2>(storage_);
}
std::optional<uint64_t> XpcObject::uint64Value() const {
  if (type() != Type::kUint64) return std::nullopt;
  return std::get<3>(storage_).value;
}
std::optional<double> XpcObject::doubleValue() const {
  if (type() != Type::kDouble) return std::nullopt;
  return std::get<4>(storage_);
}
std::optional<int64_t> XpcObject::dateValue() const {
  if (type() != Type::kDate) return std::nullopt;
  return std::get<5>(storage_).nanoseconds;
}
const XpcBytes* XpcObject::data() const {
  return type() == Type::kData ? std::get<6>(storage_).get() : nullptr;
}
const std::string* XpcObject::string() const {
  return type() == Type::kString ? std::get<7>(storage_).get() : nullptr;
}
std::optional<XpcUuid> XpcObject::uuidValue() const {
  if (type() != Type::kUuid) return std::nullopt;
  return std::get<8>(storage_);
}
const XpcArray* XpcObject::array() const {
  return type() == Type::kArray ? std::get<9>(storage_).get() : nullptr;
}
const XpcDictionary* XpcObject::dictionary() const {
  return type() == Type::kDictionary ? std::get<10>(storage_).get() : nullptr;
}

const XpcObject* XpcObject::find(std::string_view key) const {
  const XpcDictionary* dict = dictionary();
  return dict ? dict->find(key) : nullptr;
}

bool operator==(const XpcObject& a, const XpcObject& b) {
  if (a.type() != b.type()) return false;
  switch (a.type()) {
    case XpcObject::Type::kNull:
      return true;
    case XpcObject::Type::kBool:
      return a.boolValue() == b.boolValue();
    case XpcObject::Type::kInt64:
      return a.int64Value() == b.int64Value();
    case XpcObject::Type::kUint64:
      return a.uint64Value() == b.uint64Value();
    case XpcObject::Type::kDouble: {
      double x = *a.doubleValue(), y = *b.doubleValue();
      return std::memcmp(&x, &y, sizeof x) == 0;
    }
    case XpcObject::Type::kDate:
      return a.dateValue() == b.dateValue();
    case XpcObject::Type::kData:
      return *a.data() == *b.data();
    case XpcObject::Type::kString:
      return *a.string() == *b.string();
    case XpcObject::Type::kUuid:
      return a.uuidValue() == b.uuidValue();
    case XpcObject::Type::kArray:
      return *a.array() == *b.array();
    case XpcObject::Type::kDictionary:
      return *a.dictionary() == *b.dictionary();
  }
  return false;
}

XpcDictionary::XpcDictionary(std::initializer_list<Entry> entries) {
  for (const Entry& entry : entries) set(entry.first, entry.second);
}

std::optional<XpcDictionary> XpcDictionary::FromUniqueEntries(std::vector<Entry> entries) {
  std::vector<std::string_view> keys;
  keys.reserve(entries.size());
  for (const Entry& entry : entries) keys.push_back(entry.first);
  std::sort(keys.begin(), keys.end());
  if (std::adjacent_find(keys.begin(), keys.end()) != keys.end()) return std::nullopt;
  XpcDictionary dict;
  dict.entries_ = std::move(entries);
  return dict;
}

void XpcDictionary::set(std::string key, XpcObject value) {
  for (Entry& entry : entries_) {
    if (entry.first == key) {
      entry.second = std::move(value);
      return;
    }
  }
  entries_.emplace_back(std::move(key), std::move(value));
}

const XpcObject* XpcDictionary::find(std::string_view key) const {
  for (const Entry& entry : entries_) {
    if (entry.first == key) return &entry.second;
  }
  return nullptr;
}

bool operator==(const XpcDictionary& a, const XpcDictionary& b) { return a.entries_ == b.entries_; }

const char* XpcTypeName(XpcObject::Type type) {
  switch (type) {
    case XpcObject::Type::kNull: return "null";
    case XpcObject::Type::kBool: return "bool";
    case XpcObject::Type::kInt64: return "int64";
    case XpcObject::Type::kUint64: return "uint64";
    case XpcObject::Type::kDouble: return "double";
    case XpcObject::Type::kDate: return "date";
    case XpcObject::Type::kData: return "data";
    case XpcObject::Type::kString: return "string";
    case XpcObject::Type::kUuid: return "uuid";
    case XpcObject::Type::kArray: return "array";
    case XpcObject::Type::kDictionary: return "dictionary";
  }
  return "unknown";
}

}  // namespace vtr
