// vtr-manifest inspect: the outer fields of a signed manifest and a summary
// of its payload.
#include "platform/signing_files.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/manifest_render.h"
#include "tools/vtr-manifest/manifest_source.h"

namespace vtr::manifest_tool {
namespace {

using Json = nlohmann::json;

// {identifier: record count} of a container list; wrapped lists hold each
// manifest under "Manifest".
Json ContainerCounts(const PlistNode& list, bool wrapped) {
  Json counts = Json::object();
  list.forEachEntry([&](const std::string& identifier, const PlistNode& container) {
    counts[identifier] = (wrapped ? container.get("Manifest") : container).count();
    return true;
  });
  return counts;
}

Json Describe(const VTRSignedManifest& manifest) {
  Json certificates = Json::array();
  if (const Array* chain = manifest.certificates().array()) {
    for (const Value& item : *chain) {
      const Bytes* der = item.data();
      Result<CertificateSummary> summary = der ? DescribeCertificate(*der) : Error::Invalid("not data");
      if (!summary.ok()) {
        certificates.push_back({{"error", summary.error().message()}});
        continue;
      }
      certificates.push_back({{"subject", summary->subject},
                              {"issuer", summary->issuer},
                              {"notBefore", summary->notBefore},
                              {"notAfter", summary->notAfter},
                              {"serial", summary->serial}});
    }
  }
  Result<Value> info = manifest.getInfo().value();
  Json payload = {
      {"format", manifest.payloadFormat() == PlistFormat::kBinary ? "binary" : "xml"},
      {"bytes", manifest.payloadSize()},
      {"version", manifest.getVersion()},
      {"info", info.ok() ? ToJson(*info) : Json()},
      {"records", manifest.getManifest().count()},
      {"apps", manifest.getAppList().count()},
      {"appData", ContainerCounts(manifest.getAppDataList(), true)},
      {"groupData", ContainerCounts(manifest.getGroupDataList(), false)},
      {"extensionData", ContainerCounts(manifest.getPlugInDataList(), false)},
  };
  return {{"version", ToJson(manifest.outerVersion())}, {"certificates", certificates}, {"payload", payload}};
}

void PrintText(const Json& d, FILE* out) {
  std::fprintf(out, "version: %s\n", d["version"].dump().c_str());
  size_t i = 0;
  for (const Json& c : d["certificates"]) {
    if (c.contains("error")) {
      std::fprintf(out, "certificate %zu: unreadable (%s)\n", i++, c["error"].get<std::string>().c_str());
      continue;
    }
    std::fprintf(out, "certificate %zu: %s\n  issuer: %s\n  valid: %s to %s\n  serial: %s\n", i++,
                 c["subject"].get<std::string>().c_str(), c["issuer"].get<std::string>().c_str(),
                 c["notBefore"].get<std::string>().c_str(), c["notAfter"].get<std::string>().c_str(),
                 c["serial"].get<std::string>().c_str());
  }
  const Json& p = d["payload"];
  std::fprintf(out, "payload: %s, %s bytes, version %s\n  info: %s\n  records (Backup): %s\n  apps: %s\n",
               p["format"].get<std::string>().c_str(), p["bytes"].dump().c_str(), p["version"].dump().c_str(),
               p["info"].dump().c_str(), p["records"].dump().c_str(), p["apps"].dump().c_str());
  for (const char* list : {"appData", "groupData", "extensionData"}) {
    for (const auto& [identifier, count] : p[list].items()) {
      std::fprintf(out, "  %s %s: %s records\n", list, EscapedText(identifier).c_str(), count.dump().c_str());
    }
  }
}

}  // namespace

int RunInspect(const InspectOptions& options, FILE* out, Console& console) {
  Result<std::string> bytes = ReadWholeFile(options.file);
  if (!bytes.ok()) {
    console.print("vtr-manifest: " + bytes.error().description());
    return ExitStatusOfLoad(bytes.error());
  }
  std::optional<VTRSignedManifest> manifest = VTRSignedManifest::unverifiedManifestWithBytes(std::move(*bytes));
  if (!manifest) {
    console.print("vtr-manifest: " + options.file + " is not a signed manifest this tool can read");
    return kExitBadInput;
  }
  const Json description = Describe(*manifest);
  if (options.json) {
    std::fprintf(out, "%s\n", description.dump(2, ' ', false, Json::error_handler_t::replace).c_str());
  } else {
    PrintText(description, out);
  }
  return std::fflush(out) == 0 ? kExitOk : kExitIoError;
}

}  // namespace vtr::manifest_tool
