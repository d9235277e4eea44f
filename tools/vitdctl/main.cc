// vitdctl: the reference client of the demo-mode helper.
#include <getopt.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "tools/vitdctl/nvram_listing.h"
#include "tools/vitdctl/request.h"
#include "tools/vitdctl/session.h"

namespace {

using namespace vtr::vitdctl;

constexpr char kDefaultSocket[] = VITD_HELPER_SOCKET;

void PrintUsage(FILE* out) {
  std::fprintf(out,
               "Usage: vitdctl [--root DIR | --socket PATH] [--timeout S] [--label] COMMAND [ARGS...]\n"
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
  item("send FILE|-", "send the request dictionary in FILE: an XML or binary");
  item("", "property list, or JSON (FILE ends in .json or starts with '{')");
  for (const SubCommand& c : SubCommands()) item(std::string(c.name) + (*c.usage ? " " : "") + c.usage, c.summary);
  item("listNvram [--json]", "print this system's firmware variables (read here, not by the helper;");
  item("", "with --root, those of DIR/sys/firmware/efi/efivars)");
  std::fprintf(out,
               "\n"
               "Options:\n"
               "  --root DIR     talk to a helper running with --root DIR\n"
               "  --socket PATH  the helper's socket (default %s)\n"
               "  --timeout S    seconds to wait for the next message (default 60)\n"
               "  --label        start each line with the command it answers\n"
               "  -h, --help     show this text\n"
               "  -V, --version  show the version\n"
               "\n"
               "Exit status: 0 every response true (reboot and quitHelper: also the helper\n"
               "closing the connection without a reply), 1 a response false, 64 usage error,\n"
               "65 a request file that is not a dictionary, 66 a request file (listNvram: the\n"
               "variables) that cannot be read, 69 cannot connect, 75 no complete answer\n"
               "(timeout or connection closed).\n",
               kDefaultSocket);
}

[[noreturn]] void UsageError(const std::string& message) {
  std::fprintf(stderr, "vitdctl: %s\n", message.c_str());
  std::fprintf(stderr, "Try 'vitdctl --help'.\n");
  std::exit(kExitUsage);
}

}  // namespace

int main(int argc, char** argv) {
  static const struct option kLongOptions[] = {
      {"root", required_argument, nullptr, 'r'},     {"socket", required_argument, nullptr, 's'},
      {"timeout", required_argument, nullptr, 't'},  {"help", no_argument, nullptr, 'h'},
      {"version", no_argument, nullptr, 'V'},        {"label", no_argument, nullptr, 'l'},
      {nullptr, 0, nullptr, 0},
  };
  SessionOptions options;
  options.socketPath = kDefaultSocket;
  std::string root, socket;
  int c;
  // "+": options end at the command, so command arguments may start with '-'.
  opterr = 0;
  while ((c = getopt_long(argc, argv, "+:hV", kLongOptions, nullptr)) != -1) {
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
  UniqueValue request;
  if (command == "listNvram") {
    if (args.size() > 1 || (args.size() == 1 && args[0] != "--json")) UsageError("listNvram takes only --json");
    if (!socket.empty()) UsageError("listNvram reads the variables here: it takes --root, not --socket");
    return ListNvram(root, !args.empty(), stdout);
  }
  bool endsHelper = false;
  if (command == "send") {
    if (args.size() != 1) UsageError("send takes one FILE (or - for standard input)");
    vtr::Result<UniqueValue> read = ReadRequestFile(args[0]);
    if (!read.ok()) {
      std::fprintf(stderr, "vitdctl: cannot read the request: %s\n", read.error().description().c_str());
      return read.error().code() == ENOENT || read.error().code() == EACCES ? kExitNoInput : kExitBadInput;
    }
    request = std::move(read).value();
  } else if (const SubCommand* sub = FindSubCommand(command)) {
    vtr::Result<UniqueValue> parameter = sub->parameter(args);
    if (!parameter.ok()) UsageError(command + " " + parameter.error().description());
    request.reset(vitd_dictionary());
    vitd_dictionary_set(request.get(), (command + ":").c_str(), std::move(parameter).value().release());
    endsHelper = sub->endsHelper;
  } else {
    UsageError("unknown command '" + command + "'");
  }
  options.progressBar = ::isatty(STDOUT_FILENO) == 1;
  options.closeIsSuccess = endsHelper;
  if (request == nullptr) UsageError("out of memory");
  return RunSession(options, *request, stdout);
}
