// Attribute restoration: the records of a verified signed manifest laid onto
// the content the unprivileged daemon put down.
#include <fcntl.h>
#include <sys/stat.h>

#include "model/file_metadata.h"
#include "model/log.h"
#include "model/signed_manifest.h"
#include "platform/open_beneath.h"
#include "platform/paths.h"
#include "platform/read_fully.h"
#include "vitd_helper/operations.h"

namespace vtr {
namespace {

// Largest signed manifest read: a whole device's records with room to spare.
constexpr size_t kMaxSignedManifestBytes = size_t{512} << 20;

// The file manifest the container type and identifier select, or nullopt
// after the message saying why not.
std::optional<Value> ChooseManifest(const VTRSignedManifest& signedManifest,
                                    const std::optional<std::string>& containerType,
                                    const std::optional<std::string>& identifier) {
  if (!containerType || !identifier) return signedManifest.getManifest();
  const std::string& type = *containerType;
  const std::string& id = *identifier;
  Value chosen;
  if (type == "AppData") {
    const Value container = signedManifest.getAppDataList().get(id);
    if (container.isNil()) {
      VTRLog("Couldn't load container data for %@/%@", type, id);
      return std::nullopt;
    }
    chosen = container.get("Manifest");
  } else if (type == "GroupData") {
    chosen = signedManifest.getGroupDataList().get(id);
  } else if (type == "ExtensionData") {
    chosen = signedManifest.getPlugInDataList().get(id);
  }
  if (chosen.isNil()) {
    VTRLog("Couldn't load manifest dict for %@/%@", type, id);
    return std::nullopt;
  }
  return chosen;
}

}  // namespace

bool VTRHOperations::restoreAttributesUnder(const std::string& root, const std::string& manifestPath,
                                            const std::optional<std::string>& containerType,
                                            const std::optional<std::string>& identifier) {
  VTRLog("Loading signed manifest.");
  std::optional<CheckedPath> manifestFile = checkClientPath(manifestPath, ClientUse::kScan);
  if (!manifestFile) return false;
  Result<UniqueFd> folder = resolver_.openParent(*manifestFile);
  Result<UniqueFd> file = folder.ok() ? OpenEntryNoFollow(folder->get(), manifestFile->name(), O_RDONLY, manifestPath)
                                      : Result<UniqueFd>(folder.error());
  struct stat st;
  Result<std::string> bytes = Error(EINVAL, manifestPath);
  if (file.ok() && ::fstat(file->get(), &st) == 0 && S_ISREG(st.st_mode)) {
    bytes = ReadFully(file->get(), kMaxSignedManifestBytes);
  }
  if (!bytes.ok()) {
    VTRLog("Cannot open manifest file.");
    return false;
  }
  SigningAnchors anchors{paths_.productionAnchors, paths_.testAnchors, paths_.efiVariables, resolver_.root()};
  const std::span<const uint8_t> content(reinterpret_cast<const uint8_t*>(bytes->data()), bytes->size());
  std::optional<VTRSignedManifest> signedManifest = VTRSignedManifest::signedManifestWithBytes(content, anchors);
  bytes = std::string();
  if (!signedManifest) return false;

  std::optional<Value> chosen = ChooseManifest(*signedManifest, containerType, identifier);
  if (!chosen) return false;
  const Dictionary* records = chosen->dictionary();
  if (records == nullptr) {
    VTRLog("Couldn't get manifest.");
    return false;
  }
  if (records->empty()) return true;  // nothing to restore touches nothing

  // The staging root is a client path; it is changed with all below it.
  std::optional<CheckedPath> staging = checkClientPath(root, ClientUse::kChange);
  if (!staging) return false;
  Result<UniqueFd> stagingDir = resolver_.openDirectory(*staging);
  if (!stagingDir.ok()) {
    LogRefusal(root, stagingDir.error());
    return false;
  }
  for (const auto& [key, value] : *records) {
    if (value.dictionary() == nullptr) return false;
    const VTRFileMetadata record(value);
    const std::string target = AppendPathComponent(root, key);
    // The record's own path, beneath the staging root: no "..", no link on
    // the way; "/" is the root itself.
    Result<std::vector<std::string>> components = SplitPathComponents("/" + key);
    Result<UniqueFd> parent = components.ok() ? OpenDirectoryBeneath(stagingDir->get(), *components,
                                                                     components->empty() ? 0 : components->size() - 1)
                                              : Result<UniqueFd>(components.error());
    if (!parent.ok()) {
      LogRefusal(target, parent.error());
      return false;
    }
    const std::string name = components->empty() ? "." : components->back();
    if (!record.restoreAttribuesToItemAt(parent->get(), name, target)) return false;
  }
  return true;
}

}  // namespace vtr
