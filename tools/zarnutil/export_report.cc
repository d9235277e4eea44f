#include "tools/zarnutil/export_report.h"

#include "tools/zarnutil/json_writer.h"
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
  JsonWriter json;
  json.beginObject();
  json.key("media_identity");
  json.string(UuidText(mediaIdentity));
  json.key("partitions");
  json.beginArray();
  for (const ZarnExportedPartition& p : partitions) {
    json.beginObject();
    json.key("index");
    json.number(p.index);
    json.key("name");
    json.string(p.name);
    json.key("type");
    json.string(UuidText(p.type));
    json.key("identity");
    json.string(UuidText(p.identity));
    json.key("size");
    json.number(p.size);
    json.key("flags");
    json.number(p.flags);
    json.key("extents");
    json.beginArray();
    for (const ZarnExtent& e : p.extents) {
      json.beginObject();
      json.key("offset");
      json.number(e.offset);
      json.key("length");
      json.number(e.length);
      json.endObject();
    }
    json.endArray();
    json.endObject();
  }
  json.endArray();
  json.endObject();
  return json.text() + "\n";
}

}  // namespace vtr
