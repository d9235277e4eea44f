// The command line of vtr-manifest.
#ifndef VTR_TOOLS_VTR_MANIFEST_COMMAND_LINE_H_
#define VTR_TOOLS_VTR_MANIFEST_COMMAND_LINE_H_

#include <cstdio>
#include <string>
#include <vector>

#include "platform/result.h"
#include "tools/vtr-manifest/commands.h"

namespace vtr::manifest_tool {

struct CommandLine {
  enum class Command { kHelp, kVersion, kCreate, kShow, kCompare, kSign, kVerify, kInspect } command = Command::kHelp;
  bool verbose = false;
  CreateOptions create;
  ShowOptions show;
  CompareOptions compare;
  SignOptions sign;
  VerifyOptions verify;
  InspectOptions inspect;
};

// Parses the arguments after the program name. The error's message says
// what is wrong with them.
Result<CommandLine> ParseCommandLine(const std::vector<std::string>& arguments);

void PrintUsage(FILE* out);

}  // namespace vtr::manifest_tool

#endif  // VTR_TOOLS_VTR_MANIFEST_COMMAND_LINE_H_
