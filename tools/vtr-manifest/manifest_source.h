// Finding the manifest a file holds: a manifest file itself, or a manifest
// inside the payload of a signed manifest.
#ifndef VTR_TOOLS_VTR_MANIFEST_MANIFEST_SOURCE_H_
#define VTR_TOOLS_VTR_MANIFEST_MANIFEST_SOURCE_H_

#include "platform/result.h"
#include "platform/value.h"
#include "tools/vtr-manifest/commands.h"

namespace vtr::manifest_tool {

// The manifest dictionary selection names. A file whose top dictionary holds
// "Payload" data beside "Certificate" or "Signature" is a signed manifest:
// its payload is read and its "Backup" manifest taken, or with a container,
// that container's manifest ("AppData" entries hold it under "Manifest",
// "GroupData" and "ExtensionData" entries directly). The signature is not
// checked: this is for looking at a manifest, not for trusting it. Fails
// when the file cannot be read or holds no such manifest.
Result<Value> LoadManifest(const ManifestSelection& selection);

}  // namespace vtr::manifest_tool

#endif  // VTR_TOOLS_VTR_MANIFEST_MANIFEST_SOURCE_H_
