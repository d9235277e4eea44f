// The binary property-list reader, shared by the whole-file reader and by
// PlistDocument, which decodes objects only when they are asked for.
// Internal to the platform library; not thread-safe.
//
// The input is hostile until proven otherwise. open() checks the trailer and
// every object's offset, count and reference against the file and counts
// references, so that only objects reached more than once are remembered
// while decoding. decode() then builds the value of one object without
// recursion (an explicit stack bounded by the depth limit), refuses
// containers that contain themselves, and tracks the size of the result as
// if every shared object were copied wherever it is referenced, so a small
// file cannot describe a huge result.
#ifndef VTR_PLATFORM_PLIST_BINARY_READER_H_
#define VTR_PLATFORM_PLIST_BINARY_READER_H_

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <unordered_map>
#include <vector>

#include "platform/plist.h"
#include "platform/plist_binary_format.h"

namespace vtr::bplist {

// Where an object lives and what its marker says, checked against the file.
struct ObjectHeader {
  uint64_t index = 0;
  uint64_t offset = 0;
  uint8_t marker = 0;
  uint64_t count = 0;    // elements (strings: bytes or UTF-16 units; containers: entries)
  uint64_t content = 0;  // offset of the first byte after the marker and count
  uint8_t type() const { return marker >> 4; }
  bool isContainer() const { return type() == kArrayType || type() == kDictType; }
};

class BinaryPlistReader {
 public:
  // bytes must outlive the reader.
  BinaryPlistReader(std::span<const uint8_t> bytes, const PlistLimits& limits);

  // Checks the trailer and every object's header and references. Must
  // succeed before anything else is called.
  Status open();
  // Walks everything the top object reaches without building it: every
  // scalar decodes, every key is a string, no dictionary holds a key twice,
  // no container holds itself, no nesting is deeper than the limit. After
  // it succeeds, decode() fails only on the expansion bounds.
  Status validate();

  uint64_t top() const { return trailer_.topObject; }
  // The value of object index and all it holds. Each call is bounded on its
  // own by the expansion limits.
  Result<Value> decode(uint64_t index);
  Result<ObjectHeader> header(uint64_t index) const;
  // The object index that slot of container h refers to (a dictionary's
  // keys come first, then its values).
  uint64_t reference(const ObjectHeader& h, uint64_t slot) const {
    return ReadBigEndian(&bytes_[h.content + slot * trailer_.objectRefSize], trailer_.objectRefSize);
  }
  // The text of a string object (a dictionary key); fails for any other.
  Result<std::string> keyText(uint64_t index) const;
  // The bytes of a data object, in place.
  std::span<const uint8_t> dataBytes(const ObjectHeader& h) const { return bytes_.subspan(h.content, h.count); }

 private:
  // A shared object decoded once, with the expanded size of one copy of it.
  struct Memo {
    Value value;
    uint64_t nodes = 0;
    uint64_t bytes = 0;
  };
  // An array or dictionary being decoded.
  struct Frame {
    ObjectHeader header;
    uint64_t next = 0;  // index of the next element to decode
    Array items;
    DictionaryBuilder entries;
    std::string key;  // key of the dictionary value being decoded
    uint64_t nodesBefore = 0;
    uint64_t bytesBefore = 0;
  };

  Status readTrailer();
  Status checkObjects();
  Result<std::optional<Value>> reach(uint64_t index);
  Result<Value> decodeScalar(const ObjectHeader& h) const;
  Result<std::string> decodeText(const ObjectHeader& h) const;
  Result<std::string> decodeKey(uint64_t index);
  Result<Value> finish(Frame& frame);
  Status charge(uint64_t nodes, uint64_t bytes, uint64_t index);
  Result<Value> decodeFromTop(uint64_t index);
  // The text of a string object, in place when it is ASCII, else decoded
  // into scratch.
  Result<std::string_view> textView(const ObjectHeader& h, std::string* scratch) const;
  Status checkUniqueKeys(const ObjectHeader& dict, std::vector<std::pair<size_t, uint64_t>>& keys) const;
  Error objectError(uint64_t index, const std::string& what) const;
  Error objectError(const ObjectHeader& h, const std::string& what) const;

  std::span<const uint8_t> bytes_;
  PlistLimits limits_;
  uint64_t maxNodes_;
  uint64_t maxBytes_;
  Trailer trailer_;
  std::vector<uint8_t> state_;  // per object: reference count, kOnPath, kValidated
  std::unordered_map<uint64_t, Memo> memo_;
  std::vector<uint64_t> containersRemembered_;  // in memo_ for this decode call only
  std::vector<Frame> stack_;
  uint64_t nodes_ = 0;
  uint64_t expandedBytes_ = 0;
};

}  // namespace vtr::bplist

#endif  // VTR_PLATFORM_PLIST_BINARY_READER_H_
