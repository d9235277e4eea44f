#include "tools/zarnutil/commands.h"

#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

#include "storage/zarn_check.h"
#include "storage/zarn_export.h"
#include "storage/zarn_header.h"
#include "tools/common/tool_conventions.h"
#include "tools/zarnutil/chunk_map_picture.h"
#include "tools/zarnutil/export_report.h"
#include "tools/zarnutil/header_report.h"
#include "tools/zarnutil/report_format.h"
#include "tools/zarnutil/zarn_image.h"

namespace vtr {
namespace {

using namespace tools;

int Print(const std::string& text) {
  std::fwrite(text.data(), 1, text.size(), stdout);
  return std::fflush(stdout) == 0 ? kExitOk : kExitIoError;
}

// Opens the medium and acquires its header; the commands that work on a
// header start here. *status is the exit status when it fails.
std::optional<ZarnImage> OpenWithHeader(const ZarnutilInvocation& call, bool writable, ZarnHeaderBuffer* header,
                                        int* status) {
  std::optional<ZarnImage> image = OpenZarnImage(call.image, writable, call.imageBlockSize, status);
  if (!image) return std::nullopt;
  if (!AcquireHeader(*image, header)) {
    *status = kExitBadInput;
    return std::nullopt;
  }
  return image;
}

// The library's check, on a copy (validation may rewrite the CRC field).
bool Consistent(const ZarnImage& image, const ZarnHeaderBuffer& header) {
  ZarnHeaderBuffer copy = header;
  return zarnCheckHeader(&image.props, copy.data()) == 0;
}

// A note about the image on standard error.
void Say(const ZarnutilInvocation& call, const std::string& text) {
  std::fprintf(stderr, "zarnutil: %s: %s\n", call.image.c_str(), text.c_str());
}

}  // namespace

int RunCreate(const ZarnutilInvocation& call) {
  const bool dryRun = call.has("--dry-run");
  int status = kExitOk;
  std::optional<ZarnImage> image = OpenZarnImage(call.image, !dryRun, call.imageBlockSize, &status);
  if (!image) return status;
  if (HasHeaderCopy(*image) && !call.has("--force")) {
    Say(call, "a Zarn header is already there; --force replaces it (and every partition it holds)");
    return kExitBadInput;
  }
  ZarnHeaderBuffer header{};
  if (zarnCreateHeader(&image->props, header.data()) != 0) return kExitBadInput;
  zarnSetHeaderCRC(header.data());
  if (dryRun) {
    Say(call, "would write a fresh header for " + std::to_string(image->props.chunkCount) +
                  " chunks (main and backup copies); nothing written");
    return kExitOk;
  }
  return WriteHeaderCopies(*image, header) ? kExitOk : kExitIoError;
}

int RunShow(const ZarnutilInvocation& call) {
  ZarnHeaderBuffer header{};
  int status = kExitOk;
  std::optional<ZarnImage> image = OpenWithHeader(call, false, &header, &status);
  if (!image) return status;
  const ZarnHeaderView view(header);
  return Print(call.has("--json") ? HeaderJson(view) : HeaderText(image->props, view));
}

int RunCheck(const ZarnutilInvocation& call) {
  ZarnHeaderBuffer header{};
  int status = kExitOk;
  std::optional<ZarnImage> image = OpenWithHeader(call, false, &header, &status);
  if (!image) return status;
  const bool consistent = Consistent(*image, header);
  if (call.has("--json")) {
    status = Print(JsonLine({{"image", call.image}, {"consistent", consistent}}));
    if (status != kExitOk) return status;
  }
  return consistent ? kExitOk : kExitNo;
}

int RunRepair(const ZarnutilInvocation& call) {
  const bool dryRun = call.has("--dry-run");
  ZarnHeaderBuffer header{};
  int status = kExitOk;
  std::optional<ZarnImage> image = OpenWithHeader(call, !dryRun, &header, &status);
  if (!image) return status;
  const bool consistent = Consistent(*image, header);
  const bool repair = !consistent || call.has("--force");
  ZarnHeaderBuffer repaired = header;
  bool failed = false;
  if (repair) {
    failed = zarnRepairHeader(&image->props, repaired.data(), call.has("--strict") ? 1 : 0) != 0;
    if (!failed) zarnSetHeaderCRC(repaired.data());
  }
  size_t changed = 0;
  if (repair && !failed) {
    for (size_t i = 0; i < kZarnHeaderSize; ++i) changed += repaired[i] != header[i];
  }
  const bool written = repair && !failed && !dryRun && WriteHeaderCopies(*image, repaired);
  if (call.has("--json")) {
    status = Print(JsonLine({{"image", call.image},
                             {"consistent", consistent},
                             {"repaired", repair && !failed},
                             {"bytes_changed", changed},
                             {"written", written}}));
    if (status != kExitOk) return status;
  } else if (!repair) {
    Say(call, "the header passes the check; nothing written (--force repairs it anyway)");
  } else if (!failed && dryRun) {
    Say(call, "the repair would change " + std::to_string(changed) + " bytes of the header; nothing written");
  }
  if (failed) return kExitNo;
  if (repair && !dryRun && !written) return kExitIoError;
  return kExitOk;
}

int RunExport(const ZarnutilInvocation& call) {
  int status = kExitOk;
  std::optional<ZarnImage> image = OpenZarnImage(call.image, false, call.imageBlockSize, &status);
  if (!image) return status;
  ZarnUuid identity{};
  std::vector<ZarnExportedPartition> partitions;
  if (Zarn_ExportMediaInfo(image->fd.get(), identity.data(), &partitions, call.imageBlockSize) != 0) {
    std::fprintf(stderr, "zarnutil: %s: the main header cannot be exported (unreadable, invalid, or a partition "
                 "without all of its chunks)\n", call.image.c_str());
    return kExitBadInput;
  }
  return Print(call.has("--json") ? ExportJson(identity, partitions) : ExportText(identity, partitions));
}

int RunMap(const ZarnutilInvocation& call) {
  ZarnHeaderBuffer header{};
  int status = kExitOk;
  std::optional<ZarnImage> image = OpenWithHeader(call, false, &header, &status);
  if (!image) return status;
  return Print(ChunkMapPicture(image->props, ZarnHeaderView(header)));
}

}  // namespace vtr
