// zarnutil: create, inspect, check, repair and export the Zarn volume-manager
// header of a disk image or block device, and draw its chunk map.
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>

#include "tools/zarnutil/commands.h"
#include "tools/zarnutil/disk_report.h"

namespace {

constexpr char kUsage[] =
    "usage: zarnutil [--block-size N] COMMAND IMAGE [OPTIONS]\n"
    "\n"
    "Works on the Zarn volume-manager header of IMAGE, a disk image file or a\n"
    "block device.\n"
    "\n"
    "commands:\n"
    "  create IMAGE            write a fresh header (main and backup copies)\n"
    "  show IMAGE [--json]     print the header: fields, partitions, chunk map\n"
    "  check IMAGE             exit 0 when the header is consistent, 1 if not\n"
    "  repair [--strict] IMAGE repair the header and write both copies;\n"
    "                          --strict fails on a fault and writes nothing\n"
    "  export IMAGE [--json]   print the partitions with their extents\n"
    "  map IMAGE               draw the chunk map (32 x 32, one mark a chunk)\n"
    "  disk DISK [--json]      the boot disk as the data-partition resize sees\n"
    "                          it: signature, GPT copies, entries, free blocks,\n"
    "                          the file system mounted from \"Data\"\n"
    "\n"
    "options:\n"
    "  --block-size N          block size of an image file (default 4096);\n"
    "                          a block device always uses its own\n"
    "  -h, --help              show this help\n"
    "\n"
    "Exit status: 0 success, 1 failure, 2 usage error.\n";

struct Command {
  const char* name;
  const char* flag;  // the command's own option, or nullptr
  int (*run)(const vtr::ZarnutilInvocation&);
};

constexpr Command kCommands[] = {
    {"create", nullptr, vtr::RunCreate}, {"show", "--json", vtr::RunShow},
    {"check", nullptr, vtr::RunCheck},   {"repair", "--strict", vtr::RunRepair},
    {"export", "--json", vtr::RunExport}, {"map", nullptr, vtr::RunMap},
    {"disk", "--json", vtr::RunDisk},
};

int UsageError(const std::string& problem) {
  std::fprintf(stderr, "zarnutil: %s\n%s", problem.c_str(), kUsage);
  return 2;
}

// A block size in decimal, 1 .. kMaxImageBlockSize.
bool ParseBlockSize(std::string_view text, uint32_t* out) {
  if (text.empty() || text.size() > 8) return false;
  uint32_t value = 0;
  for (char c : text) {
    if (c < '0' || c > '9') return false;
    value = value * 10 + static_cast<uint32_t>(c - '0');
  }
  if (value == 0 || value > vtr::kMaxImageBlockSize) return false;
  *out = value;
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  vtr::ZarnutilInvocation call;
  int i = 1;
  for (; i < argc && argv[i][0] == '-'; ++i) {
    const std::string_view arg = argv[i];
    if (arg == "-h" || arg == "--help") {
      std::fputs(kUsage, stdout);
      return 0;
    }
    std::string_view value;
    if (arg == "--block-size") {
      if (++i == argc) return UsageError("--block-size needs a value");
      value = argv[i];
    } else if (arg.starts_with("--block-size=")) {
      value = arg.substr(std::strlen("--block-size="));
    } else {
      return UsageError("unknown option " + std::string(arg));
    }
    if (!ParseBlockSize(value, &call.imageBlockSize)) {
      return UsageError("bad block size " + std::string(value));
    }
  }
  if (i == argc) return UsageError("no command given");

  const std::string_view name = argv[i++];
  for (const Command& command : kCommands) {
    if (name != command.name) continue;
    for (; i < argc; ++i) {
      const std::string_view arg = argv[i];
      if (command.flag != nullptr && arg == command.flag) {
        call.flags.insert(command.flag);
      } else if (!arg.empty() && arg[0] == '-') {
        return UsageError(std::string(name) + ": unknown option " + std::string(arg));
      } else if (call.image.empty()) {
        call.image = arg;
      } else {
        return UsageError(std::string(name) + ": more than one image given");
      }
    }
    if (call.image.empty()) return UsageError(std::string(name) + ": no image given");
    return command.run(call);
  }
  return UsageError("unknown command " + std::string(name));
}
