// vtr-manifest show: a manifest as text, JSON or XML.
#include "platform/plist.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/manifest_render.h"
#include "tools/vtr-manifest/manifest_source.h"

namespace vtr::manifest_tool {
namespace {

using Json = nlohmann::json;

std::string JsonText(const Json& json) { return json.dump(-1, ' ', false, Json::error_handler_t::replace); }

// One entry per line inside one object, so that a manifest of a whole
// device is never held as JSON all at once.
void PrintJson(const Dictionary& entries, FILE* out) {
  std::fputs("{", out);
  bool first = true;
  for (const auto& [path, record] : entries) {
    std::fprintf(out, "%s\n  %s: %s", first ? "" : ",", JsonText(Json(path)).c_str(), JsonText(ToJson(record)).c_str());
    first = false;
  }
  std::fputs(first ? "}\n" : "\n}\n", out);
}

}  // namespace

int RunShow(const ShowOptions& options, FILE* out, Console& console) {
  Result<Value> manifest = LoadManifest(options.manifest);
  if (!manifest.ok()) {
    console.write("vtr-manifest: " + manifest.error().description());
    return kExitError;
  }
  if (options.path) {
    const Value* record = manifest->dictionary()->find(*options.path);
    if (record == nullptr) {
      console.write("vtr-manifest: the manifest has no entry " + *options.path);
      return kExitFailure;
    }
    *manifest = Value::DictionaryOf({{*options.path, *record}});
  }
  const Dictionary& entries = *manifest->dictionary();
  switch (options.format) {
    case ShowFormat::kText:
      for (const auto& [path, record] : entries) std::fprintf(out, "%s\n", RecordLine(path, record).c_str());
      break;
    case ShowFormat::kJson:
      PrintJson(entries, out);
      break;
    case ShowFormat::kXml: {
      Result<std::string> xml = EncodeXmlPropertyList(*manifest);
      if (!xml.ok()) {
        console.write("vtr-manifest: cannot show the manifest as XML: " + xml.error().description());
        return kExitError;
      }
      std::fputs(xml->c_str(), out);
      break;
    }
  }
  return std::fflush(out) == 0 ? kExitOk : kExitError;
}

}  // namespace vtr::manifest_tool
