// A bounded memory of small encoded objects and the indexes they were written
// under, so that a binary property-list writer emits a repeated key, string or
// number once and refers to it afterwards. Internal to the platform library.
//
// Memory is fixed: two generations of at most `capacity` entries each. When
// the current generation is full it becomes the previous one and the older
// entries are forgotten; an entry found in the previous generation moves back
// into the current one, so objects that keep recurring (the keys of every
// record of a manifest) stay while one-off values age out. Behaviour depends
// only on the sequence of calls, so output built with it is deterministic.
// Not thread-safe.
#ifndef VTR_PLATFORM_PLIST_BINARY_OBJECT_CACHE_H_
#define VTR_PLATFORM_PLIST_BINARY_OBJECT_CACHE_H_

#include <cstddef>
#include <cstdint>
#include <span>
#include <vector>

namespace vtr::bplist {

class ObjectCache {
 public:
  // Encodings longer than this are not remembered.
  static constexpr size_t kMaxEncodingSize = 64;

  // Enough to keep the keys and common values of a manifest record hot while
  // the tables stay small enough for the processor's caches.
  static constexpr size_t kDefaultCapacity = 1024;

  explicit ObjectCache(size_t capacity = kDefaultCapacity);

  // The index remembered for exactly these bytes, if any; otherwise index,
  // which is remembered for them (unless they are too long to keep).
  uint64_t findOrAdd(std::span<const uint8_t> encoding, uint64_t index);

 private:
  // The probed part of a slot is kept small so that lookups stay in the
  // processor's cache; the encodings live apart and are compared only when
  // the hash matches.
  struct Slot {
    uint64_t hash;
    uint64_t index;
    uint32_t epoch;  // the slot is in use when this equals its table's epoch
    uint32_t length;
  };
  // An open-addressing table kept at most half full; clearing it is a new epoch.
  struct Table {
    std::vector<Slot> slots;
    std::vector<uint8_t> encodings;  // kMaxEncodingSize bytes per slot
    uint32_t epoch = 1;
    size_t used = 0;
    // The slot holding encoding, or the free slot where it would go.
    size_t lookup(std::span<const uint8_t> encoding, uint64_t hash) const;
    bool holds(size_t slot) const { return slots[slot].epoch == epoch; }
  };

  void insertCurrent(std::span<const uint8_t> encoding, uint64_t hash, uint64_t index, size_t slot);

  size_t capacity_;
  Table current_;
  Table previous_;
};

}  // namespace vtr::bplist

#endif  // VTR_PLATFORM_PLIST_BINARY_OBJECT_CACHE_H_
