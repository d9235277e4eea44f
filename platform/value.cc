#include "platform/value.h"

#include <algorithm>
#include <cctype>
#include <cmath>
#include <cstdint>

namespace vtr {
namespace {

bool KeyLess(const Dictionary::Entry& a, const Dictionary::Entry& b) { return a.first < b.first; }

// An integer (signed or unsigned) equals a real only when the real is that
// exact whole number.
bool IntegerEqualsReal(const Value& n, double d) {
  if (std::trunc(d) != d) return false;
  if (auto i = n.integer()) {
    return d >= -9223372036854775808.0 && d < 9223372036854775808.0 && static_cast<int64_t>(d) == *i;
  }
  if (auto u = n.unsignedInteger()) return d >= 0 && d < 18446744073709551616.0 && static_cast<uint64_t>(d) == *u;
  return false;
}

// Numbers compare by value whatever their representation.
bool NumbersEqual(const Value& a, const Value& b) {
  using T = Value::Type;
  if (a.type() == T::kReal && b.type() == T::kReal) return *a.real() == *b.real();
  if (a.type() == T::kReal) return IntegerEqualsReal(b, *a.real());
  if (b.type() == T::kReal) return IntegerEqualsReal(a, *b.real());
  if (auto x = a.integer(), y = b.integer(); x && y) return *x == *y;
  if (auto x = a.unsignedInteger(), y = b.unsignedInteger(); x && y) return *x == *y;
  return false;
}

}  // namespace

Dictionary::Dictionary(std::vector<Entry> entries) : entries_(std::move(entries)) {
  // Entries mostly arrive sorted and unique (copied from another dictionary,
  // read from a file written sorted): nothing to do then.
  const auto outOfOrder = [](const Entry& a, const Entry& b) { return !(a.first < b.first); };
  if (std::adjacent_find(entries_.begin(), entries_.end(), outOfOrder) == entries_.end()) return;
  std::stable_sort(entries_.begin(), entries_.end(), KeyLess);
  // Keep the last of each run of equal keys.
  std::vector<Entry> unique;
  unique.reserve(entries_.size());
  for (auto& e : entries_) {
    if (!unique.empty() && unique.back().first == e.first) {
      unique.back().second = std::move(e.second);
    } else {
      unique.push_back(std::move(e));
    }
  }
  entries_ = std::move(unique);
}

const Value* Dictionary::find(std::string_view key) const {
  auto it = std::lower_bound(entries_.begin(), entries_.end(), key,
                             [](const Entry& e, std::string_view k) { return e.first < k; });
  if (it == entries_.end() || it->first != key) return nullptr;
  return &it->second;
}

bool operator==(const Dictionary& a, const Dictionary& b) { return a.entries_ == b.entries_; }

void DictionaryBuilder::add(std::string key, Value value) { entries_.emplace_back(std::move(key), std::move(value)); }

Value DictionaryBuilder::build() { return Value::DictionaryOf(Dictionary(std::move(entries_))); }

std::optional<Value> DictionaryBuilder::buildUnique() {
  // Files written by careful writers hold their keys sorted already.
  if (!std::is_sorted(entries_.begin(), entries_.end(), KeyLess)) {
    std::stable_sort(entries_.begin(), entries_.end(), KeyLess);
  }
  for (size_t i = 1; i < entries_.size(); ++i) {
    if (entries_[i - 1].first == entries_[i].first) return std::nullopt;
  }
  Dictionary dict;
  dict.entries_ = std::move(entries_);
  return Value::DictionaryOf(std::move(dict));
}

Value Value::Boolean(bool b) { return Value(Storage(std::in_place_index<1>, b)); }
Value Value::Integer(int64_t i) { return Value(Storage(std::in_place_index<2>, i)); }
Value Value::Unsigned(uint64_t u) { return Value(Storage(std::in_place_index<3>, UnsignedBox{u})); }
Value Value::Real(double d) { return Value(Storage(std::in_place_index<4>, d)); }
Value Value::String(std::string s) {
  return Value(Storage(std::in_place_index<5>, std::make_shared<const std::string>(std::move(s))));
}
Value Value::Data(Bytes bytes) {
  return Value(Storage(std::in_place_index<6>, std::make_shared<const Bytes>(std::move(bytes))));
}
Value Value::Data(const void* bytes, size_t length) {
  const auto* p = static_cast<const uint8_t*>(bytes);
  return Data(Bytes(p, p + length));
}
Value Value::DateValue(Date date) { return Value(Storage(std::in_place_index<7>, date)); }
Value Value::ArrayOf(Array items) {
  return Value(Storage(std::in_place_index<8>, std::make_shared<const Array>(std::move(items))));
}
Value Value::DictionaryOf(Dictionary dict) {
  return Value(Storage(std::in_place_index<9>, std::make_shared<const Dictionary>(std::move(dict))));
}
Value Value::DictionaryOf(std::initializer_list<std::pair<std::string, Value>> entries) {
  return DictionaryOf(Dictionary(std::vector<Dictionary::Entry>(entries)));
}

bool Value::isNumber() const {
  const Type t = type();
  return t == Type::kInteger || t == Type::kUnsigned || t == Type::kReal;
}

std::optional<bool> Value::boolean() const {
  if (auto* b = std::get_if<bool>(&storage_)) return *b;
  return std::nullopt;
}

std::optional<int64_t> Value::integer() const {
  if (auto* i = std::get_if<int64_t>(&storage_)) return *i;
  if (auto* u = std::get_if<UnsignedBox>(&storage_); u && u->value <= static_cast<uint64_t>(INT64_MAX)) {
    return static_cast<int64_t>(u->value);
  }
  return std::nullopt;
}

std::optional<uint64_t> Value::unsignedInteger() const {
  if (auto* u = std::get_if<UnsignedBox>(&storage_)) return u->value;
  if (auto* i = std::get_if<int64_t>(&storage_); i && *i >= 0) return static_cast<uint64_t>(*i);
  return std::nullopt;
}

std::optional<double> Value::real() const {
  if (auto* d = std::get_if<double>(&storage_)) return *d;
  if (auto* i = std::get_if<int64_t>(&storage_)) return static_cast<double>(*i);
  if (auto* u = std::get_if<UnsignedBox>(&storage_)) return static_cast<double>(u->value);
  return std::nullopt;
}

std::optional<Date> Value::date() const {
  if (auto* d = std::get_if<Date>(&storage_)) return *d;
  return std::nullopt;
}

const std::string* Value::string() const {
  auto* p = std::get_if<std::shared_ptr<const std::string>>(&storage_);
  return p ? p->get() : nullptr;
}

const Bytes* Value::data() const {
  auto* p = std::get_if<std::shared_ptr<const Bytes>>(&storage_);
  return p ? p->get() : nullptr;
}

const Array* Value::array() const {
  auto* p = std::get_if<std::shared_ptr<const Array>>(&storage_);
  return p ? p->get() : nullptr;
}

const Dictionary* Value::dictionary() const {
  auto* p = std::get_if<std::shared_ptr<const Dictionary>>(&storage_);
  return p ? p->get() : nullptr;
}

Value Value::get(std::string_view key) const {
  const Dictionary* dict = dictionary();
  if (!dict) return Value();
  const Value* v = dict->find(key);
  return v ? *v : Value();
}

bool Value::boolValue() const {
  if (auto b = boolean()) return *b;
  if (auto d = real()) return *d != 0;
  if (const std::string* text = string()) {
    // A string's boolean value as the platform reads it: leading white space
    // skipped, then an optional sign and zeros; YES when Y, y, T, t or a
    // digit 1-9 follows, whatever comes after it.
    size_t i = 0;
    while (i < text->size() && std::isspace(static_cast<unsigned char>((*text)[i]))) ++i;
    if (i < text->size() && ((*text)[i] == '+' || (*text)[i] == '-')) ++i;
    while (i < text->size() && (*text)[i] == '0') ++i;
    if (i == text->size()) return false;
    const char c = (*text)[i];
    return c == 'Y' || c == 'y' || c == 'T' || c == 't' || (c >= '1' && c <= '9');
  }
  return false;
}

int32_t Value::intValue() const {
  constexpr int64_t kMin = INT32_MIN, kMax = INT32_MAX;
  if (auto b = boolean()) return *b ? 1 : 0;
  if (auto i = integer()) return static_cast<int32_t>(*i);
  if (auto u = unsignedInteger()) return static_cast<int32_t>(*u);
  if (auto d = real()) {
    if (std::isnan(*d)) return 0;
    return static_cast<int32_t>(std::clamp<double>(std::trunc(*d), kMin, kMax));
  }
  if (const std::string* text = string()) {
    size_t i = 0;
    while (i < text->size() && std::isspace(static_cast<unsigned char>((*text)[i]))) ++i;
    const bool negative = i < text->size() && (*text)[i] == '-';
    if (i < text->size() && ((*text)[i] == '+' || (*text)[i] == '-')) ++i;
    int64_t magnitude = 0;
    for (; i < text->size() && (*text)[i] >= '0' && (*text)[i] <= '9'; ++i) {
      magnitude = std::min<int64_t>(magnitude * 10 + ((*text)[i] - '0'), kMax + 1);
    }
    return static_cast<int32_t>(std::clamp<int64_t>(negative ? -magnitude : magnitude, kMin, kMax));
  }
  return 0;
}

bool operator==(const Value& a, const Value& b) {
  if (a.isNumber() && b.isNumber()) return NumbersEqual(a, b);
  if (a.type() != b.type()) return false;
  switch (a.type()) {
    case Value::Type::kNil:
      return true;
    case Value::Type::kBoolean:
      return *a.boolean() == *b.boolean();
    case Value::Type::kString:
      return *a.string() == *b.string();
    case Value::Type::kData:
      return *a.data() == *b.data();
    case Value::Type::kDate:
      return *a.date() == *b.date();
    case Value::Type::kArray:
      return a.array() == b.array() || *a.array() == *b.array();
    case Value::Type::kDictionary:
      return a.dictionary() == b.dictionary() || *a.dictionary() == *b.dictionary();
    default:
      return false;  // numbers are handled above
  }
}

const char* TypeName(Value::Type type) {
  switch (type) {
    case Value::Type::kNil: return "nil";
    case Value::Type::kBoolean: return "boolean";
    case Value::Type::kInteger: return "integer";
    case Value::Type::kUnsigned: return "unsigned integer";
    case Value::Type::kReal: return "real";
    case Value::Type::kString: return "string";
    case Value::Type::kData: return "data";
    case Value::Type::kDate: return "date";
    case Value::Type::kArray: return "array";
    case Value::Type::kDictionary: return "dictionary";
  }
  return "unknown";
}

}  // namespace vtr
