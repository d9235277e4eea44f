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
#include "tools/zarnutil/json_writer.h"

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
    JsonWriter json;
    json.beginObject();
    json.key("disk");
    json.string(call.image);
    json.key("blockSize");
    json.number(*blockSize);
    json.key("blocks");
    json.number(*blockCount);
    json.key("zarnSignature");
    json.boolean(*signature);
    json.key("gptValid");
    json.boolean(validity->valid());
    json.key("firstUsable");
    json.number(gpt->firstUsableLba());
    json.key("lastUsable");
    json.number(gpt->lastUsableLba());
    json.key("freeBlocks");
    json.number(freeBlocks);
    json.key("entries");
    json.beginArray();
    for (uint32_t i = 0; i < count; ++i) {
      json.beginObject();
      json.key("index");
      json.number(i);
      json.key("name");
      json.string(gpt->nameOf(i));
      json.key("first");
      json.number(gpt->firstLba(i));
      json.key("last");
      json.number(gpt->lastLba(i));
      json.key("blocks");
      json.number(gpt->lastLba(i) - gpt->firstLba(i) + 1);
      json.key("uuid");
      json.string(gpt->uuidOf(i));
      json.key("data");
      json.boolean(static_cast<int>(i) == data);
      json.endObject();
    }
    json.endArray();
    if (mounted) {
      json.key("dataFileSystem");
      json.beginObject();
      json.key("mountPoint");
      json.string(mounted->mount.mountPoint);
      json.key("source");
      json.string(mounted->mount.source);
      json.key("type");
      json.string(mounted->fileSystem.type);
      json.key("bytes");
      json.number(mounted->fileSystem.bytes);
      json.endObject();
    }
    json.endObject();
    out = json.text() + "\n";
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
