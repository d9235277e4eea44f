// vtr-manifest compare: a tree checked against a manifest, item by item.
#include <nlohmann/json.hpp>

#include <algorithm>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "model/file_metadata.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/manifest_render.h"
#include "tools/vtr-manifest/manifest_source.h"
#include "tools/vtr-manifest/walk.h"

namespace vtr::manifest_tool {
namespace {

// Names of the comparison codes, by code.
constexpr const char* kDifferenceNames[] = {
    "missing-on-disk", "type-differs", "content-differs", "link-target-differs",
    "owner-or-mode-differs", "xattrs-differ", "same",
};

// The entries of a manifest found by path, and which of them were met: 16
// bytes and a bit per entry, whatever the paths' length.
class EntryIndex {
 public:
  explicit EntryIndex(const PlistNode& records) : records_(records), met_(records.count()) {
    slots_.reserve(records.count());
    for (uint64_t i = 0; i < records.count(); ++i) slots_.emplace_back(Hash(records.keyAt(i)), i);
    std::sort(slots_.begin(), slots_.end());
  }

  // The entry of path, now counted as met; nullopt when there is none.
  std::optional<uint64_t> meet(const std::string& path) {
    const size_t hash = Hash(path);
    auto it = std::lower_bound(slots_.begin(), slots_.end(), std::pair<size_t, uint64_t>(hash, 0));
    for (; it != slots_.end() && it->first == hash; ++it) {
      if (records_.keyAt(it->second) == path) {
        met_[it->second] = true;
        return it->second;
      }
    }
    return std::nullopt;
  }
  bool met(uint64_t i) const { return met_[i]; }

 private:
  static size_t Hash(const std::string& text) { return std::hash<std::string>{}(text); }

  PlistNode records_;
  std::vector<std::pair<size_t, uint64_t>> slots_;  // (hash of the path, entry), sorted
  std::vector<bool> met_;
};

}  // namespace

int RunCompare(const CompareOptions& options, FILE* out, Console& console) {
  if (int checked = CheckWalkOptions(options.walk, console); checked != kExitOk) return checked;
  Result<std::unique_ptr<ManifestSource>> source = ManifestSource::Load(options.manifest);
  if (!source.ok()) {
    console.print("vtr-manifest: " + source.error().description());
    return ExitStatusOfLoad(source.error());
  }
  const PlistNode& expected = (*source)->records();
  EntryIndex index(expected);
  bool differs = false;
  bool built = true;
  nlohmann::json differences = nlohmann::json::array();
  // One difference: a line now, or an entry of the JSON document at the end.
  auto report = [&](std::optional<int> code, const char* name, const std::string& key) {
    differs = true;
    if (options.json) {
      differences.push_back({{"code", code ? nlohmann::json(*code) : nlohmann::json(nullptr)}, {"name", name},
                             {"path", key}});
    } else {
      std::fprintf(out, "%s %s %s\n", code ? std::to_string(*code).c_str() : "-", name, EscapedText(key).c_str());
    }
  };
  const bool filled = RunWalk(
      options.walk,
      [&](const VTRFileMetadata& onDisk, const std::string& key) {
        const std::optional<uint64_t> entry = index.meet(key);
        if (!entry) {
          report(std::nullopt, "not-in-manifest", key);
          return true;
        }
        Result<Value> record = expected.valueAt(*entry).value();
        if (!record.ok()) return built = false;
        const int code = VTRFileMetadata(*record).compareWith(&onDisk);
        if (code != kVTRFileSame) report(code, kDifferenceNames[code], key);
        return true;
      },
      console);
  if (!built) {
    console.print("vtr-manifest: a record of the manifest is too large to build");
    return kExitBadInput;
  }
  for (uint64_t i = 0; i < expected.count(); ++i) {
    if (index.met(i)) continue;
    report(kVTRFileOtherAbsent, kDifferenceNames[kVTRFileOtherAbsent], expected.keyAt(i));
  }
  if (options.json) {
    const nlohmann::json document = {{"matches", !differs}, {"differences", std::move(differences)}};
    std::fprintf(out, "%s\n", document.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace).c_str());
  }
  if (std::fflush(out) != 0) return kExitIoError;
  if (!filled) {
    console.print("vtr-manifest: the tree could not be walked to its end");
    return kExitIoError;
  }
  return differs ? kExitNo : kExitOk;
}

}  // namespace vtr::manifest_tool
