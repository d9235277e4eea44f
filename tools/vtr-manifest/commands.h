// The commands of vtr-manifest, each run from parsed options. Results go to
// `out`, diagnostics to `console` (standard error); the return value is the
// process's exit status.
#ifndef VTR_TOOLS_VTR_MANIFEST_COMMANDS_H_
#define VTR_TOOLS_VTR_MANIFEST_COMMANDS_H_

#include <cstdio>
#include <optional>
#include <string>
#include <vector>

#include "tools/vtr-manifest/console.h"

namespace vtr::manifest_tool {

inline constexpr int kExitOk = 0;
inline constexpr int kExitFailure = 1;  // compare: the tree differs from the manifest
inline constexpr int kExitError = 2;    // the command could not do its work
inline constexpr int kExitUsage = 64;

// What is walked, and how, for create and compare.
struct WalkOptions {
  std::string tree;
  std::optional<std::string> relativeTo;  // default: the tree itself
  bool inclusive = false;
  std::vector<std::string> skip;
  std::optional<unsigned> jobs;  // record threads; default: the builder's
};

struct CreateOptions {
  WalkOptions walk;
  std::string output;
};

enum class ShowFormat { kText, kJson, kXml };

// Which manifest of a file to use: the file itself, or in a signed manifest
// the whole-device manifest or one container's.
struct ManifestSelection {
  std::string file;
  std::optional<std::string> container;
};

struct ShowOptions {
  ManifestSelection manifest;
  ShowFormat format = ShowFormat::kText;
  std::optional<std::string> path;
};

struct CompareOptions {
  ManifestSelection manifest;
  WalkOptions walk;
};

// Writes the manifest of the tree to options.output, streamed exactly as the
// helper writes the device manifest. 0 when the fill succeeded and the file
// was written.
int RunCreate(const CreateOptions& options, Console& console);

// Prints a manifest (or one entry of it) in the chosen format.
int RunShow(const ShowOptions& options, FILE* out, Console& console);

// Walks the tree and compares each item with the manifest's record of it,
// printing one line per difference: "CODE NAME PATH" with the comparison's
// code, "0 missing-on-disk PATH" for a manifest entry nothing on disk
// matched, "- not-in-manifest PATH" for an item the manifest lacks. 0 only
// when no line was printed.
int RunCompare(const CompareOptions& options, FILE* out, Console& console);

}  // namespace vtr::manifest_tool

#endif  // VTR_TOOLS_VTR_MANIFEST_COMMANDS_H_
