// vtr-manifest sign: a signed manifest made of manifest files.
#include <cerrno>
#include <cstdio>

#include "platform/plist.h"
#include "platform/signing_files.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/manifest_source.h"

namespace vtr::manifest_tool {
namespace {

// The manifest dictionary in the file at path.
Result<Value> ReadManifest(const std::string& path) {
  Result<Value> manifest = ReadPropertyListFile(path);
  if (!manifest.ok()) return manifest.error();
  if (manifest->dictionary() == nullptr) return Error::Invalid(path + " does not hold a manifest dictionary");
  if (manifest->get("Payload").data() != nullptr) {
    return Error::Invalid(path + " is a signed manifest; sign the manifests it was made of");
  }
  return manifest;
}

// {identifier: manifest} of a container list; with wrap, each manifest sits
// under "Manifest" (application data) rather than directly.
Result<Value> ContainerList(const std::vector<std::pair<std::string, std::string>>& containers, bool wrap) {
  DictionaryBuilder list;
  for (const auto& [identifier, path] : containers) {
    Result<Value> manifest = ReadManifest(path);
    if (!manifest.ok()) return manifest.error();
    list.add(identifier, wrap ? Value::DictionaryOf({{"Manifest", *manifest}}) : *manifest);
  }
  std::optional<Value> built = list.buildUnique();
  if (!built) return Error::Invalid("a container identifier is given twice");
  return *built;
}

Result<Value> BuildPayload(const SignOptions& options) {
  Result<Value> backup = ReadManifest(options.manifest);
  if (!backup.ok()) return backup.error();
  Result<Value> appData = ContainerList(options.appData, true);
  if (!appData.ok()) return appData.error();
  Array apps;
  for (const auto& [identifier, path] : options.appData) apps.push_back(Value::String(identifier));
  DictionaryBuilder payload;
  payload.add("Version", Value::Integer(options.payloadVersion));
  payload.add("Info", Value::DictionaryOf({{"Description", Value::String(options.info)}}));
  payload.add("Backup", *backup);
  payload.add("App", Value::ArrayOf(std::move(apps)));
  payload.add("AppData", *appData);
  // The optional lists stand only where they hold something.
  const struct {
    const char* key;
    const std::vector<std::pair<std::string, std::string>>& containers;
  } lists[] = {{"GroupData", options.groupData}, {"ExtensionData", options.extensionData}};
  for (const auto& list : lists) {
    if (list.containers.empty()) continue;
    Result<Value> built = ContainerList(list.containers, false);
    if (!built.ok()) return built.error();
    payload.add(list.key, *built);
  }
  return payload.build();
}

Result<Bytes> Encode(const Value& value, bool xml) {
  if (!xml) return EncodeBinaryPropertyList(value);
  Result<std::string> text = EncodeXmlPropertyList(value);
  if (!text.ok()) return text.error();
  return Bytes(text->begin(), text->end());
}

Status Sign(const SignOptions& options) {
  Result<PublicKey> key = ReadPrivateKeyFile(options.key);
  if (!key.ok()) return key.error();
  Array certificates;
  for (const std::string& path : options.certificates) {
    Result<Bytes> der = ReadCertificateFile(path);
    if (!der.ok()) return der.error();
    certificates.push_back(Value::Data(std::move(*der)));
  }
  // A signature the signer's certificate cannot verify would make a file
  // no one can trust.
  Result<bool> matches = KeyMatchesCertificate(key->get(), *certificates.front().data());
  if (!matches.ok()) return matches.error();
  if (!*matches) {
    return Error::Invalid("the key " + options.key + " does not belong to the certificate " +
                          options.certificates.front() + " (the signer's, given first)");
  }
  Result<Value> payload = BuildPayload(options);
  if (!payload.ok()) return payload.error();
  Result<Bytes> payloadBytes = Encode(*payload, options.xml);
  if (!payloadBytes.ok()) return payloadBytes.error();
  Result<Bytes> signature = SignRsaSha1(key->get(), *payloadBytes);
  if (!signature.ok()) return signature.error();
  const Value file = Value::DictionaryOf({{"Version", Value::Integer(2)},
                                          {"Certificate", Value::ArrayOf(std::move(certificates))},
                                          {"Payload", Value::Data(std::move(*payloadBytes))},
                                          {"Signature", Value::Data(std::move(*signature))}});
  if (options.output != "-") {
    return WritePropertyListFile(options.output, file, options.xml ? PlistFormat::kXml : PlistFormat::kBinary);
  }
  Result<Bytes> bytes = Encode(file, options.xml);
  if (!bytes.ok()) return bytes.error();
  if (std::fwrite(bytes->data(), 1, bytes->size(), stdout) != bytes->size() || std::fflush(stdout) != 0) {
    return Error(EIO, "writing the signed manifest to standard output");
  }
  return Status::Ok();
}

}  // namespace

int RunSign(const SignOptions& options, Console& console) {
  if (Status signed_ = Sign(options); !signed_.ok()) {
    console.print("vtr-manifest: " + signed_.error().description());
    return signed_.error().code() == EIO ? kExitIoError : ExitStatusOfLoad(signed_.error());
  }
  return kExitOk;
}

}  // namespace vtr::manifest_tool
