// vitdctl: the reference client of the demo-mode helper.
#include <getopt.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <utility>
#include <vector>

#include "tools/vitdctl/nvram_listing.h"
#include "tools/vitdctl/request.h"
#include "tools/vitdctl/request_shape.h"
#include "tools/vitdctl/session.h"
#include "tools/vitdctl/status.h"

namespace {

using namespace vtr::vitdctl;

constexpr char kDefaultSocket[] = VITD_HELPER_SOCKET;

void PrintUsage(FILE* out) {
  std::fprintf(out,
               "Usage: vitdctl [--root DIR | --socket PATH] [--timeout S] [--label] [--json] COMMAND [ARGS...]\n"
               "\n"
               "Sends a request to the demo-mode helper and prints each message it sends\n"
               "back as one line of JSON ({\"Response\":true}, {\"Progress\":42}, {\"Data\":\"...\"}).\n"
               "On a terminal, progress is drawn as a bar.\n"
               "\n"
               "Commands:\n");
  auto item = [out](const std::string& head, const char* summary) {
    if (head.size() <= 30) {
      std::fprintf(out, "  %-30s %s\n", head.c_str(), summary);
    } else {
      std::fprintf(out, "  %s\n  %-30s %s\n", head.c_str(), "", summary);
    }
  };
  item("send [--raw] FILE|-", "send the request dictionary in FILE: an XML or binary");
  item("", "property list, or JSON (FILE ends in .json or starts with '{');");
  item("", "its keys and their parameters are checked first (--raw: sent as they are)");
  for (const SubCommand& c : SubCommands()) item(std::string(c.name) + (*c.usage ? " " : "") + c.usage, c.summary);
  item("listNvram [--json]", "print this system's firmware variables (read here, not by the helper;");
  item("", "with --root, those of DIR/sys/firmware/efi/efivars)");
  item("status", "whether the socket and the helper are up, its version, where its logs are");
  std::fprintf(out,
               "\n"
               "Options:\n"
               "  --root DIR     talk to a helper running with --root DIR\n"
               "  --socket PATH  the helper's socket (default %s)\n"
               "  --timeout S    seconds to wait for the next message (default 60)\n"
               "  --label        start each line with the command it answers\n"
               "  --json         print progress as JSON lines even on a terminal (no bar)\n"
               "  -h, --help     show this text\n"
               "  -V, --version  show the version\n"
               "\n"
               "Exit status: 0 every response true (reboot and quitHelper: also the helper\n"
               "closing the connection without a reply), 1 a response false, 64 usage error\n"
               "(a request key or parameter of the wrong shape too),\n"
               "65 a request file that is not a dictionary, 66 a request file (listNvram: the\n"
               "variables) that cannot be read, 69 cannot connect, 75 no complete answer\n"
               "(timeout or connection closed).\n"
               "\n"
               "Options may stand before or after the command; an argument that starts\n"
               "with '-' follows \"--\". Why the helper answered false: journalctl -t\n"
               "vitd_helper -p err (under --root: the helper's standard error).\n",
               kDefaultSocket);
}

[[noreturn]] void UsageError(const std::string& message) {
  std::fprintf(stderr, "vitdctl: %s\n", message.c_str());
  std::fprintf(stderr, "Try 'vitdctl --help'.\n");
  std::exit(kExitUsage);
}

// The command's own options, gathered wherever they stood on the line.
struct CommandFlags {
  bool inclusive = false;
  bool json = false;
  bool raw = false;
  std::vector<std::pair<std::string, std::string>> named;  // --type, --identifier
};

// The arguments a sub-command's parameter builder reads: the words after
// the command, then its options as typed.
std::vector<std::string> SubCommandArguments(std::vector<std::string> words, const CommandFlags& flags) {
  if (flags.inclusive) words.push_back("--inclusive");
  for (const auto& [option, value] : flags.named) {
    words.push_back(option);
    words.push_back(value);
  }
  return words;
}

}  // namespace

int main(int argc, char** argv) {
  enum { kJson = 256, kRaw, kInclusive, kType, kIdentifier };
  static const struct option kLongOptions[] = {
      {"root", required_argument, nullptr, 'r'},     {"socket", required_argument, nullptr, 's'},
      {"timeout", required_argument, nullptr, 't'},  {"help", no_argument, nullptr, 'h'},
      {"version", no_argument, nullptr, 'V'},        {"label", no_argument, nullptr, 'l'},
      {"json", no_argument, nullptr, kJson},         {"raw", no_argument, nullptr, kRaw},
      {"inclusive", no_argument, nullptr, kInclusive}, {"type", required_argument, nullptr, kType},
      {"identifier", required_argument, nullptr, kIdentifier}, {nullptr, 0, nullptr, 0},
  };
  SessionOptions options;
  options.socketPath = kDefaultSocket;
  std::string root, socket;
  CommandFlags flags;
  int c;
  // Options may stand before or after the command (getopt permutes); an
  // argument that starts with '-' follows "--".
  opterr = 0;
  while ((c = getopt_long(argc, argv, ":hV", kLongOptions, nullptr)) != -1) {
    switch (c) {
      case 'r': root = optarg; break;
      case 's': socket = optarg; break;
      case 't': {
        char* end = nullptr;
        const double seconds = std::strtod(optarg, &end);
        if (end == optarg || *end != '\0' || !(seconds > 0) || seconds > 86400 * 365) {
          UsageError("--timeout takes a positive number of seconds");
        }
        options.timeout = std::chrono::milliseconds(static_cast<int64_t>(seconds * 1000));
        break;
      }
      case 'h': PrintUsage(stdout); return 0;
      case 'V': PrintVersion("vitdctl"); return 0;
      case 'l': options.label = true; break;
      case kJson: flags.json = true; break;
      case kRaw: flags.raw = true; break;
      case kInclusive: flags.inclusive = true; break;
      case kType: flags.named.emplace_back("--type", optarg); break;
      case kIdentifier: flags.named.emplace_back("--identifier", optarg); break;
      case ':': UsageError(std::string(argv[optind - 1]) + " needs a value");
      default: UsageError("unknown option " + std::string(argv[optind - 1]));
    }
  }
  if (!root.empty() && !socket.empty()) UsageError("--root and --socket exclude each other");
  if (!root.empty()) options.socketPath = root + kDefaultSocket;
  if (!socket.empty()) options.socketPath = socket;
  if (optind >= argc) UsageError("no command given");

  const std::string command = argv[optind];
  const std::vector<std::string> args(argv + optind + 1, argv + argc);
  if (flags.raw && command != "send") UsageError("--raw belongs to send");
  if (flags.inclusive && command != "createDeviceManifest") UsageError("--inclusive belongs to createDeviceManifest");
  if (!flags.named.empty() && command != "restoreAttributes") {
    UsageError(flags.named.front().first + " belongs to restoreAttributes");
  }
  if (command == "listNvram") {
    if (!args.empty()) UsageError("listNvram takes only --json");
    if (!socket.empty()) UsageError("listNvram reads the variables here: it takes --root, not --socket");
    return ListNvram(root, flags.json, stdout);
  }
  if (command == "status") {
    if (!args.empty()) UsageError("status takes no arguments");
    return PrintHelperStatus({options.socketPath, root, root.empty() && socket.empty()}, stdout);
  }
  UniqueValue request;
  bool endsHelper = false;
  if (command == "send") {
    if (args.size() != 1) UsageError("send takes one FILE (or - for standard input)");
    vtr::Result<UniqueValue> read = ReadRequestFile(args[0]);
    if (!read.ok()) {
      std::fprintf(stderr, "vitdctl: cannot read the request: %s\n", read.error().description().c_str());
      return read.error().code() == ENOENT || read.error().code() == EACCES ? kExitNoInput : kExitBadInput;
    }
    request = std::move(read).value();
    if (vtr::Status shaped = CheckRequestShape(*request); !flags.raw && !shaped.ok()) {
      UsageError(shaped.error().description() + " (send --raw sends it as it is)");
    }
  } else if (const SubCommand* sub = FindSubCommand(command)) {
    vtr::Result<UniqueValue> parameter = sub->parameter(SubCommandArguments(args, flags));
    if (!parameter.ok()) UsageError(command + " " + parameter.error().description());
    request.reset(vitd_dictionary());
    vitd_dictionary_set(request.get(), (command + ":").c_str(), std::move(parameter).value().release());
    endsHelper = sub->endsHelper;
  } else {
    UsageError("unknown command '" + command + "'");
  }
  options.progressBar = !flags.json && ::isatty(STDOUT_FILENO) == 1;
  options.closeIsSuccess = endsHelper;
  if (root.empty() && socket.empty()) {
    options.whereReasonsAre = "journalctl -t vitd_helper -p err";
    options.howToStart = "start the helper's socket: systemctl start vitd_helper.socket";
  } else {
    options.whereReasonsAre = "the helper's standard error (with --stderr), else journalctl -t vitd_helper -p err";
    options.howToStart = root.empty() ? "is the helper running?"
                                      : "start the helper: vitd_helper --root " + root + " --stderr";
  }
  if (request == nullptr) UsageError("out of memory");
  return RunSession(options, *request, stdout);
}
