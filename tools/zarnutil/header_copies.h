// The two copies of a Zarn header, each read and judged on its own: the
// library's acquisition stops at the first valid copy, so a damaged backup
// behind a sound main copy (or a damaged main copy in front of a sound
// backup, which the export cannot read past) would go unnoticed.
#ifndef VTR_TOOLS_ZARNUTIL_HEADER_COPIES_H_
#define VTR_TOOLS_ZARNUTIL_HEADER_COPIES_H_

#include <cstdint>
#include <string>

#include "tools/zarnutil/zarn_image.h"

namespace vtr {

enum class CopyCondition {
  kSound,         // a valid header the library's check finds consistent
  kInconsistent,  // valid (type and CRC) but the check finds a fault
  kBadCrc,        // a CRC-protected header whose CRC does not match
  kNotAHeader,    // no known header type: overwritten or never written
  kUnreadable,    // the block cannot be read whole
};

struct HeaderCopy {
  const char* name = "";  // "main" or "backup"
  uint64_t offset = 0;
  CopyCondition condition = CopyCondition::kUnreadable;
  std::string fault;  // kInconsistent: the check's message, without "zarn: "
  ZarnHeaderBuffer bytes{};

  // Whether the library would take this copy (type and CRC right).
  bool valid() const { return condition == CopyCondition::kSound || condition == CopyCondition::kInconsistent; }
  // What is wrong with it, in a few words ("sound" when nothing is).
  std::string description() const;
};

struct HeaderCopies {
  HeaderCopy main;
  HeaderCopy backup;

  // Both sound and byte for byte the same: nothing to repair.
  bool healthy() const;
  // The copy to restore the other from: main when sound, else backup when
  // sound; null when neither is.
  const HeaderCopy* sound() const;
  // The valid copy a repair by the library's rules starts from (main first);
  // null when neither is valid.
  const HeaderCopy* valid() const;
};

// Reads and judges both copies of image's header (the library's check runs
// quietly on each valid copy).
HeaderCopies ReadHeaderCopies(const ZarnImage& image);

// The condition's name in reports: "sound", "inconsistent", "bad-crc",
// "not-a-header", "unreadable".
const char* ConditionName(CopyCondition condition);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_HEADER_COPIES_H_
