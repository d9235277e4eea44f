#include "tools/vitdctl/request.h"

#include <cmath>
#include <utility>

#include "platform/plist.h"
#include "platform/read_fully.h"

namespace vtr::vitdctl {
namespace {

// A request is a few paths; anything near this is not one.
constexpr size_t kMaxRequestFileBytes = 16 << 20;

bool LooksLikeJson(const std::string& path, const std::string& text) {
  if (path.size() >= 5 && path.compare(path.size() - 5, 5, ".json") == 0) return true;
  const size_t first = text.find_first_not_of(" \t\r\n");
  return first != std::string::npos && text[first] == '{';
}

UniqueValue String(const std::string& text) { return UniqueValue(vitd_string(text.c_str())); }

// A dictionary of the entries, which it takes over.
UniqueValue Dictionary(std::initializer_list<std::pair<const char*, vitd_value*>> entries) {
  UniqueValue dict(vitd_dictionary());
  for (const auto& [key, item] : entries) vitd_dictionary_set(dict.get(), key, item);
  return dict;
}

// Sub-command parameters.
Result<UniqueValue> NoParameter(const std::vector<std::string>& args) {
  if (!args.empty()) return Error::Invalid("takes no arguments");
  return UniqueValue(vitd_bool(1));
}

Result<UniqueValue> OnePath(const std::vector<std::string>& args) {
  if (args.size() != 1) return Error::Invalid("takes exactly one PATH");
  return String(args[0]);
}

Result<UniqueValue> ManifestParameter(const std::vector<std::string>& args) {
  std::string path;
  bool inclusive = false;
  for (const std::string& arg : args) {
    if (arg == "--inclusive") {
      inclusive = true;
    } else if (path.empty()) {
      path = arg;
    } else {
      return Error::Invalid("takes one PATH and --inclusive");
    }
  }
  if (path.empty()) return Error::Invalid("takes a PATH");
  return Dictionary({{"Path", vitd_string(path.c_str())}, {"Inclusive", vitd_bool(inclusive)}});
}

Result<UniqueValue> HardLinkParameter(const std::vector<std::string>& args) {
  if (args.size() != 2) return Error::Invalid("takes FILE and STAGING_PATH");
  return Dictionary({{"FilePath", vitd_string(args[0].c_str())}, {"StagingPath", vitd_string(args[1].c_str())}});
}

// STAGING_ROOT MANIFEST [--type TYPE] [--identifier ID]: a missing type or
// identifier stays out of the request (the whole device).
Result<UniqueValue> RestoreParameter(const std::vector<std::string>& args) {
  std::vector<std::string> paths;
  UniqueValue parameter(vitd_dictionary());
  for (size_t i = 0; i < args.size(); ++i) {
    const bool named = args[i] == "--type" || args[i] == "--identifier";
    if (named && i + 1 == args.size()) return Error::Invalid(args[i] + " needs a value");
    if (named) {
      const char* key = args[i] == "--type" ? "ContentType" : "Identifier";
      vitd_dictionary_set(parameter.get(), key, vitd_string(args[i + 1].c_str()));
      ++i;
    } else {
      paths.push_back(args[i]);
    }
  }
  if (paths.size() != 2) return Error::Invalid("takes STAGING_ROOT and MANIFEST");
  vitd_dictionary_set(parameter.get(), "StagingRootPath", vitd_string(paths[0].c_str()));
  vitd_dictionary_set(parameter.get(), "ManifestPath", vitd_string(paths[1].c_str()));
  return parameter;
}

Result<UniqueValue> NvramWriteParameter(const std::vector<std::string>& args) {
  if (args.size() != 2) return Error::Invalid("takes NAME and VALUE");
  return Dictionary({{"Name", vitd_string(args[0].c_str())}, {"Value", vitd_string(args[1].c_str())}});
}

Result<UniqueValue> NvramName(const std::vector<std::string>& args) {
  if (args.size() != 1) return Error::Invalid("takes exactly one NAME");
  return String(args[0]);
}

}  // namespace

UniqueValue MessageValueOf(const Value& value) {
  switch (value.type()) {
    case Value::Type::kNil:
      return UniqueValue(vitd_null());
    case Value::Type::kBoolean:
      return UniqueValue(vitd_bool(*value.boolean()));
    case Value::Type::kInteger:
      return UniqueValue(vitd_int64(*value.integer()));
    case Value::Type::kUnsigned:
      return UniqueValue(vitd_uint64(*value.unsignedInteger()));
    case Value::Type::kReal:
      return UniqueValue(vitd_double(*value.real()));
    case Value::Type::kString:
      return String(*value.string());
    case Value::Type::kData:
      return UniqueValue(vitd_data(value.data()->data(), value.data()->size()));
    case Value::Type::kDate:
      return UniqueValue(vitd_date(static_cast<int64_t>(std::llround(value.date()->unixSeconds() * 1e9))));
    case Value::Type::kArray: {
      UniqueValue items(vitd_array());
      for (const Value& item : *value.array()) vitd_array_append(items.get(), MessageValueOf(item).release());
      return items;
    }
    case Value::Type::kDictionary: {
      UniqueValue dict(vitd_dictionary());
      for (const auto& [key, item] : *value.dictionary()) {
        vitd_dictionary_set(dict.get(), key.c_str(), MessageValueOf(item).release());
      }
      return dict;
    }
  }
  return UniqueValue(vitd_null());
}

Result<UniqueValue> ReadRequestFile(const std::string& path) {
  Result<std::string> text = ReadFileNamed(path, kMaxRequestFileBytes);
  if (!text.ok()) return text.error();
  if (LooksLikeJson(path, *text)) {
    vitd_value* request = nullptr;
    const int status = vitd_value_from_json(text->c_str(), &request);
    if (status != VITD_OK) return Error::Invalid(vitd_strerror(status));
    UniqueValue owned(request);
    if (vitd_value_type(request) != VITD_TYPE_DICTIONARY) return Error::Invalid("the request must be a JSON object");
    return owned;
  }
  const auto* bytes = reinterpret_cast<const uint8_t*>(text->data());
  Result<Value> plist = ReadPropertyList(std::span<const uint8_t>(bytes, text->size()));
  if (!plist.ok()) return plist.error();
  if (plist->dictionary() == nullptr) return Error::Invalid("the request must be a dictionary");
  return MessageValueOf(*plist);
}

const std::vector<SubCommand>& SubCommands() {
  static const std::vector<SubCommand> commands = {
      {"migratePreferencesFile", "", "move root's demo-mode preferences file to mobile", NoParameter},
      {"prepareLogContainer", "PATH", "create a log directory (under /var/logs) writable by mobile", OnePath},
      {"prepareWorkContainer", "PATH", "create a work directory writable by mobile, without VTR_staging",
       OnePath},
      {"removeWorkContainer", "PATH", "remove a directory and everything below it", OnePath},
      {"createDeviceManifest", "PATH [--inclusive]",
       "write the manifest of PATH (/private/var: the whole device) to the work container", ManifestParameter},
      {"createHardLink", "FILE STAGING_PATH", "hard-link FILE (a directory: its tree) at STAGING_PATH",
       HardLinkParameter},
      {"restoreAttributes", "STAGING_ROOT MANIFEST [--type TYPE --identifier ID]",
       "restore the attributes a signed MANIFEST records (of one container, with TYPE and ID) under STAGING_ROOT",
       RestoreParameter},
      {"moveStagingToFinal", "PATH", "move the staging directory PATH to /var/backup", OnePath},
      {"writeNvram", "NAME VALUE", "set the firmware variable NAME to VALUE (empty: remove it)",
       NvramWriteParameter},
      {"deleteNvram", "NAME", "remove the firmware variable NAME", NvramName},
      {"reboot", "", "restart the machine (no answer when it does)", NoParameter, true},
      {"quitHelper", "", "end the helper (it sends no answer)", NoParameter, true},
      {"shrinkDataPartition", "", "give half of the data volume's free space back to the disk", NoParameter},
      {"expandDataPartition", "", "grow the data partition over every block the others leave free", NoParameter},
  };
  return commands;
}

const SubCommand* FindSubCommand(const std::string& name) {
  for (const SubCommand& command : SubCommands()) {
    if (name == command.name) return &command;
  }
  return nullptr;
}

}  // namespace vtr::vitdctl
