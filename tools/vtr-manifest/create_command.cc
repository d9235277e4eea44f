// vtr-manifest create: the manifest of a tree, written as the helper writes
// the device manifest.
#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>

#include "model/manifest_file.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/manifest_render.h"
#include "tools/vtr-manifest/walk.h"

namespace vtr::manifest_tool {
namespace {

// Where "-o -" builds the manifest before it goes to standard output whole:
// a file of this process's own in the temporary folder.
std::string StagingPath() {
  const char* folder = std::getenv("TMPDIR");
  return std::string(folder != nullptr && *folder != '\0' ? folder : "/tmp") + "/vtr-manifest-" +
         std::to_string(::getpid()) + ".plist";
}

// Copies the file at path to out and removes it; false when out cannot take it.
bool MoveToOutput(const std::string& path, FILE* out) {
  UniqueFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
  ::unlink(path.c_str());
  if (!file) return false;
  char buffer[65536];
  ssize_t n;
  while ((n = ::read(file.get(), buffer, sizeof buffer)) > 0) {
    if (std::fwrite(buffer, 1, static_cast<size_t>(n), out) != static_cast<size_t>(n)) return false;
  }
  return n == 0 && std::fflush(out) == 0;
}

}  // namespace

int RunCreate(const CreateOptions& options, Console& console) {
  WalkOptions walk = options.walk;
  if (int prepared = PrepareWalkOptions(walk, console); prepared != kExitOk) return prepared;
  const bool toStandardOutput = options.output == "-";
  const std::string output = toStandardOutput ? StagingPath() : options.output;
  const std::string shown = toStandardOutput ? "standard output" : EscapedText(options.output);
  Result<std::unique_ptr<ManifestFileWriter>> writer = ManifestFileWriter::Create(output);
  if (!writer.ok()) {
    console.print("vtr-manifest: cannot create " + shown + ": " + writer.error().description());
    return kExitIoError;
  }
  // As the helper does for the device manifest: a tree that holds the output
  // does not describe it half written.
  walk.skip.push_back(CanonicalItemPath((*writer)->temporaryPath()));
  const WalkOutcome outcome = RunWalk(walk, (*writer)->handler(), console);
  if (int status = ReportWalkOutcome(outcome, console); status != kExitOk) {
    console.print("vtr-manifest: no manifest written; " + shown + " is left as it was");
    return status;
  }
  if (Status committed = (*writer)->commit(); !committed.ok()) {
    console.print("vtr-manifest: cannot write " + shown + ": " + committed.error().description());
    return kExitIoError;
  }
  if (toStandardOutput && !MoveToOutput(output, stdout)) {
    console.print("vtr-manifest: cannot write the manifest to standard output");
    return kExitIoError;
  }
  return kExitOk;
}

}  // namespace vtr::manifest_tool
