// vtr-manifest verify: a signed manifest checked as the helper checks it.
#include <nlohmann/json.hpp>

#include <cstring>
#include <string>

#include "platform/device_properties.h"
#include "platform/trust_policy.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/manifest_render.h"
#include "tools/vtr-manifest/manifest_source.h"

namespace vtr::manifest_tool {
namespace {

// Whether the trust anchors the check consults can be used: the production
// folder, and on a device that says it is not fused the test folder, which
// the check falls back to. A folder missing, unreadable or without a
// certificate is no reason to call a manifest untrusted; it is said as such.
bool AnchorsUsable(const SigningAnchors& anchors, Console& console) {
  std::vector<std::string> folders = {anchors.production};
  if (SigningFuse(anchors.efiVariables, anchors.rootFd) == false) folders.push_back(anchors.test);
  std::vector<std::string> problems;
  for (const std::string& folder : folders) {
    Result<TrustPolicy> policy = TrustPolicy::Create(folder, anchors.rootFd);
    if (policy.ok()) return true;
    // An error that names the folder itself says the rest; one that names
    // a folder above it (missing, a link) says which, with the reason.
    const Error& error = policy.error();
    std::string why = error.message();
    if (why == folder) {
      why = std::strerror(error.code());
    } else if (why.starts_with(folder + " ")) {
      why.erase(0, folder.size() + 1);
    } else {
      why = error.description();
    }
    problems.push_back("vtr-manifest: trust anchors folder " + EscapedText(folder) + ": " + why);
  }
  for (const std::string& problem : problems) console.print(problem);
  return false;
}

}  // namespace

int RunVerify(const VerifyOptions& options, FILE* out, Console& console) {
  Result<std::string> bytes = ReadWholeFile(options.file);
  if (!bytes.ok()) {
    console.print("vtr-manifest: " + bytes.error().description());
    return ExitStatusOfLoad(bytes.error());
  }
  if (!AnchorsUsable(options.anchors, console)) return kExitNoInput;
  // The helper's own messages reach the console through the log only with
  // --verbose; the verdict below says the cause in the tool's words.
  SignedManifestFailure failure = SignedManifestFailure::kNone;
  std::optional<VTRSignedManifest> manifest =
      VTRSignedManifest::signedManifestWithBytes(std::move(*bytes), options.anchors, &failure);
  // The verdict as JSON, for scripts: trusted or the cause.
  auto printJson = [&](const char* cause) {
    nlohmann::json verdict = {{"file", options.file}, {"trusted", manifest.has_value()}, {"cause", nullptr}};
    if (manifest) {
      verdict["payloadVersion"] = manifest->getVersion();
      verdict["records"] = manifest->getManifest().count();
    } else {
      verdict["cause"] = cause;
    }
    std::fprintf(out, "%s\n", verdict.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace).c_str());
  };
  if (manifest) {
    if (options.json) {
      printJson(nullptr);
    } else {
      std::fprintf(out, "%s: trusted and well signed; payload version %d, %llu records in \"Backup\"\n",
                   options.file.c_str(), manifest->getVersion(),
                   static_cast<unsigned long long>(manifest->getManifest().count()));
    }
    return std::fflush(out) == 0 ? kExitOk : kExitIoError;
  }
  // The cause in the tool's words too: a bad signature is only a debug
  // trace in the helper's log.
  const struct {
    SignedManifestFailure failure;
    int status;
    const char* why;
  } kCauses[] = {
      {SignedManifestFailure::kUnsupportedVersion, kExitUnsupportedVersion, "its version is not supported"},
      {SignedManifestFailure::kNotTrusted, kExitNotTrusted, "no trusted root vouches for its certificates"},
      {SignedManifestFailure::kBadSignature, kExitBadSignature, "the signature does not sign the payload"},
  };
  for (const auto& cause : kCauses) {
    if (cause.failure == failure) {
      console.print("vtr-manifest: " + options.file + " is not trusted: " + cause.why);
      if (options.json) printJson(cause.why);
      return cause.status;
    }
  }
  console.print("vtr-manifest: " + options.file + " is not a well-formed signed manifest");
  if (options.json) printJson("it is not a well-formed signed manifest");
  return kExitMalformed;
}

}  // namespace vtr::manifest_tool
