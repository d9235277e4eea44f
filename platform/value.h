// Value: the object graph that requests, metadata records and manifests are
// made of. A Value is nil, a boolean, a signed or an unsigned 64-bit integer,
// a real, a string (UTF-8), data, a date, an array or a dictionary with string
// keys. Values are immutable; copies share their storage, so passing one
// around costs a reference count. A Value may be read from several threads at
// once.
#ifndef VTR_PLATFORM_VALUE_H_
#define VTR_PLATFORM_VALUE_H_

#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "platform/date.h"

namespace vtr {

using Bytes = std::vector<uint8_t>;

class Value;
using Array = std::vector<Value>;

class Dictionary;

class Value {
 public:
  enum class Type : uint8_t { kNil, kBoolean, kInteger, kUnsigned, kReal, kString, kData, kDate, kArray, kDictionary };

  Value() = default;  // nil

  static Value Boolean(bool b);
  static Value Integer(int64_t i);
  static Value Unsigned(uint64_t u);
  static Value Real(double d);
  static Value String(std::string s);
  static Value Data(Bytes bytes);
  static Value Data(const void* bytes, size_t length);
  static Value DateValue(Date date);
  static Value ArrayOf(Array items);
  static Value DictionaryOf(Dictionary dict);
  // {key: value, ...} from a list; the last of duplicate keys wins.
  static Value DictionaryOf(std::initializer_list<std::pair<std::string, Value>> entries);

  Type type() const { return static_cast<Type>(storage_.index()); }
  bool isNil() const { return type() == Type::kNil; }
  // Integer, unsigned or real (a boolean is not a number here).
  bool isNumber() const;

  // Typed access: the value when it has that type, else empty/null.
  std::optional<bool> boolean() const;
  // A signed integer, or an unsigned one that fits in int64.
  std::optional<int64_t> integer() const;
  // An unsigned integer, or a signed one that is not negative.
  std::optional<uint64_t> unsignedInteger() const;
  // Any number as a double.
  std::optional<double> real() const;
  std::optional<Date> date() const;
  const std::string* string() const;
  const Bytes* data() const;
  const Array* array() const;
  const Dictionary* dictionary() const;

  // For a dictionary, the value under key; nil when absent or not a dictionary.
  Value get(std::string_view key) const;

  // True for a true boolean, a non-zero number, and a string whose first
  // character after white space, a sign and zeros is Y, y, T, t or 1-9 (as
  // the platform reads "YES", "true", "1"); false otherwise (nil and other
  // types read as false).
  bool boolValue() const;
  // The value as a C int, as the platform's intValue reads it: a boolean
  // 1 or 0, an integer truncated to 32 bits, a real toward zero (clamped),
  // a string's leading decimal integer after white space and a sign
  // ("2.5" is 2, "12abc" 12, clamped to the int range); anything else 0.
  int32_t intValue() const;

  // The text "%@" prints: strings bare, numbers and booleans as numbers (1/0),
  // dates as "2026-11-21 09:30:00 +0000", data as <0011aabb ...>, arrays and
  // dictionaries in old-style property-list text, nested and indented; nil is
  // "(null)".
  std::string description() const;

  // Object equality as the system compares objects: numbers by numeric value
  // across integer, unsigned and real; booleans only with booleans; strings
  // and data by bytes; dates by time; arrays and dictionaries element-wise.
  friend bool operator==(const Value& a, const Value& b);

 private:
  struct UnsignedBox {
    uint64_t value;
  };
  using Storage = std::variant<std::monostate, bool, int64_t, UnsignedBox, double, std::shared_ptr<const std::string>,
                               std::shared_ptr<const Bytes>, Date, std::shared_ptr<const Array>,
                               std::shared_ptr<const Dictionary>>;
  explicit Value(Storage storage) : storage_(std::move(storage)) {}

  Storage storage_;
};

// A dictionary's entries, kept sorted by key (byte order) with unique keys,
// so enumeration is deterministic and written files are reproducible.
class Dictionary {
 public:
  using Entry = std::pair<std::string, Value>;
  using const_iterator = std::vector<Entry>::const_iterator;

  Dictionary() = default;
  // Sorts the entries; where a key stands more than once the last one wins.
  explicit Dictionary(std::vector<Entry> entries);

  size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }
  const_iterator begin() const { return entries_.begin(); }
  const_iterator end() const { return entries_.end(); }

  // The value stored under key, or null when there is none.
  const Value* find(std::string_view key) const;
  bool contains(std::string_view key) const { return find(key) != nullptr; }

  friend bool operator==(const Dictionary& a, const Dictionary& b);

 private:
  friend class DictionaryBuilder;
  std::vector<Entry> entries_;
};

// Collects entries in any order and makes a Dictionary of them.
class DictionaryBuilder {
 public:
  DictionaryBuilder() = default;
  void reserve(size_t n) { entries_.reserve(n); }
  void add(std::string key, Value value);
  size_t size() const { return entries_.size(); }

  // The dictionary; a key added twice keeps its last value.
  Value build();
  // The dictionary, or nullopt when a key was added twice (readers of
  // untrusted files refuse duplicates).
  std::optional<Value> buildUnique();

 private:
  std::vector<Dictionary::Entry> entries_;
};

const char* TypeName(Value::Type type);

}  // namespace vtr

#endif  // VTR_PLATFORM_VALUE_H_
