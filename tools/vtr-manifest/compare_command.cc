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
#include "tools/vtr-manifest/record_differences.h"
#include "tools/vtr-manifest/walk.h"

namespace vtr::manifest_tool {
namespace {

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
  WalkOptions walk = options.walk;
  if (int prepared = PrepareWalkOptions(walk, console); prepared != kExitOk) return prepared;
  Result<std::unique_ptr<ManifestSource>> source = ManifestSource::Load(options.manifest);
  if (!source.ok()) {
    console.print("vtr-manifest: " + source.error().description());
    return ExitStatusOfLoad(source.error());
  }
  // A manifest kept inside the tree it describes is not part of it.
  const std::string manifestPath = CanonicalItemPath(options.manifest.file);
  if (manifestPath.starts_with(walk.tree + "/")) walk.skip.push_back(manifestPath);
  const PlistNode& expected = (*source)->records();
  EntryIndex index(expected);
  bool differs = false;
  bool built = true;
  using Json = nlohmann::ordered_json;  // members in the order written
  Json differences = Json::array();
  // One path's difference: lines now, or an entry of the JSON document at
  // the end. status: "changed", "missing" (in the manifest, not on disk) or
  // "extra" (on disk, not in the manifest).
  auto report = [&](const std::string& key, const char* status, const std::vector<Difference>& changes) {
    differs = true;
    if (options.json) {
      Json entry = {{"path", key}, {"status", status}};
      if (!changes.empty()) {
        entry["changes"] = Json::array();
        for (const Difference& d : changes) {
          entry["changes"].push_back({{"key", d.key}, {"expected", Json(d.expected)}, {"found", Json(d.found)}});
        }
      }
      differences.push_back(std::move(entry));
      return;
    }
    std::fprintf(out, "%s %s\n", EscapedText(key).c_str(), status);
    for (const Difference& d : changes) {
      std::fprintf(out, "\t%s expected %s, found %s\n", d.key.c_str(), ValueText(d.expected).c_str(),
                   ValueText(d.found).c_str());
    }
  };
  const WalkOutcome outcome = RunWalk(
      walk,
      [&](const VTRFileMetadata& onDisk, const std::string& key) {
        const std::optional<uint64_t> entry = index.meet(key);
        if (!entry) {
          report(key, "extra", {});
          return true;
        }
        Result<Value> record = expected.valueAt(*entry).value();
        if (!record.ok()) return built = false;
        const std::vector<Difference> changes = DifferencesBetween(VTRFileMetadata(*record), onDisk);
        if (!changes.empty()) report(key, "changed", changes);
        return true;
      },
      console);
  if (!built) {
    console.print("vtr-manifest: a record of the manifest is too large to build");
    return kExitBadInput;
  }
  // What the walk could not describe is neither missing nor the same.
  const int walked = ReportWalkOutcome(outcome, console);
  if (walked != kExitOk) return walked;
  for (uint64_t i = 0; i < expected.count(); ++i) {
    if (!index.met(i)) report(expected.keyAt(i), "missing", {});
  }
  if (options.json) {
    const Json document = {{"matches", !differs}, {"differences", std::move(differences)}};
    std::fprintf(out, "%s\n", document.dump(-1, ' ', false, Json::error_handler_t::replace).c_str());
  }
  if (std::fflush(out) != 0) return kExitIoError;
  return differs ? kExitNo : kExitOk;
}

}  // namespace vtr::manifest_tool
