#include "tools/vitdctl/request_shape.h"

#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include <nlohmann/json.hpp>

namespace vtr::vitdctl {
namespace {

using Json = nlohmann::json;

enum class Kind { kAnything, kString, kBoolean, kDictionary };

struct Entry {
  const char* key;
  Kind kind;
  bool required;
};

struct CommandShape {
  const char* key;
  Kind kind;
  std::vector<Entry> entries;  // of a dictionary
};

const std::vector<CommandShape>& Shapes() {
  static const std::vector<CommandShape> shapes = {
      {"migratePreferencesFile:", Kind::kAnything, {}},
      {"prepareLogContainer:", Kind::kString, {}},
      {"prepareWorkContainer:", Kind::kString, {}},
      {"removeWorkContainer:", Kind::kString, {}},
      {"createDeviceManifest:", Kind::kDictionary, {{"Path", Kind::kString, true}, {"Inclusive", Kind::kBoolean, false}}},
      {"createHardLink:", Kind::kDictionary, {{"FilePath", Kind::kString, true}, {"StagingPath", Kind::kString, true}}},
      {"restoreAttributes:",
       Kind::kDictionary,
       {{"StagingRootPath", Kind::kString, true},
        {"ManifestPath", Kind::kString, true},
        {"ContentType", Kind::kString, false},
        {"Identifier", Kind::kString, false}}},
      {"moveStagingToFinal:", Kind::kString, {}},
      {"deleteNvram:", Kind::kString, {}},
      {"writeNvram:", Kind::kDictionary, {{"Name", Kind::kString, true}, {"Value", Kind::kString, true}}},
      {"reboot:", Kind::kAnything, {}},
      {"quitHelper:", Kind::kAnything, {}},
      {"shrinkDataPartition:", Kind::kAnything, {}},
      {"expandDataPartition:", Kind::kAnything, {}},
  };
  return shapes;
}

const char* NameOf(Kind kind) {
  switch (kind) {
    case Kind::kString: return "a string";
    case Kind::kBoolean: return "a boolean";
    case Kind::kDictionary: return "a dictionary";
    case Kind::kAnything: break;
  }
  return "anything";
}

bool Fits(const Json& value, Kind kind) {
  switch (kind) {
    case Kind::kString: return value.is_string();
    // The helper reads a number as a boolean too (non-zero: YES).
    case Kind::kBoolean: return value.is_boolean() || value.is_number();
    case Kind::kDictionary: return value.is_object();
    case Kind::kAnything: break;
  }
  return true;
}

// "Path (a string), Inclusive (a boolean, optional)".
std::string DescribeEntries(const CommandShape& shape) {
  std::string text;
  for (const Entry& entry : shape.entries) {
    if (!text.empty()) text += ", ";
    text += std::string(entry.key) + " (" + NameOf(entry.kind) + (entry.required ? "" : ", optional") + ")";
  }
  return text;
}

std::string KnownKeys() {
  std::string text;
  for (const CommandShape& shape : Shapes()) text += std::string(text.empty() ? "" : ", ") + shape.key;
  return text;
}

const CommandShape* FindShape(const std::string& key) {
  for (const CommandShape& shape : Shapes()) {
    if (key == shape.key) return &shape;
  }
  return nullptr;
}

Status CheckEntry(const std::string& key, const Json& value) {
  const CommandShape* shape = FindShape(key);
  if (shape == nullptr) {
    if (FindShape(key + ":") != nullptr) {
      return Error::Invalid("unknown request key \"" + key + "\": the helper's keys end in a colon (\"" + key + ":\")");
    }
    return Error::Invalid("unknown request key \"" + key + "\"; the helper knows " + KnownKeys());
  }
  if (!Fits(value, shape->kind)) {
    std::string hint = std::string(NameOf(shape->kind));
    if (shape->kind == Kind::kDictionary) hint += " of " + DescribeEntries(*shape);
    return Error::Invalid("\"" + key + "\" takes " + hint + ", not " + value.dump());
  }
  if (shape->kind != Kind::kDictionary) return Status::Ok();
  for (const auto& [name, item] : value.items()) {
    const Entry* entry = nullptr;
    for (const Entry& e : shape->entries) {
      if (name == e.key) entry = &e;
    }
    if (entry == nullptr) {
      return Error::Invalid("\"" + key + "\" has no entry \"" + name + "\"; its entries are " +
                            DescribeEntries(*shape));
    }
    if (!Fits(item, entry->kind)) {
      return Error::Invalid("\"" + key + "\" entry \"" + name + "\" must be " + NameOf(entry->kind) + ", not " +
                            item.dump());
    }
  }
  for (const Entry& entry : shape->entries) {
    if (entry.required && !value.contains(entry.key)) {
      return Error::Invalid("\"" + key + "\" needs the entry \"" + entry.key + "\"; its entries are " +
                            DescribeEntries(*shape));
    }
  }
  return Status::Ok();
}

}  // namespace

Status CheckRequestShape(const vitd_value& request) {
  // The client library shows a value only as JSON; data reads as a string
  // there, which no command's parameter confuses with a path.
  std::unique_ptr<char, decltype(&std::free)> text(vitd_value_to_json(&request), &std::free);
  if (text == nullptr) return Error(ENOMEM, "request");
  const Json json = Json::parse(text.get(), nullptr, /*allow_exceptions=*/false);
  if (!json.is_object()) return Error::Invalid("the request must be a dictionary");
  if (json.empty()) return Error::Invalid("the request holds no command");
  for (const auto& [key, value] : json.items()) {
    if (Status checked = CheckEntry(key, value); !checked.ok()) return checked;
  }
  return Status::Ok();
}

}  // namespace vtr::vitdctl
