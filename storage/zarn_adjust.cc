#include "storage/zarn_adjust.h"

#include <uuid/uuid.h>

#include <array>
#include <cstring>
#include <utility>

#include "platform/little_endian.h"
#include "storage/zarn_diagnostics.h"
#include "storage/zarn_layout.h"

namespace vtr {
namespace {

ZarnEntryEditor EntryAt(uint8_t* table, uint32_t i) {
  return ZarnEntryEditor(std::span<uint8_t, kGptEntrySize>(table + size_t{i} * kGptEntrySize, kGptEntrySize));
}

// Table positions 0..count-1 ordered by first LBA. A bubble sort that swaps
// only on a strictly greater start, so equal starts keep table order.
std::array<uint32_t, kGptTableEntries> OrderByStart(uint8_t* table, uint32_t count) {
  std::array<uint32_t, kGptTableEntries> order{};
  for (uint32_t i = 0; i < count; ++i) order[i] = i;
  for (bool swapped = true; swapped;) {
    swapped = false;
    for (uint32_t i = 0; i + 1 < count; ++i) {
      if (EntryAt(table, order[i]).begin() > EntryAt(table, order[i + 1]).begin()) {
        std::swap(order[i], order[i + 1]);
        swapped = true;
      }
    }
  }
  return order;
}

}  // namespace

int zarnAdjustPartition(const ZarnMediaProperties* props, uint8_t* gptHeader, uint8_t* gptEntries,
                        uint32_t partitionIndex, uint64_t newSizeBytes) {
  if (props == nullptr) {
    ZarnPrint("zarn: NULL media properties\n");
    return -1;
  }
  if (gptHeader == nullptr || gptEntries == nullptr) {
    ZarnPrint("zarn: NULL header buffer\n");
    return -1;
  }
  const uint32_t count = LoadU32(gptHeader + kGptEntryCountOffset);
  const uint64_t firstUsable = LoadU64(gptHeader + kGptFirstUsableLbaOffset);
  const uint64_t lastUsable = LoadU64(gptHeader + kGptLastUsableLbaOffset);
  // A count above the table's eight entries would lead the re-packing past it.
  if (partitionIndex > 7 || partitionIndex > count || count > kGptTableEntries) {
    std::fprintf(stderr, "zarn: cannot adjust partition %d - out of range\n", static_cast<int>(partitionIndex));
    return -1;
  }
  const uint32_t blockSize = props->blockSize;
  const uint64_t blocks = blockSize == 0 ? 0 : newSizeBytes / blockSize + (newSizeBytes % blockSize != 0 ? 1 : 0);

  uint32_t newCount = count;
  ZarnEntryEditor entry = EntryAt(gptEntries, partitionIndex);
  if (partitionIndex == count) {
    if (blocks == 0) {
      ZarnPrint("zarn: cannot create zero-sized partition\n");
      return -1;
    }
    ZarnUuid identity;
    uuid_generate(identity.data());
    entry.clear();
    entry.setType(kZarnHfsPlusType);
    entry.setIdentity(identity);
    entry.setAsciiName("New");
    entry.setBegin(lastUsable + 1);
    entry.setEnd(lastUsable + blocks);
    newCount = partitionIndex + 1;
  } else if (blocks == 0) {
    uint8_t* at = gptEntries + size_t{partitionIndex} * kGptEntrySize;
    std::memmove(at, at + kGptEntrySize, size_t{count - 1 - partitionIndex} * kGptEntrySize);
    newCount = count - 1;
    EntryAt(gptEntries, newCount).clear();
  } else {
    entry.setEnd(entry.begin() + blocks - 1);
  }

  // An entry that ends before it starts has no length to keep: re-packed,
  // its length would wrap around and the layout seem to fit.
  for (uint32_t i = 0; i < newCount; ++i) {
    if (EntryAt(gptEntries, i).end() < EntryAt(gptEntries, i).begin()) {
      std::fprintf(stderr, "zarn: partition %u ends before it starts\n", i);
      return -1;
    }
  }
  uint64_t next = firstUsable;
  bool wrapped = false;
  const std::array<uint32_t, kGptTableEntries> order = OrderByStart(gptEntries, newCount);
  for (uint32_t i = 0; i < newCount; ++i) {
    ZarnEntryEditor e = EntryAt(gptEntries, order[i]);
    const uint64_t length = e.end() - e.begin();
    e.setBegin(next);
    uint64_t end = 0;
    wrapped = wrapped || __builtin_add_overflow(next, length, &end) || __builtin_add_overflow(end, 1, &next);
    e.setEnd(end);
  }
  if (wrapped) {
    std::fprintf(stderr, "zarn: new layout does not fit, overflows by 0x%llx blocks\n", ~0ULL);
    return -1;
  }
  if (next > lastUsable + 1) {
    std::fprintf(stderr, "zarn: new layout does not fit, overflows by 0x%llx blocks\n",
                 static_cast<unsigned long long>(next - (lastUsable + 1)));
    return -1;
  }
  StoreU32(gptHeader + kGptEntryCountOffset, newCount);
  return 0;
}

}  // namespace vtr
