#include "storage/zarn_map_scan.h"

namespace vtr {

ZarnSlotIndex::ZarnSlotIndex(const ZarnMediaProperties& props, ZarnHeaderView header) {
  for (uint32_t s = 1; s < ZarnMediumSlots(props); ++s) {
    entries_.emplace_back(header.chunk(s), static_cast<uint16_t>(s));
  }
  std::sort(entries_.begin(), entries_.end());
}

std::vector<uint32_t> ZarnSlotIndex::slotsHolding(uint64_t value) const {
  std::vector<uint32_t> slots;
  if (value > 0xFFFF) return slots;
  const auto wanted = static_cast<uint16_t>(value);
  auto it = std::lower_bound(entries_.begin(), entries_.end(), std::pair<uint16_t, uint16_t>(wanted, 0));
  for (; it != entries_.end() && it->first == wanted; ++it) slots.push_back(it->second);
  return slots;
}

}  // namespace vtr
