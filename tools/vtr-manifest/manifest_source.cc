#include "tools/vtr-manifest/manifest_source.h"

#include <fcntl.h>
#include <sys/stat.h>

#include "platform/read_fully.h"
#include "platform/unique_fd.h"

namespace vtr::manifest_tool {
namespace {

// Largest file read: far above a whole device's manifest.
constexpr size_t kMaxFileBytes = size_t{2} << 30;

// The manifest of a container in a signed manifest, looked for in
// "AppData", then "GroupData" and "ExtensionData"; nil when none holds it.
PlistNode ContainerManifest(const VTRSignedManifest& manifest, const std::string& container) {
  for (const char* type : {"AppData", "GroupData", "ExtensionData"}) {
    const PlistNode found = manifest.containerManifest(type, container);
    if (found.isDictionary()) return found;
  }
  return PlistNode();
}

}  // namespace

Result<std::string> ReadWholeFile(const std::string& path) { return ReadFileNamed(path, kMaxFileBytes); }

Result<std::unique_ptr<ManifestSource>> ManifestSource::Load(const ManifestSelection& selection) {
  const std::string& file = selection.file;
  std::unique_ptr<ManifestSource> source(new ManifestSource());
  Result<std::string> bytes = ReadWholeFile(file);
  if (!bytes.ok()) return bytes.error();
  source->bytes_ = std::move(*bytes);
  const std::span<const uint8_t> span(reinterpret_cast<const uint8_t*>(source->bytes_.data()),
                                      source->bytes_.size());
  Result<std::unique_ptr<PlistDocument>> document = PlistDocument::Open(span);
  if (!document.ok()) return Error::Invalid(file + ": " + document.error().message());
  source->document_ = std::move(*document);
  const PlistNode top = source->document_->top();
  if (!VTRSignedManifest::LooksSigned(top)) {
    if (selection.container) return Error::Invalid(file + " is not a signed manifest");
    if (!top.isDictionary()) return Error::Invalid(file + " does not hold a dictionary");
    // A manifest maps paths to records; anything else is some other list.
    for (uint64_t i = 0; i < top.count(); ++i) {
      if (!top.valueAt(i).isDictionary() || !top.keyAt(i).starts_with('/')) {
        return Error::Invalid(file + " is not a manifest: its entry \"" + top.keyAt(i) +
                              "\" is not a path with its record");
      }
    }
    source->records_ = top;
    return source;
  }
  // The signed manifest reads the bytes again, as its own.
  source->document_.reset();
  source->signed_ = VTRSignedManifest::unverifiedManifestWithBytes(std::move(source->bytes_));
  if (!source->signed_) return Error::Invalid(file + " is not a signed manifest this tool can read");
  if (selection.container) {
    source->records_ = ContainerManifest(*source->signed_, *selection.container);
    if (source->records_.isNil()) {
      return Error::Invalid("the signed manifest holds no manifest for container " + *selection.container);
    }
  } else {
    source->records_ = source->signed_->getManifest();
    if (!source->records_.isDictionary()) {
      return Error::Invalid("the payload of " + file + " has no \"Backup\" manifest");
    }
  }
  return source;
}

int ExitStatusOfLoad(const Error& error) {
  return error.code() == ENOENT || error.code() == EACCES || error.code() == ENOTDIR ? kExitNoInput : kExitBadInput;
}

}  // namespace vtr::manifest_tool
