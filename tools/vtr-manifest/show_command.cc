// vtr-manifest show: a manifest as text, JSON or XML.
#include "platform/plist.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/manifest_render.h"
#include "tools/vtr-manifest/manifest_source.h"

namespace vtr::manifest_tool {
namespace {

using Json = nlohmann::json;

std::string JsonText(const Json& json) { return json.dump(-1, ' ', false, Json::error_handler_t::replace); }

// Each entry is built, printed and dropped in turn; false when a record
// cannot be built.
bool PrintEntries(const PlistNode& records, ShowFormat format, FILE* out) {
  bool first = true;
  bool built = true;
  if (format == ShowFormat::kJson) std::fputs("{", out);
  records.forEachEntry([&](const std::string& path, const PlistNode& node) {
    Result<Value> record = node.value();
    if (!record.ok()) return built = false;
    if (format == ShowFormat::kJson) {
      // One entry per line inside one object.
      std::fprintf(out, "%s\n  %s: %s", first ? "" : ",", JsonText(Json(path)).c_str(),
                   JsonText(ToJson(*record)).c_str());
    } else {
      std::fprintf(out, "%s\n", RecordLine(path, *record).c_str());
    }
    first = false;
    return true;
  });
  if (format == ShowFormat::kJson) std::fputs(first ? "}\n" : "\n}\n", out);
  return built;
}

}  // namespace

int RunShow(const ShowOptions& options, FILE* out, Console& console) {
  Result<std::unique_ptr<ManifestSource>> source = ManifestSource::Load(options.manifest);
  if (!source.ok()) {
    console.print("vtr-manifest: " + source.error().description());
    return ExitStatusOfLoad(source.error());
  }
  PlistNode records = (*source)->records();
  if (options.path) {
    const PlistNode record = records.get(*options.path);
    if (record.isNil()) {
      console.print("vtr-manifest: the manifest has no entry " + *options.path);
      return kExitNo;
    }
    Result<Value> value = record.value();
    if (!value.ok()) {
      console.print("vtr-manifest: " + value.error().description());
      return kExitBadInput;
    }
    records = PlistNode(Value::DictionaryOf({{*options.path, *value}}));
  }
  if (options.format == ShowFormat::kXml) {
    // XML is written whole, so the manifest is built whole for it.
    Result<Value> manifest = records.value();
    Result<std::string> xml = manifest.ok() ? EncodeXmlPropertyList(*manifest) : Result<std::string>(manifest.error());
    if (!xml.ok()) {
      console.print("vtr-manifest: cannot show the manifest as XML: " + xml.error().description());
      return kExitBadInput;
    }
    std::fputs(xml->c_str(), out);
  } else if (!PrintEntries(records, options.format, out)) {
    console.print("vtr-manifest: a record of the manifest is too large to build");
    return kExitBadInput;
  }
  return std::fflush(out) == 0 ? kExitOk : kExitIoError;
}

}  // namespace vtr::manifest_tool
