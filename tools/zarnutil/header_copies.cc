#include "tools/zarnutil/header_copies.h"

#include <unistd.h>

#include <algorithm>
#include <vector>

#include "storage/zarn_check.h"
#include "storage/zarn_header.h"
#include "tools/zarnutil/library_messages.h"

namespace vtr {
namespace {

HeaderCopy ReadCopy(const ZarnImage& image, const char* name, uint64_t offset) {
  HeaderCopy copy;
  copy.name = name;
  copy.offset = offset;
  const uint32_t blockSize = image.props.blockSize;
  std::vector<uint8_t> block(std::max<size_t>(blockSize, kZarnHeaderSize), 0);
  if (::pread(image.fd.get(), block.data(), blockSize, static_cast<off_t>(offset)) != static_cast<ssize_t>(blockSize)) {
    return copy;
  }
  std::copy_n(block.begin(), kZarnHeaderSize, copy.bytes.begin());
  ZarnHeaderBuffer scratch = copy.bytes;  // validation rewrites the CRC field
  switch (zarnValidateHeader(scratch.data())) {
    case 0: break;
    case -1: copy.condition = CopyCondition::kBadCrc; return copy;
    default: copy.condition = CopyCondition::kNotAHeader; return copy;
  }
  LibraryMessages messages;
  const bool consistent = zarnCheckHeader(&image.props, copy.bytes.data()) == 0;
  const std::vector<std::string> lines = messages.finish();
  copy.condition = consistent ? CopyCondition::kSound : CopyCondition::kInconsistent;
  if (!consistent && !lines.empty()) copy.fault = lines.back();
  return copy;
}

}  // namespace

std::string HeaderCopy::description() const {
  switch (condition) {
    case CopyCondition::kSound: return "sound";
    case CopyCondition::kInconsistent: return "inconsistent: " + fault;
    case CopyCondition::kBadCrc: return "damaged: its CRC does not match its contents";
    case CopyCondition::kNotAHeader: return "damaged: not a Zarn header (unknown type identifier)";
    case CopyCondition::kUnreadable: return "unreadable: its block cannot be read whole";
  }
  return "";
}

bool HeaderCopies::healthy() const {
  return main.condition == CopyCondition::kSound && backup.condition == CopyCondition::kSound &&
         main.bytes == backup.bytes;
}

const HeaderCopy* HeaderCopies::sound() const {
  if (main.condition == CopyCondition::kSound) return &main;
  if (backup.condition == CopyCondition::kSound) return &backup;
  return nullptr;
}

const HeaderCopy* HeaderCopies::valid() const {
  if (main.valid()) return &main;
  if (backup.valid()) return &backup;
  return nullptr;
}

HeaderCopies ReadHeaderCopies(const ZarnImage& image) {
  return {ReadCopy(image, "main", 0), ReadCopy(image, "backup", BackupHeaderOffset(image))};
}

const char* ConditionName(CopyCondition condition) {
  switch (condition) {
    case CopyCondition::kSound: return "sound";
    case CopyCondition::kInconsistent: return "inconsistent";
    case CopyCondition::kBadCrc: return "bad-crc";
    case CopyCondition::kNotAHeader: return "not-a-header";
    case CopyCondition::kUnreadable: return "unreadable";
  }
  return "";
}

}  // namespace vtr
