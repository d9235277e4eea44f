// Attribute restoration: the records of a verified signed manifest laid onto
// the content the unprivileged daemon put down.
#include <fcntl.h>
#include <unistd.h>

#include <cstring>
#include <thread>

#include "model/log.h"
#include "model/signed_manifest.h"
#include "platform/accounts.h"
#include "platform/open_beneath.h"
#include "platform/read_fully.h"
#include "vitd_helper/failure_journal.h"
#include "vitd_helper/operations.h"
#include "vitd_helper/restore_workers.h"

namespace vtr {
namespace {

// Largest signed manifest read. The file is held whole while its records are
// read from it in place, so it is what a restore's memory grows with: at
// 44 MiB (about 120,000 records of a binary manifest, at some 360 bytes
// each) the helper stays within 64 MiB plus 500 bytes per record whatever
// the file holds (a hostile file of tiny objects costs a byte more per
// object). An XML file is built whole, at about 3.5 times its size, so
// its limit is lower. A larger file is refused before its bytes are read.
constexpr size_t kMaxBinaryManifestBytes = size_t{44} << 20;
constexpr size_t kMaxXmlManifestBytes = size_t{12} << 20;
constexpr char kBinaryPlistMagic[] = "bplist";

// The limit for the manifest open as fd, by the format its first bytes
// announce.
size_t ManifestLimit(int fd) {
  char magic[sizeof kBinaryPlistMagic - 1] = {};
  const bool binary = ::pread(fd, magic, sizeof magic, 0) == static_cast<ssize_t>(sizeof magic) &&
                      std::memcmp(magic, kBinaryPlistMagic, sizeof magic) == 0;
  return binary ? kMaxBinaryManifestBytes : kMaxXmlManifestBytes;
}

// The file manifest the container type and identifier select, or nullopt
// after the message saying why not.
std::optional<PlistNode> ChooseManifest(const VTRSignedManifest& signedManifest,
                                        const std::optional<std::string>& containerType,
                                        const std::optional<std::string>& identifier) {
  if (!containerType || !identifier) return signedManifest.getManifest();
  const std::string& type = *containerType;
  const std::string& id = *identifier;
  if (type == "AppData" && signedManifest.getAppDataList().get(id).isNil()) {
    VTRLogError("Couldn't load container data for %@/%@", type, id);
    return std::nullopt;
  }
  const PlistNode chosen = signedManifest.containerManifest(type, id);
  if (chosen.isNil()) {
    VTRLogError("Couldn't load manifest dict for %@/%@", type, id);
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
  Result<std::string> bytes = file.ok() ? ReadRegularFile(file->get(), ManifestLimit(file->get()))
                                      : Result<std::string>(file.error());
  if (!bytes.ok()) {
    VTRLogError("Cannot open manifest file.");
    JournalFailure("Cannot read the signed manifest", manifestPath,
                   file.ok() ? bytes.error() : file.error());
    return false;
  }
  SigningAnchors anchors{paths_.productionAnchors, paths_.testAnchors, paths_.efiVariables, resolver_.root()};
  // The manifest keeps the bytes and reads its records from them one at a
  // time: a whole device's manifest is never built in memory.
  std::optional<VTRSignedManifest> signedManifest =
      VTRSignedManifest::signedManifestWithBytes(std::move(*bytes), anchors);
  if (!signedManifest) return false;

  std::optional<PlistNode> chosen = ChooseManifest(*signedManifest, containerType, identifier);
  if (!chosen) return false;
  if (!chosen->isDictionary()) {
    VTRLogError("Couldn't get manifest.");
    return false;
  }
  if (chosen->count() == 0) return true;  // nothing to restore touches nothing

  // The staging root is a client path; it is changed with all below it.
  std::optional<CheckedPath> staging = checkClientPath(root, ClientUse::kChange);
  if (!staging) return false;
  Result<UniqueFd> stagingDir = resolver_.openDirectory(*staging);
  if (!stagingDir.ok()) {
    LogRefusal(root, stagingDir.error());
    return false;
  }
  // Records are built here one at a time, in the order the manifest keeps
  // them, and laid down by workers on every core.
  // What is more than mobile's own is granted only after a check; without
  // a mobile account, everything is.
  const std::shared_ptr<const AccountDatabase> accounts = AccountDatabase::Shared();
  const ClientAccount client{accounts->userId(paths_.mobileAccount).value_or(static_cast<uid_t>(-1)),
                             accounts->groupId(paths_.mobileAccount).value_or(static_cast<gid_t>(-1))};
  RestoreWorkers workers(stagingDir->get(), root, client, std::thread::hardware_concurrency());
  bool built = true;
  chosen->forEachEntry([&](const std::string& key, const PlistNode& node) {
    Result<Value> record = node.value();
    built = record.ok();
    return built && workers.add(key, std::move(*record));
  });
  if (!built) JournalFailure("Cannot read a record of the signed manifest", manifestPath, Error(EINVAL, ""));
  return workers.finish() && built;
}

}  // namespace vtr
