// The object layer of the binary property-list writer: writes objects to a
// stream as they are produced, children before the containers that refer to
// them, and keeps only each object's offset (a few bytes each) until the
// offset table is written at the end. Repeated small objects are written once
// (see ObjectCache). Internal to the platform library; not thread-safe.
#ifndef VTR_PLATFORM_PLIST_BINARY_ENCODER_H_
#define VTR_PLATFORM_PLIST_BINARY_ENCODER_H_

#include <cstdint>
#include <span>
#include <string_view>
#include <vector>

#include "platform/output_stream.h"
#include "platform/plist_binary_format.h"
#include "platform/plist_binary_object_cache.h"
#include "platform/result.h"
#include "platform/value.h"

namespace vtr::bplist {

class ObjectEncoder {
 public:
  // Objects go to out, which must outlive the encoder. Every reference is
  // written in refSize bytes (1, 2, 4 or 8); writing more objects than that
  // can address fails. cacheCapacity bounds the repeated objects remembered.
  ObjectEncoder(OutputStream* out, uint8_t refSize, size_t cacheCapacity = ObjectCache::kDefaultCapacity);
  ObjectEncoder(const ObjectEncoder&) = delete;
  ObjectEncoder& operator=(const ObjectEncoder&) = delete;

  // Writes the magic. Must come first.
  Status begin();

  // Writes value and everything in it (without recursion, so any depth), and
  // returns the index of value's object. Fails on a nil value or a string
  // that is not UTF-8; objects already written stay in the stream,
  // unreferenced. After a stream error every later call fails with it.
  Result<uint64_t> write(const Value& value);
  Result<uint64_t> writeString(std::string_view text);

  // Writes a dictionary of count entries whose key and value object indexes
  // keyAt(i) and valueAt(i) give; returns its index.
  template <typename KeyAt, typename ValueAt>
  Result<uint64_t> writeDictionary(uint64_t count, KeyAt keyAt, ValueAt valueAt) {
    startObject(kDictType, count);
    uint8_t* p = appendReferences(2 * count);
    for (uint64_t i = 0; i < count; ++i, p += refSize_) StoreBigEndian(p, keyAt(i), refSize_);
    for (uint64_t i = 0; i < count; ++i, p += refSize_) StoreBigEndian(p, valueAt(i), refSize_);
    return emit({});
  }

  // Writes the offset table and the trailer naming top as the top object,
  // then flushes the stream.
  Status end(uint64_t top);

  uint64_t objectCount() const { return objectCount_; }

 private:
  struct Pending {
    const Value* value;
    size_t next;       // next child (dictionaries: 2 per entry, key then value)
    size_t refsStart;  // where this container's child indexes begin in refs_
  };

  Result<uint64_t> writeScalar(const Value& value);
  Result<uint64_t> writeContainer(const Pending& pending);
  void startObject(uint8_t type, uint64_t count);
  // Grows scratch_ by count references and returns where they go.
  uint8_t* appendReferences(uint64_t count);
  // Writes scratch_ followed by payload as one object, or finds it already
  // written; returns its index.
  Result<uint64_t> emit(std::span<const uint8_t> payload);

  OutputStream* out_;
  Status failure_;  // the stream's first error
  uint8_t refSize_;
  uint64_t base_ = 0;  // stream position of the magic
  uint64_t objectCount_ = 0;
  uint64_t lastOffset_ = 0;
  // Offsets of the objects, each as a LEB128 delta from the one before.
  std::vector<uint8_t> offsetDeltas_;
  ObjectCache cache_;
  std::vector<uint8_t> scratch_;  // the object being encoded
  std::vector<uint8_t> utf16_;    // a string's UTF-16 form
  std::vector<Pending> stack_;
  std::vector<uint64_t> refs_;  // child indexes of the containers on stack_
};

}  // namespace vtr::bplist

#endif  // VTR_PLATFORM_PLIST_BINARY_ENCODER_H_
