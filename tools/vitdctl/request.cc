#include "tools/vitdctl/request.h"

#include <nlohmann/json.hpp>

#include <cmath>
#include <fstream>
#include <iostream>
#include <iterator>
#include <sstream>

#include "platform/plist.h"

namespace vtr::vitdctl {
namespace {

using Json = nlohmann::json;

// Deepest JSON nesting accepted (the helper takes 64 levels).
constexpr int kMaxJsonDepth = 64;

Result<XpcObject> FromJson(const Json& json, int depth) {
  if (depth > kMaxJsonDepth) return Error::Invalid("JSON nested too deeply");
  switch (json.type()) {
    case Json::value_t::null:
      return XpcObject::Null();
    case Json::value_t::boolean:
      return XpcObject::Bool(json.get<bool>());
    case Json::value_t::number_integer:
      return XpcObject::Int64(json.get<int64_t>());
    case Json::value_t::number_unsigned: {
      const uint64_t u = json.get<uint64_t>();
      return u <= static_cast<uint64_t>(INT64_MAX) ? XpcObject::Int64(static_cast<int64_t>(u)) : XpcObject::Uint64(u);
    }
    case Json::value_t::number_float:
      return XpcObject::Double(json.get<double>());
    case Json::value_t::string:
      return XpcObject::String(json.get<std::string>());
    case Json::value_t::array: {
      XpcArray items;
      for (const Json& item : json) {
        Result<XpcObject> converted = FromJson(item, depth + 1);
        if (!converted.ok()) return converted;
        items.push_back(std::move(converted).value());
      }
      return XpcObject::Array(std::move(items));
    }
    case Json::value_t::object: {
      XpcDictionary dict;
      for (const auto& [key, item] : json.items()) {
        Result<XpcObject> converted = FromJson(item, depth + 1);
        if (!converted.ok()) return converted;
        dict.set(key, std::move(converted).value());
      }
      return XpcObject::Dictionary(std::move(dict));
    }
    default:
      return Error::Invalid("JSON value of an unsupported kind");
  }
}

Result<std::string> ReadAll(const std::string& path) {
  if (path == "-") {
    return std::string(std::istreambuf_iterator<char>(std::cin), std::istreambuf_iterator<char>());
  }
  std::ifstream in(path, std::ios::binary);
  if (!in) return Error::FromErrno(path);
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

bool LooksLikeJson(const std::string& path, const std::string& text) {
  if (path.size() >= 5 && path.compare(path.size() - 5, 5, ".json") == 0) return true;
  const size_t first = text.find_first_not_of(" \t\r\n");
  return first != std::string::npos && text[first] == '{';
}

// Sub-command parameters.
Result<XpcObject> NoParameter(const std::vector<std::string>& args) {
  if (!args.empty()) return Error::Invalid("takes no arguments");
  return XpcObject::Bool(true);
}

Result<XpcObject> OnePath(const std::vector<std::string>& args) {
  if (args.size() != 1) return Error::Invalid("takes exactly one PATH");
  return XpcObject::String(args[0]);
}

Result<XpcObject> ManifestParameter(const std::vector<std::string>& args) {
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
  return XpcObject::Dictionary({{"Path", XpcObject::String(path)}, {"Inclusive", XpcObject::Bool(inclusive)}});
}

Result<XpcObject> HardLinkParameter(const std::vector<std::string>& args) {
  if (args.size() != 2) return Error::Invalid("takes FILE and STAGING_PATH");
  return XpcObject::Dictionary({{"FilePath", XpcObject::String(args[0])}, {"StagingPath", XpcObject::String(args[1])}});
}

// STAGING_ROOT MANIFEST [--type TYPE] [--identifier ID]: a missing type or
// identifier stays out of the request (the whole device).
Result<XpcObject> RestoreParameter(const std::vector<std::string>& args) {
  std::vector<std::string> paths;
  XpcDictionary parameter;
  for (size_t i = 0; i < args.size(); ++i) {
    const bool named = args[i] == "--type" || args[i] == "--identifier";
    if (named && i + 1 == args.size()) return Error::Invalid(args[i] + " needs a value");
    if (named) {
      const char* key = args[i] == "--type" ? "ContentType" : "Identifier";
      parameter.set(key, XpcObject::String(args[i + 1]));
      ++i;
    } else {
      paths.push_back(args[i]);
    }
  }
  if (paths.size() != 2) return Error::Invalid("takes STAGING_ROOT and MANIFEST");
  parameter.set("StagingRootPath", XpcObject::String(paths[0]));
  parameter.set("ManifestPath", XpcObject::String(paths[1]));
  return XpcObject::Dictionary(std::move(parameter));
}

Result<XpcObject> NvramWriteParameter(const std::vector<std::string>& args) {
  if (args.size() != 2) return Error::Invalid("takes NAME and VALUE");
  return XpcObject::Dictionary({{"Name", XpcObject::String(args[0])}, {"Value", XpcObject::String(args[1])}});
}

Result<XpcObject> NvramName(const std::vector<std::string>& args) {
  if (args.size() != 1) return Error::Invalid("takes exactly one NAME");
  return XpcObject::String(args[0]);
}

}  // namespace

XpcObject XpcObjectFromValue(const Value& value) {
  switch (value.type()) {
    case Value::Type::kNil:
      return XpcObject::Null();
    case Value::Type::kBoolean:
      return XpcObject::Bool(*value.boolean());
    case Value::Type::kInteger:
      return XpcObject::Int64(*value.integer());
    case Value::Type::kUnsigned:
      return XpcObject::Uint64(*value.unsignedInteger());
    case Value::Type::kReal:
      return XpcObject::Double(*value.real());
    case Value::Type::kString:
      return XpcObject::String(*value.string());
    case Value::Type::kData:
      return XpcObject::Data(*value.data());
    case Value::Type::kDate:
      return XpcObject::Date(static_cast<int64_t>(std::llround(value.date()->unixSeconds() * 1e9)));
    case Value::Type::kArray: {
      XpcArray items;
      for (const Value& item : *value.array()) items.push_back(XpcObjectFromValue(item));
      return XpcObject::Array(std::move(items));
    }
    case Value::Type::kDictionary: {
      XpcDictionary dict;
      for (const auto& [key, item] : *value.dictionary()) dict.set(key, XpcObjectFromValue(item));
      return XpcObject::Dictionary(std::move(dict));
    }
  }
  return XpcObject::Null();
}

Result<XpcObject> RequestFromJson(const std::string& text) {
  Json json = Json::parse(text, nullptr, /*allow_exceptions=*/false);
  if (json.is_discarded()) return Error::Invalid("not valid JSON");
  if (!json.is_object()) return Error::Invalid("the request must be a JSON object");
  return FromJson(json, 1);
}

Result<XpcObject> ReadRequestFile(const std::string& path) {
  Result<std::string> text = ReadAll(path);
  if (!text.ok()) return text.error();
  if (LooksLikeJson(path, *text)) return RequestFromJson(*text);
  const auto* bytes = reinterpret_cast<const uint8_t*>(text->data());
  Result<Value> plist = ReadPropertyList(std::span<const uint8_t>(bytes, text->size()));
  if (!plist.ok()) return plist.error();
  if (plist->dictionary() == nullptr) return Error::Invalid("the request must be a dictionary");
  return XpcObjectFromValue(*plist);
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

XpcObject RequestFor(const SubCommand& command, XpcObject parameter) {
  return XpcObject::Dictionary({{std::string(command.name) + ":", std::move(parameter)}});
}

}  // namespace vtr::vitdctl
