// vtr-manifest compare: a tree checked against a manifest, item by item.
#include <set>

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

}  // namespace

int RunCompare(const CompareOptions& options, FILE* out, Console& console) {
  Result<Value> loaded = LoadManifest(options.manifest);
  if (!loaded.ok()) {
    console.write("vtr-manifest: " + loaded.error().description());
    return kExitError;
  }
  const Dictionary& expected = *loaded->dictionary();
  std::set<std::string> seen;
  bool differs = false;
  const bool filled = RunWalk(
      options.walk,
      [&](const VTRFileMetadata& onDisk, const std::string& key) {
        seen.insert(key);
        const Value* entry = expected.find(key);
        if (entry == nullptr) {
          std::fprintf(out, "- not-in-manifest %s\n", EscapedText(key).c_str());
          differs = true;
          return true;
        }
        const int code = VTRFileMetadata(*entry).compareWith(&onDisk);
        if (code != kVTRFileSame) {
          std::fprintf(out, "%d %s %s\n", code, kDifferenceNames[code], EscapedText(key).c_str());
          differs = true;
        }
        return true;
      },
      console);
  for (const auto& entry : expected) {
    if (seen.count(entry.first) != 0) continue;
    std::fprintf(out, "%d %s %s\n", kVTRFileOtherAbsent, kDifferenceNames[kVTRFileOtherAbsent],
                 EscapedText(entry.first).c_str());
    differs = true;
  }
  if (std::fflush(out) != 0) return kExitError;
  if (!filled) {
    console.write("vtr-manifest: the tree could not be walked to its end");
    return kExitError;
  }
  return differs ? kExitFailure : kExitOk;
}

}  // namespace vtr::manifest_tool
