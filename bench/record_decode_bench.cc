// How long reading a signed manifest in place takes, step by step: opening
// it (the whole file checked, the signature not), then building every record
// of its "Backup" once, then building each again and taking the attributes
// a restore may set (no file is touched).
//
//   record_decode_bench FILE
#include <fcntl.h>

#include <chrono>
#include <cstdio>

#include "model/file_metadata.h"
#include "model/signed_manifest.h"
#include "platform/plist_document.h"
#include "platform/read_fully.h"
#include "platform/unique_fd.h"

using namespace vtr;
using Clock = std::chrono::steady_clock;

static double Since(Clock::time_point start) {
  return std::chrono::duration<double>(Clock::now() - start).count();
}

int main(int argc, char** argv) {
  if (argc != 2) {
    std::fprintf(stderr, "usage: record_decode_bench FILE\n");
    return 64;
  }
  UniqueFd fd(::open(argv[1], O_RDONLY | O_CLOEXEC));
  Result<std::string> bytes = fd ? ReadFully(fd.get(), size_t{2} << 30) : Result<std::string>(Error::FromErrno(argv[1]));
  if (!bytes.ok()) {
    std::fprintf(stderr, "%s\n", bytes.error().description().c_str());
    return 2;
  }
  Clock::time_point start = Clock::now();
  std::optional<VTRSignedManifest> manifest = VTRSignedManifest::unverifiedManifestWithBytes(std::move(*bytes));
  if (!manifest) return 2;
  const PlistNode records = manifest->getManifest();
  std::printf("open and check:   %.3f s (%llu records)\n", Since(start), static_cast<unsigned long long>(records.count()));
  start = Clock::now();
  size_t keys = 0;
  records.forEachEntry([&](const std::string& key, const PlistNode& node) {
    keys += key.size() + static_cast<size_t>(node.value().ok());
    return true;
  });
  std::printf("build each record: %.3f s\n", Since(start));
  start = Clock::now();
  size_t allowed = 0;
  records.forEachEntry([&](const std::string&, const PlistNode& node) {
    const VTRFileMetadata record(*node.value());
    if (const Dictionary* attributes = record.getFileAttributes()) {
      allowed += VTRFileMetadata::fileAttributesAllowSet(*attributes).size();
    }
    return true;
  });
  std::printf("build + filter:   %.3f s (%zu, %zu)\n", Since(start), keys, allowed);
  return 0;
}
