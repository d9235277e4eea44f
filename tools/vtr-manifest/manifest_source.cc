#include "tools/vtr-manifest/manifest_source.h"

#include "platform/plist.h"

namespace vtr::manifest_tool {
namespace {

bool IsSignedManifest(const Value& top) {
  const Dictionary* dictionary = top.dictionary();
  return dictionary != nullptr && top.get("Payload").data() != nullptr &&
         (dictionary->contains("Certificate") || dictionary->contains("Signature"));
}

Result<Value> ContainerManifest(const Value& payload, const std::string& container) {
  const Value apps = payload.get("AppData");
  const Value* app = apps.dictionary() != nullptr ? apps.dictionary()->find(container) : nullptr;
  if (app != nullptr && app->get("Manifest").dictionary() != nullptr) return app->get("Manifest");
  for (const char* list : {"GroupData", "ExtensionData"}) {
    const Dictionary* containers = payload.get(list).dictionary();
    const Value* manifest = containers != nullptr ? containers->find(container) : nullptr;
    if (manifest != nullptr && manifest->dictionary() != nullptr) return *manifest;
  }
  return Error::Invalid("the signed manifest holds no manifest for container " + container);
}

}  // namespace

Result<Value> LoadManifest(const ManifestSelection& selection) {
  Result<Value> top = ReadPropertyListFile(selection.file);
  if (!top.ok()) return top.error();
  if (!IsSignedManifest(*top)) {
    if (selection.container) return Error::Invalid(selection.file + " is not a signed manifest");
    if (top->dictionary() == nullptr) return Error::Invalid(selection.file + " does not hold a dictionary");
    return std::move(*top);
  }
  Result<Value> payload = ReadPropertyList(*top->get("Payload").data());
  if (!payload.ok()) return Error::Invalid("the payload of " + selection.file + ": " + payload.error().description());
  if (selection.container) return ContainerManifest(*payload, *selection.container);
  Value backup = payload->get("Backup");
  if (backup.dictionary() == nullptr) {
    return Error::Invalid("the payload of " + selection.file + " has no \"Backup\" manifest");
  }
  return backup;
}

}  // namespace vtr::manifest_tool
