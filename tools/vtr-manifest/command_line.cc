#include "tools/vtr-manifest/command_line.h"

#include <getopt.h>

#include <charconv>
#include <iterator>

namespace vtr::manifest_tool {
namespace {

using Command = CommandLine::Command;

// Upper bound of --jobs: more threads than this only contend for the disk.
constexpr unsigned kMaxJobs = 64;

constexpr unsigned Bit(Command command) { return 1u << static_cast<unsigned>(command); }
constexpr unsigned kWalking = Bit(Command::kCreate) | Bit(Command::kCompare);
constexpr unsigned kReading = Bit(Command::kShow) | Bit(Command::kCompare);
constexpr unsigned kAll = Bit(Command::kCreate) | Bit(Command::kShow) | Bit(Command::kCompare) |
                          Bit(Command::kSign) | Bit(Command::kVerify) | Bit(Command::kInspect);
constexpr unsigned kSigning = Bit(Command::kSign);
constexpr unsigned kVerifying = Bit(Command::kVerify);

WalkOptions& Walk(CommandLine& c) { return c.command == Command::kCreate ? c.create.walk : c.compare.walk; }
ManifestSelection& Selection(CommandLine& c) {
  return c.command == Command::kShow ? c.show.manifest : c.compare.manifest;
}

Status ParseJobs(const std::string& text, std::optional<unsigned>* jobs) {
  unsigned n = 0;
  const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), n);
  if (error != std::errc() || end != text.data() + text.size() || n > kMaxJobs) {
    return Error::Invalid("--jobs takes a number from 0 to " + std::to_string(kMaxJobs));
  }
  *jobs = n;
  return Status::Ok();
}

Status ParseFormat(const std::string& text, ShowFormat* format) {
  static const struct {
    const char* name;
    ShowFormat format;
  } kFormats[] = {{"text", ShowFormat::kText}, {"json", ShowFormat::kJson}, {"xml", ShowFormat::kXml}};
  for (const auto& f : kFormats) {
    if (text == f.name) {
      *format = f.format;
      return Status::Ok();
    }
  }
  return Error::Invalid("--format takes text, json or xml");
}

// "ID=FILE" of a container option.
Status ParseContainer(const std::string& text, std::vector<std::pair<std::string, std::string>>* containers) {
  const size_t equals = text.find('=');
  if (equals == std::string::npos || equals == 0 || equals + 1 == text.size()) {
    return Error::Invalid("a container is given as ID=MANIFEST");
  }
  containers->emplace_back(text.substr(0, equals), text.substr(equals + 1));
  return Status::Ok();
}

Status ParsePayloadVersion(const std::string& text, int32_t* version) {
  if (text != "3" && text != "4") return Error::Invalid("--payload-version takes 3 or 4");
  *version = text[0] - '0';
  return Status::Ok();
}

struct Option {
  const char* name;
  bool takesValue;
  unsigned commands;  // the commands that accept it
  Status (*apply)(CommandLine& c, const std::string& value);
};

const Option kOptions[] = {
    {"--relative-to", true, kWalking,
     [](CommandLine& c, const std::string& v) { Walk(c).relativeTo = v; return Status::Ok(); }},
    {"--inclusive", false, kWalking,
     [](CommandLine& c, const std::string&) { Walk(c).inclusive = true; return Status::Ok(); }},
    {"--skip", true, kWalking,
     [](CommandLine& c, const std::string& v) { Walk(c).skip.push_back(v); return Status::Ok(); }},
    {"--jobs", true, kWalking, [](CommandLine& c, const std::string& v) { return ParseJobs(v, &Walk(c).jobs); }},
    {"-o", true, Bit(Command::kCreate) | kSigning,
     [](CommandLine& c, const std::string& v) {
       (c.command == Command::kSign ? c.sign.output : c.create.output) = v;
       return Status::Ok();
     }},
    {"--key", true, kSigning, [](CommandLine& c, const std::string& v) { c.sign.key = v; return Status::Ok(); }},
    {"--certificate", true, kSigning,
     [](CommandLine& c, const std::string& v) { c.sign.certificates.push_back(v); return Status::Ok(); }},
    {"--app-data", true, kSigning,
     [](CommandLine& c, const std::string& v) { return ParseContainer(v, &c.sign.appData); }},
    {"--group-data", true, kSigning,
     [](CommandLine& c, const std::string& v) { return ParseContainer(v, &c.sign.groupData); }},
    {"--extension-data", true, kSigning,
     [](CommandLine& c, const std::string& v) { return ParseContainer(v, &c.sign.extensionData); }},
    {"--payload-version", true, kSigning,
     [](CommandLine& c, const std::string& v) { return ParsePayloadVersion(v, &c.sign.payloadVersion); }},
    {"--info", true, kSigning, [](CommandLine& c, const std::string& v) { c.sign.info = v; return Status::Ok(); }},
    {"--xml", false, kSigning, [](CommandLine& c, const std::string&) { c.sign.xml = true; return Status::Ok(); }},
    {"--anchors", true, kVerifying,
     [](CommandLine& c, const std::string& v) { c.verify.anchors.production = v; return Status::Ok(); }},
    {"--test-anchors", true, kVerifying,
     [](CommandLine& c, const std::string& v) { c.verify.anchors.test = v; return Status::Ok(); }},
    {"--efivars", true, kVerifying,
     [](CommandLine& c, const std::string& v) { c.verify.anchors.efiVariables = v; return Status::Ok(); }},
    {"--json", false, Bit(Command::kInspect) | Bit(Command::kCompare) | kVerifying,
     [](CommandLine& c, const std::string&) {
       (c.command == Command::kInspect ? c.inspect.json : c.command == Command::kCompare ? c.compare.json
                                                                                         : c.verify.json) = true;
       return Status::Ok();
     }},
    {"--format", true, Bit(Command::kShow),
     [](CommandLine& c, const std::string& v) { return ParseFormat(v, &c.show.format); }},
    {"--path", true, Bit(Command::kShow),
     [](CommandLine& c, const std::string& v) { c.show.path = v; return Status::Ok(); }},
    {"--container", true, kReading,
     [](CommandLine& c, const std::string& v) { Selection(c).container = v; return Status::Ok(); }},
    {"--verbose", false, kAll, [](CommandLine& c, const std::string&) { c.verbose = true; return Status::Ok(); }},
};

const struct {
  const char* name;
  Command command;
  size_t operands;  // FILE and/or DIR
} kCommands[] = {{"create", Command::kCreate, 1}, {"show", Command::kShow, 1},     {"compare", Command::kCompare, 2},
                 {"sign", Command::kSign, 1},     {"verify", Command::kVerify, 1}, {"inspect", Command::kInspect, 1}};

Status SetOperands(CommandLine& c, const std::vector<std::string>& operands) {
  switch (c.command) {
    case Command::kCreate:
      c.create.walk.tree = operands[0];
      if (c.create.output.empty()) return Error::Invalid("create needs -o FILE");
      break;
    case Command::kShow: c.show.manifest.file = operands[0]; break;
    case Command::kCompare:
      c.compare.manifest.file = operands[0];
      c.compare.walk.tree = operands[1];
      break;
    case Command::kSign:
      c.sign.manifest = operands[0];
      if (c.sign.output.empty()) return Error::Invalid("sign needs -o FILE");
      if (c.sign.key.empty()) return Error::Invalid("sign needs --key KEY");
      if (c.sign.certificates.empty()) return Error::Invalid("sign needs --certificate CERT (the signer's first)");
      break;
    case Command::kVerify: c.verify.file = operands[0]; break;
    case Command::kInspect: c.inspect.file = operands[0]; break;
    case Command::kHelp:
    case Command::kVersion: break;
  }
  return Status::Ok();
}

}  // namespace

Result<CommandLine> ParseCommandLine(const std::vector<std::string>& arguments) {
  CommandLine c;
  if (arguments.empty()) return Error::Invalid("no command given");
  const std::string& word = arguments[0];
  if (word == "--help" || word == "-h" || word == "help") return c;
  if (word == "--version" || word == "-V") {
    c.command = Command::kVersion;
    return c;
  }
  size_t operandCount = 0;
  bool known = false;
  for (const auto& command : kCommands) {
    if (word == command.name) {
      c.command = command.command;
      operandCount = command.operands;
      known = true;
    }
  }
  if (!known) return Error::Invalid("unknown command '" + word + "'");

  // getopt_long over the command's arguments, as the other tools parse
  // theirs: options anywhere, "--" ends them. Each option's index in kOptions
  // is its value; "-o" is the one short option.
  std::vector<struct option> longOptions;
  std::string shortOptions = ":h";
  for (size_t i = 0; i < std::size(kOptions); ++i) {
    const char* name = kOptions[i].name;
    if (name[1] != '-') {
      shortOptions += name[1];
      if (kOptions[i].takesValue) shortOptions += ':';
      continue;
    }
    longOptions.push_back({name + 2, kOptions[i].takesValue ? required_argument : no_argument, nullptr,
                           static_cast<int>(256 + i)});
  }
  longOptions.push_back({"help", no_argument, nullptr, 'h'});
  longOptions.push_back({nullptr, 0, nullptr, 0});
  std::vector<std::string> words = arguments;
  std::vector<char*> argv;
  for (std::string& w : words) argv.push_back(w.data());
  argv.push_back(nullptr);

  optind = 0;  // a fresh scan (GNU getopt)
  opterr = 0;
  int code;
  while ((code = getopt_long(static_cast<int>(words.size()), argv.data(), shortOptions.c_str(), longOptions.data(),
                             nullptr)) != -1) {
    if (code == 'h') {
      c.command = Command::kHelp;
      return c;
    }
    const std::string given = argv[optind - 1] != nullptr ? argv[optind - 1] : "";
    if (code == ':') return Error::Invalid(given + " needs a value");
    const Option* option = nullptr;
    if (code >= 256) {
      option = &kOptions[code - 256];
    } else {
      for (const Option& candidate : kOptions) {
        if (candidate.name[1] == code) option = &candidate;
      }
    }
    if (option == nullptr) return Error::Invalid("unknown option '" + given + "'");
    if ((option->commands & Bit(c.command)) == 0) {
      return Error::Invalid(std::string(option->name) + " is not an option of " + word);
    }
    if (Status applied = option->apply(c, optarg != nullptr ? optarg : ""); !applied.ok()) return applied.error();
  }
  // getopt permuted argv (not words): the operands are at its end.
  const std::vector<std::string> operands(argv.begin() + optind, argv.end() - 1);
  if (operands.size() != operandCount) {
    return Error::Invalid(word + (operandCount == 1 ? " takes one operand" : " takes two operands"));
  }
  if (Status set = SetOperands(c, operands); !set.ok()) return set.error();
  return c;
}

void PrintUsage(FILE* out) {
  std::fputs(
      "Usage:\n"
      "  vtr-manifest create DIR [--relative-to R] [--inclusive] [--skip PATH]... [--jobs N] -o FILE\n"
      "  vtr-manifest show FILE [--format text|json|xml] [--path KEY] [--container ID]\n"
      "  vtr-manifest compare FILE DIR [--relative-to R] [--inclusive] [--skip PATH]... [--jobs N]\n"
      "                       [--container ID] [--json]\n"
      "  vtr-manifest sign MANIFEST --key KEY --certificate CERT... -o FILE [--app-data ID=MANIFEST]...\n"
      "                    [--group-data ID=MANIFEST]... [--extension-data ID=MANIFEST]...\n"
      "                    [--payload-version 3|4] [--info TEXT] [--xml]\n"
      "  vtr-manifest verify FILE [--anchors DIR] [--test-anchors DIR] [--efivars DIR] [--json]\n"
      "  vtr-manifest inspect FILE [--json]\n"
      "\n"
      "create   writes the manifest of the tree DIR (each item's attributes, extended\n"
      "         attributes, SHA-1 and link target, keyed by its path relative to R,\n"
      "         default DIR; both are resolved first, so any spelling of DIR gives the\n"
      "         same keys) to FILE (\"-\": standard output) as a binary property list,\n"
      "         as the helper writes the device manifest. --inclusive adds DIR itself\n"
      "         as \"/\"; --skip leaves out a path (absolute, or relative to DIR) and\n"
      "         everything below it. An item that cannot be described (unreadable, or\n"
      "         a name that is not UTF-8) is named and nothing is written. On a\n"
      "         terminal, progress is drawn.\n"
      "show     prints a manifest, or the manifest in a signed manifest's payload\n"
      "         (\"Backup\", or a container's with --container; the signature is not\n"
      "         checked): one line per path (text), or JSON (data as hex), or XML.\n"
      "compare  walks DIR as create does and prints, for each path that differs\n"
      "         from the manifest FILE, \"PATH changed\" and a line per key with both\n"
      "         values (\"\\tKEY expected OLD, found NEW\": type, owner, group, mode,\n"
      "         size, digest, modification time, link target, xattrs, xattr NAME),\n"
      "         \"PATH missing\" (in FILE, not on disk) or \"PATH extra\" (on disk,\n"
      "         not in FILE); --json prints {\"matches\", \"differences\": [{\"path\",\n"
      "         \"status\", \"changes\": [{\"key\", \"expected\", \"found\"}]}]}.\n"
      "sign     writes a signed manifest: a payload holding MANIFEST as the whole-device\n"
      "         manifest (\"Backup\") and each --app-data/--group-data/--extension-data\n"
      "         manifest under its identifier, signed (RSA, PKCS#1 v1.5, SHA-1) with the\n"
      "         PEM key KEY; the certificates (PEM or DER, the signer's first, then its\n"
      "         intermediates) go into the file. Binary unless --xml; \"-o -\" writes\n"
      "         standard output. The key must belong to the first certificate.\n"
      "verify   checks a signed manifest as the helper does (its messages with --verbose):\n"
      "         the chain against the PEM roots in --anchors (default\n"
      "         /usr/share/vitd/anchors/production), or on a device whose Secure Boot\n"
      "         variable in --efivars says it is not fused, --test-anchors (default\n"
      "         /usr/share/vitd/anchors/test); then the signature of the payload.\n"
      "         --json prints {\"file\", \"trusted\", \"cause\", \"payloadVersion\",\n"
      "         \"records\"}.\n"
      "inspect  prints a signed manifest's version, certificates (subject, issuer,\n"
      "         validity), signature size and a summary of its payload; no check.\n"
      "\n"
      "Options:\n"
      "  --jobs N     threads reading files (0: one item at a time on the main thread)\n"
      "  --verbose    show the log lines of the manifest and signature code too\n"
      "  -h, --help     show this text\n"
      "  -V, --version  show the version\n"
      "\n"
      "Exit status: 0 success (compare: the tree matches; verify: trusted), 1 compare\n"
      "found differences or show found no such entry; verify: 3 malformed, 4\n"
      "unsupported version, 5 chain not trusted, 6 bad signature; 64 usage error,\n"
      "65 an input that is not what it must be (a file where a tree belongs, a\n"
      "property list that is no manifest, a name that is not UTF-8, a key that does\n"
      "not match the certificate), 66 an input that is missing or cannot be\n"
      "read (verify: also the trust anchors' folder), 74 reading a tree or writing the\n"
      "output failed.\n",
      out);
}

}  // namespace vtr::manifest_tool
