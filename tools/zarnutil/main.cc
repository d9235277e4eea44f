// zarnutil: create, inspect, check, repair and export the Zarn
// volume-manager header of a disk image or block device.
#include <getopt.h>

#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>

#include "tools/common/tool_conventions.h"
#include "tools/zarnutil/commands.h"
#include "tools/zarnutil/disk_report.h"

namespace {

using vtr::tools::kExitUsage;

constexpr char kUsage[] =
    "usage: zarnutil [OPTIONS] COMMAND IMAGE\n"
    "\n"
    "Works on the Zarn volume-manager header of IMAGE, a disk image file or a\n"
    "block device.\n"
    "\n"
    "commands:\n"
    "  create IMAGE     write a fresh header (main and backup copies); refuses\n"
    "                   to replace a header already there unless --force\n"
    "  show IMAGE       print the header: fields, partitions (--chunks: the map)\n"
    "  check IMAGE      report both header copies; exit 0 when both are sound\n"
    "                   and the same, 1 when either is not\n"
    "  repair IMAGE     restore a damaged copy from the sound one; with no sound\n"
    "                   copy, repair by the volume manager's rules (a repair\n"
    "                   that deletes partitions needs --force)\n"
    "  export IMAGE     print the partitions with their extents\n"
    "  map IMAGE        draw the chunk map (32 x 32, one mark a chunk)\n"
    "  disk DISK        the boot disk as the data-partition resize sees it:\n"
    "                   signature, GPT copies, entries, free blocks, the file\n"
    "                   system mounted from \"Data\"\n"
    "\n"
    "options:\n"
    "  --block-size N   block size of an image file (default 4096); a block\n"
    "                   device always uses its own\n"
    "  --json           show, check, repair, export, disk: print JSON\n"
    "  --strict         repair: fail on the first fault and write nothing\n"
    "  --dry-run        create, repair: say what would be written, write nothing\n"
    "  --force          create: replace an existing header; repair: apply a\n"
    "                   repair that deletes or cuts short partitions\n"
    "  --chunks         show: print the chunk map too\n"
    "  -h, --help       show this help\n"
    "  -V, --version    show the version\n"
    "\n"
    "Exit status: 0 done, 1 a header copy is not sound (check), a strict repair\n"
    "failed or a repair needs --force, 64 usage error, 65 no valid header (or one\n"
    "in the way of create, or a medium empty or too small), 66 the image cannot\n"
    "be opened, 74 reading or writing the image failed.\n";

struct Command {
  const char* name;
  const char* options;  // the options it takes, as typed, space-separated
  int (*run)(const vtr::ZarnutilInvocation&);
};

constexpr Command kCommands[] = {
    {"create", "--dry-run --force", vtr::RunCreate},
    {"show", "--json --chunks", vtr::RunShow},
    {"check", "--json", vtr::RunCheck},
    {"repair", "--strict --dry-run --force --json", vtr::RunRepair},
    {"export", "--json", vtr::RunExport},
    {"map", "", vtr::RunMap},
    {"disk", "--json", vtr::RunDisk},
};

int UsageError(const std::string& problem) {
  std::fprintf(stderr, "zarnutil: %s\nTry 'zarnutil --help'.\n", problem.c_str());
  return kExitUsage;
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

bool Takes(const Command& command, const std::string& option) {
  const std::string options = std::string(" ") + command.options + " ";
  return options.find(" " + option + " ") != std::string::npos;
}

}  // namespace

int main(int argc, char** argv) {
  enum { kBlockSize = 256, kJson, kStrict, kDryRun, kForce, kChunks };
  static const struct option kLongOptions[] = {
      {"block-size", required_argument, nullptr, kBlockSize},
      {"json", no_argument, nullptr, kJson},
      {"strict", no_argument, nullptr, kStrict},
      {"dry-run", no_argument, nullptr, kDryRun},
      {"force", no_argument, nullptr, kForce},
      {"chunks", no_argument, nullptr, kChunks},
      {"help", no_argument, nullptr, 'h'},
      {"version", no_argument, nullptr, 'V'},
      {nullptr, 0, nullptr, 0},
  };
  vtr::ZarnutilInvocation call;
  opterr = 0;
  int c;
  // Options may stand anywhere: zarnutil takes no argument that starts with '-'.
  while ((c = getopt_long(argc, argv, ":hV", kLongOptions, nullptr)) != -1) {
    switch (c) {
      case kBlockSize:
        if (!ParseBlockSize(optarg, &call.imageBlockSize)) return UsageError("bad block size " + std::string(optarg));
        break;
      case kJson: call.flags.insert("--json"); break;
      case kStrict: call.flags.insert("--strict"); break;
      case kDryRun: call.flags.insert("--dry-run"); break;
      case kForce: call.flags.insert("--force"); break;
      case kChunks: call.flags.insert("--chunks"); break;
      case 'h': std::fputs(kUsage, stdout); return 0;
      case 'V': vtr::tools::PrintVersion("zarnutil"); return 0;
      case ':': return UsageError(std::string(argv[optind - 1]) + " needs a value");
      default: return UsageError("unknown option " + std::string(argv[optind - 1]));
    }
  }
  if (optind == argc) return UsageError("no command given");
  const std::string name = argv[optind++];
  for (const Command& command : kCommands) {
    if (name != command.name) continue;
    for (const std::string& flag : call.flags) {
      if (!Takes(command, flag)) return UsageError(name + " does not take " + flag);
    }
    if (optind == argc) return UsageError(name + ": no image given");
    if (argc - optind > 1) return UsageError(name + ": more than one image given");
    call.image = argv[optind];
    return command.run(call);
  }
  return UsageError("unknown command " + name);
}
