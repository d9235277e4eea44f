#include "tools/zarnutil/export_report.h"

#include "tools/zarnutil/report_format.h"

namespace vtr {

std::string ExportText(const ZarnUuid& mediaIdentity, const std::vector<ZarnExportedPartition>& partitions) {
  std::string out = "media identity: " + UuidText(mediaIdentity) + "\n";
  for (const ZarnExportedPartition& p : partitions) {
    out += "partition " + std::to_string(p.index) + " " + JsonQuote(p.name) + "\n";
    out += "  type:     " + UuidText(p.type) + "\n";
    out += "  identity: " + UuidText(p.identity) + "\n";
    out += "  size:     " + std::to_string(p.size) + " (" + HumanSize(p.size) + ")\n";
    out += "  flags:    " + Hex(p.flags, 2) + "\n";
    out += "  extents:  " + std::to_string(p.extents.size()) + "\n";
    for (const ZarnExtent& e : p.extents) {
      out += "    offset " + std::to_string(e.offset) + ", length " + std::to_string(e.length) + " (" +
             HumanSize(e.length) + ")\n";
    }
  }
  return out;
}

std::string ExportJson(const ZarnUuid& mediaIdentity, const std::vector<ZarnExportedPartition>& partitions) {
  Json listed = Json::array();
  for (const ZarnExportedPartition& p : partitions) {
    Json extents = Json::array();
    for (const ZarnExtent& e : p.extents) extents.push_back({{"offset", e.offset}, {"length", e.length}});
    listed.push_back({{"index", p.index},
                      {"name", p.name},
                      {"type", UuidText(p.type)},
                      {"identity", UuidText(p.identity)},
                      {"size", p.size},
                      {"flags", p.flags},
                      {"extents", std::move(extents)}});
  }
  return JsonLine({{"media_identity", UuidText(mediaIdentity)}, {"partitions", std::move(listed)}});
}

}  // namespace vtr
