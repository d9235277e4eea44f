// XpcObject: the message objects that travel between the helper and its
// clients. An object is null, a boolean, a signed or unsigned 64-bit
// integer, a double, a date (signed nanoseconds since 1970-01-01 UTC), data,
// a string, a UUID, an array or a dictionary with string keys.
//
// Objects are immutable once built; copies share their storage, so passing
// one around costs a reference count at most. Dictionaries keep their
// entries in the order they were added (for a decoded message: the order on
// the wire) and never hold a key twice. Strings and keys are kept as the
// bytes that were sent: they are not checked for valid UTF-8 here (the
// conversion layer above decides what to do with such text).
//
// An object may be read from several threads at once.
#ifndef VTR_XPC_XPC_OBJECT_H_
#define VTR_XPC_XPC_OBJECT_H_

#include <array>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

namespace vtr {

class XpcObject;
class XpcDictionary;

using XpcBytes = std::vector<uint8_t>;
using XpcUuid = std::array<uint8_t, 16>;
using XpcArray = std::vector<XpcObject>;

class XpcObject {
 public:
  // The numbering is the type's tag on the wire.
  enum class Type : uint8_t {
    kNull = 0,
    kBool = 1,
    kInt64 = 2,
    kUint64 = 3,
    kDouble = 4,
    kDate = 5,
    kData = 6,
    kString = 7,
    kUuid = 8,
    kArray = 9,
    kDictionary = 10,
  };

  XpcObject() = default;  // null

  static XpcObject Null() { return XpcObject(); }
  static XpcObject Bool(bool value);
  static XpcObject Int64(int64_t value);
  static XpcObject Uint64(uint64_t value);
  static XpcObject Double(double value);
  static XpcObject Date(int64_t nanosecondsSince1970);
  static XpcObject Data(XpcBytes bytes);
  static XpcObject String(std::string bytes);
  static XpcObject Uuid(const XpcUuid& uuid);
  static XpcObject Array(XpcArray items);
  static XpcObject Dictionary(XpcDictionary dictionary);
  // {key: value, ...}; where a key stands twice the later value wins.
  static XpcObject Dictionary(std::initializer_list<std::pair<std::string, XpcObject>> entries);

  Type type() const { return static_cast<Type>(storage_.index()); }
  bool isNull() const { return type() == Type::kNull; }

  // Typed access: the value when the object has that type (no conversion
  // between types), else nullopt / nullptr. Pointers live as long as the
  // object (or a copy of it) does.
  std::optional<bool> boolValue() const;
  std::optional<int64_t> int64Value() const;
  std::optional<uint64_t> uint64Value() const;
  std::optional<double> doubleValue() const;
  std::optional<int64_t> dateValue() const;  // nanoseconds since 1970
  std::optional<XpcUuid> uuidValue() const;
  const XpcBytes* data() const;
  const std::string* string() const;
  const XpcArray* array() const;
  const XpcDictionary* dictionary() const;

  // For a dictionary, the value under key; nullptr when absent or when this
  // is not a dictionary.
  const XpcObject* find(std::string_view key) const;

  // Same type and same contents; doubles compare by their bits (so a
  // decoded NaN equals the one that was sent), dictionaries entry by entry
  // in order.
  friend bool operator==(const XpcObject& a, const XpcObject& b);

 private:
  struct Uint64Box {
    uint64_t value;
  };
  struct DateBox {
    int64_t nanoseconds;
  };
  using Storage = std::variant<std::monostate, bool, int64_t, Uint64Box, double, DateBox,
                               std::shared_ptr<const XpcBytes>, std::shared_ptr<const std::string>, XpcUuid,
                               std::shared_ptr<const XpcArray>, std::shared_ptr<const XpcDictionary>>;
  explicit XpcObject(Storage storage) : storage_(std::move(storage)) {}

  Storage storage_;
};

// A dictionary's entries in insertion order, each key once. Lookups are
// linear: messages hold a handful of keys.
class XpcDictionary {
 public:
  using Entry = std::pair<std::string, XpcObject>;
  using const_iterator = std::vector<Entry>::const_iterator;

  XpcDictionary() = default;
  // Where a key stands twice the later value replaces the earlier one, which
  // keeps its place.
  XpcDictionary(std::initializer_list<Entry> entries);

  // A dictionary of entries whose keys must all differ; nullopt when one
  // repeats. Takes O(n log n), so it suits entries that came from a peer.
  static std::optional<XpcDictionary> FromUniqueEntries(std::vector<Entry> entries);

  // Adds key, or replaces its value where it already stands.
  void set(std::string key, XpcObject value);

  const XpcObject* find(std::string_view key) const;
  bool contains(std::string_view key) const { return find(key) != nullptr; }
  size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }
  const_iterator begin() const { return entries_.begin(); }
  const_iterator end() const { return entries_.end(); }

  friend bool operator==(const XpcDictionary& a, const XpcDictionary& b);

 private:
  std::vector<Entry> entries_;
};

// "null", "bool", "int64", ...: the type's name for error texts.
const char* XpcTypeName(XpcObject::Type type);

}  // namespace vtr

#endif  // VTR_XPC_XPC_OBJECT_H_
