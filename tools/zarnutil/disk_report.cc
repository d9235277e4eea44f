#include "tools/zarnutil/disk_report.h"

#include <fcntl.h>

#include <cstdio>
#include <optional>
#include <string>

#include "platform/block_geometry.h"
#include "platform/format.h"
#include "platform/unique_fd.h"
#include "storage/file_system_resize.h"
#include "storage/gpt_disk.h"
#include "storage/mount_table.h"
#include "tools/zarnutil/report_format.h"

namespace vtr {
namespace {

struct DataMount {
  MountEntry mount;
  MountedFileSystem fileSystem;
};

// The file system mounted from the partition whose GPT entry has uuid.
std::optional<DataMount> MountOf(const std::string& uuid) {
  UniqueFd proc(::open("/proc", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  Result<std::vector<MountEntry>> mounts = proc ? ReadMountTable(proc.get()) : Error(ENOENT, "/proc");
  if (!mounts.ok()) return std::nullopt;
  for (const auto& [mount, found] : PartitionMounts(*mounts)) {
    if (!found.ok() || *found != uuid) continue;
    Result<MountedFileSystem> fs = DescribeMountedFileSystem(mount.mountPoint, mount.source);
    return DataMount{mount, fs.ok() ? *fs : MountedFileSystem{"unknown", 0}};
  }
  return std::nullopt;
}

}  // namespace

int RunDisk(const ZarnutilInvocation& call) {
  UniqueFd fd(::open(call.image.c_str(), O_RDONLY | O_CLOEXEC));
  Result<uint32_t> blockSize = fd ? BlockSizeOf(fd.get(), call.imageBlockSize) : Error::FromErrno(call.image);
  Result<uint64_t> blockCount = blockSize.ok() ? BlockCountOf(fd.get(), call.imageBlockSize) : blockSize.error();
  Result<bool> signature = blockCount.ok() ? ReadZarnSignature(fd.get(), *blockSize) : blockCount.error();
  Result<GptImage> gpt = signature.ok() ? ReadGptImage(fd.get(), *blockSize) : signature.error();
  Result<GptValidity> validity = gpt.ok() ? CheckGpt(fd.get(), *blockSize, *blockCount) : gpt.error();
  if (!validity.ok()) {
    std::fprintf(stderr, "zarnutil: %s: %s\n", call.image.c_str(), validity.error().description().c_str());
    return 1;
  }
  const uint32_t count = std::min<uint32_t>(gpt->entryCount(), kGptTableEntries);
  const int data = gpt->positionOf("Data");
  const uint64_t usable = gpt->lastUsableLba() - gpt->firstUsableLba() + 1;
  uint64_t used = 0;
  for (uint32_t i = 0; i < count; ++i) used += gpt->lastLba(i) - gpt->firstLba(i) + 1;
  const uint64_t freeBlocks = used <= usable ? usable - used : 0;
  const std::optional<DataMount> mounted = data >= 0 ? MountOf(gpt->uuidOf(static_cast<uint32_t>(data))) : std::nullopt;

  std::string out;
  if (call.has("--json")) {
    Json entries = Json::array();
    for (uint32_t i = 0; i < count; ++i) {
      entries.push_back({{"index", i},
                         {"name", gpt->nameOf(i)},
                         {"first", gpt->firstLba(i)},
                         {"last", gpt->lastLba(i)},
                         {"blocks", gpt->lastLba(i) - gpt->firstLba(i) + 1},
                         {"uuid", gpt->uuidOf(i)},
                         {"data", static_cast<int>(i) == data}});
    }
    Json report = {{"disk", call.image},
                   {"blockSize", *blockSize},
                   {"blocks", *blockCount},
                   {"zarnSignature", *signature},
                   {"gptValid", validity->valid()},
                   {"firstUsable", gpt->firstUsableLba()},
                   {"lastUsable", gpt->lastUsableLba()},
                   {"freeBlocks", freeBlocks},
                   {"entries", std::move(entries)}};
    if (mounted) {
      report["dataFileSystem"] = {{"mountPoint", mounted->mount.mountPoint},
                                  {"source", mounted->mount.source},
                                  {"type", mounted->fileSystem.type},
                                  {"bytes", mounted->fileSystem.bytes}};
    }
    out = JsonLine(report);
  } else {
    out +=
        Format("disk %@: %u-byte blocks, %llu blocks, Zarn signature %s, GPT %s\n", call.image, *blockSize, *blockCount,
               *signature ? "present" : "missing", validity->valid() ? "valid (both copies, CRCs)" : "NOT valid");
    out += Format("usable blocks %llu..%llu, %llu free\n", gpt->firstUsableLba(), gpt->lastUsableLba(), freeBlocks);
    for (uint32_t i = 0; i < count; ++i) {
      const uint64_t blocks = gpt->lastLba(i) - gpt->firstLba(i) + 1;
      out += Format("  %u %-8s %10llu..%-10llu %10llu blocks (%llu MiB) %@%s\n", i, gpt->nameOf(i), gpt->firstLba(i),
                    gpt->lastLba(i), blocks, (blocks * *blockSize) >> 20, gpt->uuidOf(i),
                    static_cast<int>(i) == data ? "  <- Data" : "");
    }
    if (data < 0) out += "no \"Data\" entry: a resize would create one named \"New\"\n";
    if (mounted) {
      out += Format("Data is mounted from %@ on %@: %@, %llu bytes\n", mounted->mount.source, mounted->mount.mountPoint,
                    mounted->fileSystem.type, mounted->fileSystem.bytes);
    } else if (data >= 0) {
      out += "Data is not mounted\n";
    }
  }
  std::fwrite(out.data(), 1, out.size(), stdout);
  return std::fflush(stdout) == 0 ? 0 : 1;
}

}  // namespace vtr
