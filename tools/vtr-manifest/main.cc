// vtr-manifest: create, show and compare manifests of file trees; sign,
// verify and inspect signed manifests.
#include <unistd.h>

#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "tools/vtr-manifest/command_line.h"
#include "tools/vtr-manifest/commands.h"
#include "tools/vtr-manifest/console.h"

using namespace vtr::manifest_tool;

int main(int argc, char** argv) {
  vtr::Result<CommandLine> line = ParseCommandLine(std::vector<std::string>(argv + 1, argv + argc));
  if (!line.ok()) {
    std::fprintf(stderr, "vtr-manifest: %s\nTry 'vtr-manifest --help'.\n", line.error().description().c_str());
    return kExitUsage;
  }
  auto console = std::make_shared<Console>(stderr, ::isatty(STDERR_FILENO) == 1, line->verbose);
  ConsoleLogInstaller installed(console);
  switch (line->command) {
    case CommandLine::Command::kHelp: PrintUsage(stdout); return kExitOk;
    case CommandLine::Command::kVersion: vtr::tools::PrintVersion("vtr-manifest"); return kExitOk;
    case CommandLine::Command::kCreate: return RunCreate(line->create, *console);
    case CommandLine::Command::kShow: return RunShow(line->show, stdout, *console);
    case CommandLine::Command::kCompare: return RunCompare(line->compare, stdout, *console);
    case CommandLine::Command::kSign: return RunSign(line->sign, *console);
    case CommandLine::Command::kVerify: return RunVerify(line->verify, stdout, *console);
    case CommandLine::Command::kInspect: return RunInspect(line->inspect, stdout, *console);
  }
  return kExitUsage;
}
