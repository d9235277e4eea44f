// vtr-manifest create: the manifest of a tree, written as the helper writes
// the device manifest.
#include <fcntl.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <optional>

#include "model/manifest_file.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/manifest_render.h"
#include "tools/vtr-manifest/walk.h"

namespace vtr::manifest_tool {
namespace {

// "-o -": the manifest is made in a folder of this process's own (mode 0700,
// so no one else can put anything in its place) and goes to standard output
// only when whole. The folder goes when this does.
class StagingFolder {
 public:
  StagingFolder() {
    const char* base = std::getenv("TMPDIR");
    std::string pattern = std::string(base != nullptr && *base != '\0' ? base : "/tmp") + "/vtr-manifest-XXXXXX";
    if (::mkdtemp(pattern.data()) != nullptr) {
      folder_ = pattern;
    } else {
      error_ = Error::FromErrno("cannot make a folder for the manifest in " + pattern.substr(0, pattern.rfind('/')));
    }
  }
  ~StagingFolder() {
    if (folder_.empty()) return;
    ::unlink(file().c_str());
    ::rmdir(folder_.c_str());
  }
  StagingFolder(const StagingFolder&) = delete;
  StagingFolder& operator=(const StagingFolder&) = delete;

  // Empty when the folder could not be made; error() then says why.
  std::string file() const { return folder_.empty() ? "" : folder_ + "/manifest.plist"; }
  const Error& error() const { return error_; }

 private:
  std::string folder_;
  Error error_;
};

// Copies the file at path to out; false when either fails.
bool CopyToOutput(const std::string& path, FILE* out) {
  UniqueFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
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
  std::optional<StagingFolder> staging;
  if (toStandardOutput) {
    staging.emplace();
    if (staging->file().empty()) {
      console.print("vtr-manifest: " + staging->error().description());
      return kExitIoError;
    }
  }
  const std::string output = toStandardOutput ? staging->file() : options.output;
  const std::string shown = toStandardOutput ? "standard output" : EscapedText(options.output);
  Result<std::unique_ptr<ManifestFileWriter>> writer = ManifestFileWriter::Create(output);
  if (!writer.ok()) {
    console.print("vtr-manifest: cannot create " + shown + ": " + writer.error().description());
    return kExitIoError;
  }
  // As the helper does for the device manifest: a tree that holds the output
  // does not describe it half written.
  // A temporary without a name (O_TMPFILE) cannot be met by the walk.
  if (!(*writer)->temporaryPath().empty()) walk.skip.push_back(CanonicalItemPath((*writer)->temporaryPath()));
  const WalkOutcome outcome = RunWalk(walk, (*writer)->handler(), console);
  if (int status = ReportWalkOutcome(outcome, console); status != kExitOk) {
    console.print("vtr-manifest: no manifest written; " + shown + " is left as it was");
    return status;
  }
  if (Status committed = (*writer)->commit(); !committed.ok()) {
    console.print("vtr-manifest: cannot write " + shown + ": " + committed.error().description());
    return kExitIoError;
  }
  if (toStandardOutput && !CopyToOutput(output, stdout)) {
    console.print("vtr-manifest: cannot write the manifest to standard output");
    return kExitIoError;
  }
  return kExitOk;
}

}  // namespace vtr::manifest_tool
