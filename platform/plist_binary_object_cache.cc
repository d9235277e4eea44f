#include "platform/plist_binary_object_cache.h"

#include <bit>
#include <cstring>
#include <utility>

namespace vtr::bplist {
namespace {

// A multiply-and-rotate hash, 8 bytes at a time: the encodings are short and
// this is on the path of nearly every object written. The last word overlaps
// the one before rather than being copied byte by byte, which would stall
// the load that follows.
uint64_t Hash(std::span<const uint8_t> bytes) {
  constexpr uint64_t kMultiplier = 0x9E3779B97F4A7C15u;
  const uint8_t* p = bytes.data();
  const size_t n = bytes.size();
  uint64_t h = n * kMultiplier;
  auto mix = [&](uint64_t word) { h = std::rotl((h ^ word) * kMultiplier, 29); };
  uint64_t word;
  if (n >= 8) {
    for (size_t i = 0; i + 8 < n; i += 8) {
      std::memcpy(&word, p + i, 8);
      mix(word);
    }
    std::memcpy(&word, p + n - 8, 8);
  } else if (n >= 4) {
    uint32_t first, last;
    std::memcpy(&first, p, 4);
    std::memcpy(&last, p + n - 4, 4);
    word = uint64_t{first} << 32 | last;
  } else {
    word = n == 0 ? 0 : uint64_t{p[0]} << 16 | uint64_t{p[n / 2]} << 8 | p[n - 1];
  }
  mix(word);
  return h ^ (h >> 32);
}

}  // namespace

ObjectCache::ObjectCache(size_t capacity) : capacity_(capacity) {
  const size_t slots = std::bit_ceil(2 * capacity);
  for (Table* table : {&current_, &previous_}) {
    table->slots.assign(slots, Slot{});
    table->encodings.assign(slots * kMaxEncodingSize, 0);
  }
}

size_t ObjectCache::Table::lookup(std::span<const uint8_t> encoding, uint64_t hash) const {
  const size_t mask = slots.size() - 1;
  for (size_t i = hash & mask;; i = (i + 1) & mask) {
    const Slot& slot = slots[i];
    if (slot.epoch != epoch) return i;
    if (slot.hash == hash && slot.length == encoding.size() &&
        std::memcmp(&encodings[i * kMaxEncodingSize], encoding.data(), encoding.size()) == 0) {
      return i;
    }
  }
}

uint64_t ObjectCache::findOrAdd(std::span<const uint8_t> encoding, uint64_t index) {
  if (encoding.size() > kMaxEncodingSize) return index;
  const uint64_t hash = Hash(encoding);
  const size_t slot = current_.lookup(encoding, hash);
  if (current_.holds(slot)) return current_.slots[slot].index;
  if (const size_t old = previous_.lookup(encoding, hash); previous_.holds(old)) index = previous_.slots[old].index;
  insertCurrent(encoding, hash, index, slot);
  return index;
}

// Fills slot, the free slot of the current generation for encoding, unless
// the generation is full and is retired first.
void ObjectCache::insertCurrent(std::span<const uint8_t> encoding, uint64_t hash, uint64_t index, size_t slot) {
  if (current_.used == capacity_) {
    std::swap(current_, previous_);
    ++current_.epoch;
    current_.used = 0;
    slot = current_.lookup(encoding, hash);
  }
  current_.slots[slot] = Slot{hash, index, current_.epoch, static_cast<uint32_t>(encoding.size())};
  std::memcpy(&current_.encodings[slot * kMaxEncodingSize], encoding.data(), encoding.size());
  ++current_.used;
}

}  // namespace vtr::bplist
