// Finding the manifest a file holds: a manifest file itself, or a manifest
// inside the payload of a signed manifest. The records are read in place
// from the file's bytes (see PlistDocument), one at a time, so looking at a
// whole device's manifest costs little more than its file.
#ifndef VTR_TOOLS_VTR_MANIFEST_MANIFEST_SOURCE_H_
#define VTR_TOOLS_VTR_MANIFEST_MANIFEST_SOURCE_H_

#include <memory>
#include <optional>
#include <string>

#include "model/signed_manifest.h"
#include "platform/plist_document.h"
#include "platform/result.h"
#include "tools/vtr-manifest/commands.h"

namespace vtr::manifest_tool {

// Everything a file's bytes hold, with the records that were asked for.
class ManifestSource {
 public:
  // The manifest dictionary selection names. A file whose top dictionary
  // holds "Payload" data beside "Certificate" or "Signature" is a signed
  // manifest, read with the checks of form the helper makes (their messages
  // go to the log) but not the signature's: this is for looking at a
  // manifest, not for trusting it. Its "Backup" manifest is taken, or with
  // a container, that container's ("AppData" entries hold it under
  // "Manifest", "GroupData" and "ExtensionData" entries directly). Fails
  // when the file cannot be read or holds no such manifest.
  static Result<std::unique_ptr<ManifestSource>> Load(const ManifestSelection& selection);

  // The chosen manifest: a dictionary of path to record.
  const PlistNode& records() const { return records_; }
  // The signed manifest around it, when the file is one.
  const VTRSignedManifest* signedManifest() const { return signed_ ? &*signed_ : nullptr; }

 private:
  ManifestSource() = default;

  std::string bytes_;
  std::unique_ptr<PlistDocument> document_;
  std::optional<VTRSignedManifest> signed_;
  PlistNode records_;
};

// The whole bytes of the file at path (links followed, as a tool does).
Result<std::string> ReadWholeFile(const std::string& path);

// The exit status for a failed Load: the file is missing or unreadable, or it
// is no manifest.
int ExitStatusOfLoad(const Error& error);

}  // namespace vtr::manifest_tool

#endif  // VTR_TOOLS_VTR_MANIFEST_MANIFEST_SOURCE_H_
