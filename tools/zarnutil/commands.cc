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
#include "tools/zarnutil/header_copies.h"
#include "tools/zarnutil/header_report.h"
#include "tools/zarnutil/library_messages.h"
#include "tools/zarnutil/repair_summary.h"
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

// A note about the image on standard error.
void Say(const ZarnutilInvocation& call, const std::string& text) {
  std::fprintf(stderr, "zarnutil: %s: %s\n", call.image.c_str(), text.c_str());
}

// "main header (byte 0): sound" and a newline.
std::string CopyLine(const HeaderCopy& copy) {
  return std::string(copy.name) + " header (byte " + std::to_string(copy.offset) + "): " + copy.description() + "\n";
}

Json CopyJson(const HeaderCopy& copy) {
  return {{"copy", copy.name},
          {"offset", copy.offset},
          {"condition", ConditionName(copy.condition)},
          {"fault", copy.fault.empty() ? Json(nullptr) : Json(copy.fault)}};
}

// What a user can do about copies that are not healthy.
std::string NextStep(const ZarnutilInvocation& call, const HeaderCopies& copies) {
  if (const HeaderCopy* sound = copies.sound()) {
    const HeaderCopy& other = sound == &copies.main ? copies.backup : copies.main;
    return std::string("the ") + other.name + " copy " +
           (other.condition == CopyCondition::kSound ? "differs from the main one" : "is not sound") +
           "; 'zarnutil repair " + call.image + "' restores it from the " + sound->name + " copy";
  }
  if (copies.valid() != nullptr) {
    return "no copy is consistent; 'zarnutil repair --dry-run " + call.image +
           "' shows what a repair by the volume manager's rules would change";
  }
  return "no valid header copy is left; 'zarnutil create --force " + call.image +
         "' writes a fresh header (the partitions it listed are lost)";
}

// What a repair says and answers: text for people, or one JSON object.
struct RepairReport {
  const ZarnutilInvocation& call;
  Json json;
  std::string text;

  // Prints the report; exitStatus unless printing failed.
  int finish(int exitStatus) const {
    const int printed = Print(call.has("--json") ? JsonLine(json) : text);
    return printed != kExitOk ? printed : exitStatus;
  }
};

// Writes source's bytes over the copy damaged (not with --dry-run).
int RestoreCopy(const ZarnImage& image, const HeaderCopy& damaged, const HeaderCopy& source, RepairReport& report) {
  const bool dryRun = report.call.has("--dry-run");
  report.json["action"] = "restore";
  report.json["restored"] = damaged.name;
  report.json["from"] = source.name;
  const std::string why = damaged.condition == CopyCondition::kSound ? "sound, but not the same" : damaged.description();
  report.text = std::string(dryRun ? "would restore" : "restoring") + " the " + damaged.name + " header (" + why +
                ") from the sound " + source.name + " copy" + (dryRun ? "; nothing written" : "") + "\n";
  if (dryRun) return report.finish(kExitOk);
  const bool written = WriteHeaderCopy(image, source.bytes, damaged.offset);
  report.json["written"] = written;
  return report.finish(written ? kExitOk : kExitIoError);
}

// The library's repair of source, the valid copy, written to both copies:
// said in a few lines, and held back when it costs partitions data and
// --force is not given.
int RepairByRules(const ZarnImage& image, const HeaderCopy& source, RepairReport& report) {
  const ZarnutilInvocation& call = report.call;
  report.json["action"] = "repair";
  report.json["from"] = source.name;
  ZarnHeaderBuffer repaired = source.bytes;
  LibraryMessages messages;
  const bool failed = zarnRepairHeader(&image.props, repaired.data(), call.has("--strict") ? 1 : 0) != 0;
  const std::vector<std::string> lines = messages.finish();
  if (failed) {
    ReplayLibraryMessages(lines);
    Say(call, "the strict repair stops at the first fault; nothing written");
    report.json["repaired"] = false;
    return report.finish(kExitNo);
  }
  zarnSetHeaderCRC(repaired.data());
  const RepairSummary summary = SummariseRepair(image.props, ZarnHeaderView(source.bytes), ZarnHeaderView(repaired));
  report.json["changes"] = summary.json();
  report.text = "repairing the " + std::string(source.name) + " copy (" + source.description() +
                ") by the volume manager's rules; the repair:\n";
  for (const std::string& line : summary.lines(image.props)) report.text += "  " + line + "\n";
  if (summary.empty()) report.text += "  changes nothing but the CRC\n";
  if (call.has("--dry-run")) {
    report.text += "nothing written (--dry-run)\n";
    return report.finish(kExitOk);
  }
  if (summary.losesData() && !call.has("--force")) {
    report.text += "nothing written: partitions would lose data; --force applies the repair\n";
    report.json["needs_force"] = true;
    return report.finish(kExitNo);
  }
  const bool written = WriteHeaderCopies(image, repaired);
  report.json["written"] = written;
  if (written) report.text += "both copies written\n";
  return report.finish(written ? kExitOk : kExitIoError);
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
  return Print(call.has("--json") ? HeaderJson(view) : HeaderText(image->props, view, call.has("--chunks")));
}

int RunCheck(const ZarnutilInvocation& call) {
  int status = kExitOk;
  std::optional<ZarnImage> image = OpenZarnImage(call.image, false, call.imageBlockSize, &status);
  if (!image) return status;
  const HeaderCopies copies = ReadHeaderCopies(*image);
  if (call.has("--json")) {
    status = Print(JsonLine({{"image", call.image},
                             {"consistent", copies.healthy()},
                             {"copies", {CopyJson(copies.main), CopyJson(copies.backup)}},
                             {"copies_identical", copies.main.bytes == copies.backup.bytes}}));
  } else {
    std::string text = CopyLine(copies.main) + CopyLine(copies.backup);
    if (copies.sound() == &copies.main && copies.backup.condition == CopyCondition::kSound && !copies.healthy()) {
      text += "the two copies differ\n";
    }
    status = Print(text);
  }
  if (status != kExitOk) return status;
  if (copies.healthy()) return kExitOk;
  Say(call, NextStep(call, copies));
  return copies.valid() != nullptr ? kExitNo : kExitBadInput;
}

int RunRepair(const ZarnutilInvocation& call) {
  int status = kExitOk;
  std::optional<ZarnImage> image = OpenZarnImage(call.image, !call.has("--dry-run"), call.imageBlockSize, &status);
  if (!image) return status;
  const HeaderCopies copies = ReadHeaderCopies(*image);
  RepairReport report{
      call, {{"image", call.image}, {"consistent", copies.healthy()}, {"action", "none"}, {"written", false}}, ""};
  if (copies.healthy()) {
    report.text = "both header copies are sound and the same; nothing to repair\n";
    return report.finish(kExitOk);
  }
  // A sound copy is the whole answer: the other is made its twin.
  if (const HeaderCopy* source = copies.sound()) {
    return RestoreCopy(*image, source == &copies.main ? copies.backup : copies.main, *source, report);
  }
  if (const HeaderCopy* source = copies.valid()) return RepairByRules(*image, *source, report);
  Say(call, NextStep(call, copies));
  return kExitBadInput;
}

int RunExport(const ZarnutilInvocation& call) {
  int status = kExitOk;
  std::optional<ZarnImage> image = OpenZarnImage(call.image, false, call.imageBlockSize, &status);
  if (!image) return status;
  ZarnUuid identity{};
  std::vector<ZarnExportedPartition> partitions;
  if (Zarn_ExportMediaInfo(image->fd.get(), identity.data(), &partitions, call.imageBlockSize) != 0) {
    const HeaderCopies copies = ReadHeaderCopies(*image);
    Say(call, copies.main.valid() ? "the main header cannot be exported: a partition lacks some of its chunks"
                                  : "the export reads the main header only, which is " + copies.main.description() +
                                        (copies.sound() != nullptr ? "; 'zarnutil repair " + call.image +
                                                                         "' restores it from the backup copy"
                                                                   : ""));
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
