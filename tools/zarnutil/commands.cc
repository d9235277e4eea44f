#include "tools/zarnutil/commands.h"

#include <cstdio>
#include <string>
#include <vector>

#include "storage/zarn_check.h"
#include "storage/zarn_export.h"
#include "storage/zarn_header.h"
#include "tools/zarnutil/chunk_map_picture.h"
#include "tools/zarnutil/export_report.h"
#include "tools/zarnutil/header_report.h"
#include "tools/zarnutil/zarn_image.h"

namespace vtr {
namespace {

int Print(const std::string& text) {
  std::fwrite(text.data(), 1, text.size(), stdout);
  return std::fflush(stdout) == 0 ? 0 : 1;
}

// Opens the medium read-only and acquires its header; the commands that only
// look at a header start here.
std::optional<ZarnImage> OpenWithHeader(const ZarnutilInvocation& call, bool writable, ZarnHeaderBuffer* header) {
  std::optional<ZarnImage> image = OpenZarnImage(call.image, writable, call.imageBlockSize);
  if (!image || !AcquireHeader(*image, header)) return std::nullopt;
  return image;
}

}  // namespace

int RunCreate(const ZarnutilInvocation& call) {
  std::optional<ZarnImage> image = OpenZarnImage(call.image, true, call.imageBlockSize);
  if (!image) return 1;
  ZarnHeaderBuffer header{};
  if (zarnCreateHeader(&image->props, header.data()) != 0) return 1;
  zarnSetHeaderCRC(header.data());
  return WriteHeaderCopies(*image, header) ? 0 : 1;
}

int RunShow(const ZarnutilInvocation& call) {
  ZarnHeaderBuffer header{};
  std::optional<ZarnImage> image = OpenWithHeader(call, false, &header);
  if (!image) return 1;
  const ZarnHeaderView view(header);
  return Print(call.has("--json") ? HeaderJson(view) : HeaderText(image->props, view));
}

int RunCheck(const ZarnutilInvocation& call) {
  ZarnHeaderBuffer header{};
  std::optional<ZarnImage> image = OpenWithHeader(call, false, &header);
  if (!image) return 1;
  return zarnCheckHeader(&image->props, header.data()) == 0 ? 0 : 1;
}

int RunRepair(const ZarnutilInvocation& call) {
  ZarnHeaderBuffer header{};
  std::optional<ZarnImage> image = OpenWithHeader(call, true, &header);
  if (!image) return 1;
  if (zarnRepairHeader(&image->props, header.data(), call.has("--strict") ? 1 : 0) != 0) return 1;
  zarnSetHeaderCRC(header.data());
  return WriteHeaderCopies(*image, header) ? 0 : 1;
}

int RunExport(const ZarnutilInvocation& call) {
  std::optional<ZarnImage> image = OpenZarnImage(call.image, false, call.imageBlockSize);
  if (!image) return 1;
  ZarnUuid identity{};
  std::vector<ZarnExportedPartition> partitions;
  if (Zarn_ExportMediaInfo(image->fd.get(), identity.data(), &partitions, call.imageBlockSize) != 0) {
    std::fprintf(stderr, "zarnutil: %s: the main header cannot be exported (unreadable, invalid, or a partition "
                 "without all of its chunks)\n", call.image.c_str());
    return 1;
  }
  return Print(call.has("--json") ? ExportJson(identity, partitions) : ExportText(identity, partitions));
}

int RunMap(const ZarnutilInvocation& call) {
  ZarnHeaderBuffer header{};
  std::optional<ZarnImage> image = OpenWithHeader(call, false, &header);
  if (!image) return 1;
  return Print(ChunkMapPicture(image->props, ZarnHeaderView(header)));
}

}  // namespace vtr
