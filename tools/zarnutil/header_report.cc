#include "tools/zarnutil/header_report.h"

#include <algorithm>
#include <cstdio>

#include "tools/zarnutil/report_format.h"

namespace vtr {
namespace {

uint32_t ListedPartitions(ZarnHeaderView header) {
  return std::min(header.partitionCount(), kZarnMaxPartitions);
}

const char* KindName(ZarnHeaderView header) {
  if (header.hasType(kZarnTypeWithCrc)) return "CRC-protected";
  if (header.hasType(kZarnTypeWithoutCrc)) return "without CRC";
  return "unknown";
}

std::string Line(const char* label, const std::string& value) {
  char start[32];
  std::snprintf(start, sizeof start, "%-17s", label);
  return start + value + "\n";
}

}  // namespace

std::string HeaderText(const ZarnMediaProperties& props, ZarnHeaderView header, bool chunks) {
  std::string out;
  out += Line("header kind:", KindName(header));
  out += Line("media size:", std::to_string(header.mediaSize()) + " (" + HumanSize(header.mediaSize()) + ")");
  out += Line("media identity:", UuidText(header.mediaIdentity()));
  out += Line("partition count:", std::to_string(header.partitionCount()));
  out += Line("crc:", Hex(header.crc(), 8));
  out += Line("flags:", Hex(header.flags(), 16));
  out += Line("geometry:", "block size " + std::to_string(props.blockSize) + ", " +
                               std::to_string(props.chunkCount) + " chunks of " + HumanSize(props.chunkSize) +
                               ", usable " + std::to_string(props.usableSize));
  out += "partitions:\n";
  char line[512];
  std::snprintf(line, sizeof line, "  %-5s %-36s  %-36s  %14s  %14s  %-18s  %s\n", "index", "type", "identity",
                "begin", "end", "attributes", "name");
  out += line;
  for (uint32_t i = 0; i < ListedPartitions(header); ++i) {
    const ZarnEntryView entry = header.entry(i);
    std::snprintf(line, sizeof line, "  %-5u %-36s  %-36s  %14llu  %14llu  %-18s  %s\n", i,
                  UuidText(entry.type()).c_str(), UuidText(entry.identity()).c_str(),
                  static_cast<unsigned long long>(entry.begin()), static_cast<unsigned long long>(entry.end()),
                  Hex(entry.attributes(), 16).c_str(), JsonQuote(EntryName(entry)).c_str());
    out += line;
  }
  if (!chunks) return out;
  out += "chunk map:\n";
  for (uint32_t row = 0; row < kZarnChunkMapSlots; row += 16) {
    out += "  " + Hex(row, 3) + ":";
    for (uint32_t s = row; s < row + 16; ++s) {
      std::snprintf(line, sizeof line, " %04x", header.chunk(s));
      out += line;
    }
    out += "\n";
  }
  return out;
}

std::string HeaderJson(ZarnHeaderView header) {
  Json partitions = Json::array();
  for (uint32_t i = 0; i < ListedPartitions(header); ++i) {
    const ZarnEntryView entry = header.entry(i);
    partitions.push_back({{"index", i},
                          {"type", UuidText(entry.type())},
                          {"identity", UuidText(entry.identity())},
                          {"begin", entry.begin()},
                          {"end", entry.end()},
                          {"attributes", entry.attributes()},
                          {"name", EntryName(entry)}});
  }
  Json chunks = Json::array();
  for (uint32_t s = 0; s < kZarnChunkMapSlots; ++s) chunks.push_back(header.chunk(s));
  return JsonLine({{"media_size", header.mediaSize()},
                   {"media_identity", UuidText(header.mediaIdentity())},
                   {"partition_count", header.partitionCount()},
                   {"crc", header.crc()},
                   {"flags", header.flags()},
                   {"partitions", std::move(partitions)},
                   {"chunk_map", std::move(chunks)}});
}

}  // namespace vtr
