// PlistDocument: a property list read for lookup and enumeration, without
// building all of it at once.
//
// A binary property list is used in place: opening it checks all of it
// (every header, reference and key, no duplicate keys, no container holding
// itself, the depth bound), and afterwards an object becomes a Value only
// when value() asks for it. A whole device's manifest then costs its file's
// bytes and one byte per object, and each record is built, used and dropped
// in turn. An XML property list cannot be used in place; it is read whole
// into values, so its nodes cost what a Value tree costs.
//
// Nodes refer to their document, which refers to the bytes it was opened
// on: both must outlive every node. Documents and their nodes are used by
// one thread at a time (decoding uses the document's scratch state).
#ifndef VTR_PLATFORM_PLIST_DOCUMENT_H_
#define VTR_PLATFORM_PLIST_DOCUMENT_H_

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/plist.h"
#include "platform/result.h"
#include "platform/value.h"

namespace vtr {

namespace bplist {
class BinaryPlistReader;
}

class PlistNode;

class PlistDocument {
 public:
  // The document of bytes (binary or XML, told apart by the "bplist00"
  // magic); fails as ReadPropertyList would on the same bytes.
  static Result<std::unique_ptr<PlistDocument>> Open(std::span<const uint8_t> bytes, const PlistLimits& limits = {});
  ~PlistDocument();
  PlistDocument(const PlistDocument&) = delete;
  PlistDocument& operator=(const PlistDocument&) = delete;

  PlistNode top() const;
  PlistFormat format() const { return binary_ ? PlistFormat::kBinary : PlistFormat::kXml; }

 private:
  friend class PlistNode;
  PlistDocument(std::unique_ptr<bplist::BinaryPlistReader> binary, Value xml);

  std::unique_ptr<bplist::BinaryPlistReader> binary_;
  Value xml_;  // the XML document's top value
};

// One object of a document (or nil: no object). Cheap to copy.
class PlistNode {
 public:
  PlistNode() = default;
  // A node standing for value itself, for code that takes nodes.
  explicit PlistNode(Value value) : value_(std::move(value)) {}

  Value::Type type() const { return type_ ? *type_ : value_.type(); }
  bool isNil() const { return type() == Value::Type::kNil; }
  bool isDictionary() const { return type() == Value::Type::kDictionary; }
  // Entries of a dictionary or elements of an array; 0 for anything else.
  uint64_t count() const;

  // For a dictionary, the node under key; nil when absent or not a
  // dictionary.
  PlistNode get(std::string_view key) const;
  // Entry i (below count()) of a dictionary, in the order they are stored.
  std::string keyAt(uint64_t i) const;
  PlistNode valueAt(uint64_t i) const;
  // Calls visit with each entry of a dictionary, in the order they are
  // stored, until it returns false. Nothing for anything else.
  void forEachEntry(const std::function<bool(const std::string& key, const PlistNode& value)>& visit) const;

  // The object and all it holds, built now. Fails only when building it
  // would pass the document's expansion bounds.
  Result<Value> value() const;
  // The bytes of a data object, in place; nullopt for anything else.
  std::optional<std::span<const uint8_t>> data() const;

 private:
  friend class PlistDocument;
  PlistNode(bplist::BinaryPlistReader* reader, uint64_t index);

  // A node of a binary document: its reader and object; else value_.
  bplist::BinaryPlistReader* reader_ = nullptr;
  uint64_t index_ = 0;
  std::optional<Value::Type> type_;
  Value value_;
};

}  // namespace vtr

#endif  // VTR_PLATFORM_PLIST_DOCUMENT_H_
