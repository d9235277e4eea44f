#include "tools/vtr-manifest/record_differences.h"

#include <cmath>
#include <cstdio>
#include <map>

#include "platform/file_manager.h"
#include "tools/vtr-manifest/manifest_render.h"

namespace vtr::manifest_tool {
namespace {

using Json = nlohmann::json;

const Value* Attribute(const VTRFileMetadata& record, const char* key) {
  const Dictionary* attributes = record.getFileAttributes();
  return attributes != nullptr ? attributes->find(key) : nullptr;
}

std::string TypeOf(const VTRFileMetadata& record) {
  const std::string* type = record.getFileType();
  return type != nullptr ? *type : "";
}

Json Number(const Value* value) {
  if (value == nullptr) return nullptr;
  if (std::optional<uint64_t> n = value->unsignedInteger()) return *n;
  if (std::optional<int64_t> n = value->integer()) return *n;
  return nullptr;
}

// "root (0)": an account as a person knows it and as the file system does.
Json Account(const VTRFileMetadata& record, const char* nameKey, const char* idKey) {
  const Json id = Number(Attribute(record, idKey));
  const Value* name = Attribute(record, nameKey);
  if (name == nullptr || name->string() == nullptr) return id;
  return *name->string() + " (" + (id.is_null() ? std::string("?") : id.dump()) + ")";
}

Json Mode(const VTRFileMetadata& record) {
  const Json mode = Number(Attribute(record, kNSFilePosixPermissions));
  if (!mode.is_number()) return nullptr;
  char text[8];
  std::snprintf(text, sizeof text, "%04llo", static_cast<unsigned long long>(mode.get<int64_t>() & 07777));
  return text;
}

std::optional<double> ModificationSeconds(const VTRFileMetadata& record) {
  const Value* value = Attribute(record, kNSFileModificationDate);
  const std::optional<Date> date = value != nullptr ? value->date() : std::nullopt;
  if (!date) return std::nullopt;
  return date->unixSeconds();
}

// To the microsecond: whole seconds would hide most changes a copy makes.
Json TimeText(std::optional<double> time) {
  if (!time) return nullptr;
  const double seconds = *time;
  double whole = std::floor(seconds);
  long long micros = std::llround((seconds - whole) * 1e6);
  if (micros >= 1000000) {
    micros -= 1000000;
    whole += 1;
  }
  std::string text = Date::FromUnix(static_cast<int64_t>(whole)).iso8601();
  char fraction[32];
  std::snprintf(fraction, sizeof fraction, ".%06lldZ", micros);
  if (!text.empty() && text.back() == 'Z') text.pop_back();
  return text + fraction;
}

Json Digest(const VTRFileMetadata& record) {
  const Bytes* hash = record.getHash();
  return hash != nullptr && !hash->empty() ? Json(Hex(*hash)) : Json(nullptr);
}

Json LinkTarget(const VTRFileMetadata& record) {
  const std::string* target = record.getTargetFile();
  return target != nullptr ? Json(*target) : Json(nullptr);
}

// name -> value of the extended attributes compared (names sorted).
std::map<std::string, Json> Xattrs(const VTRFileMetadata& record) {
  std::map<std::string, Json> out;
  if (const Dictionary* xattrs = record.getExtendedAttributes()) {
    for (const auto& [name, value] : *xattrs) {
      if (name != kIgnoredExtendedAttribute) out.emplace(name, ToJson(value));
    }
  }
  return out;
}

Json Names(const std::map<std::string, Json>& xattrs) {
  Json names = Json::array();
  for (const auto& entry : xattrs) names.push_back(entry.first);
  return names;
}

}  // namespace

std::vector<Difference> DifferencesBetween(const VTRFileMetadata& expected, const VTRFileMetadata& found) {
  std::vector<Difference> differences;
  auto compare = [&](const char* key, const Json& was, const Json& is) {
    if (was != is) differences.push_back({key, was, is});
  };
  const std::string type = TypeOf(expected);
  compare("type", type, TypeOf(found));
  compare("owner", Account(expected, kNSFileOwnerAccountName, kNSFileOwnerAccountID),
          Account(found, kNSFileOwnerAccountName, kNSFileOwnerAccountID));
  compare("group", Account(expected, kNSFileGroupOwnerAccountName, kNSFileGroupOwnerAccountID),
          Account(found, kNSFileGroupOwnerAccountName, kNSFileGroupOwnerAccountID));
  compare("mode", Mode(expected), Mode(found));
  const bool bothRegular = type == kNSFileTypeRegular && TypeOf(found) == kNSFileTypeRegular;
  if (bothRegular) {
    compare("size", Number(Attribute(expected, kNSFileSize)), Number(Attribute(found, kNSFileSize)));
    compare("digest", Digest(expected), Digest(found));
  }
  // A manifest kept as XML holds whole seconds: the item's time is then
  // compared at that precision.
  const std::optional<double> was = ModificationSeconds(expected);
  std::optional<double> is = ModificationSeconds(found);
  if (was && is && *was == std::floor(*was) && std::floor(*is) == *was) is = was;
  compare("modification time", TimeText(was), TimeText(is));
  if (type == kNSFileTypeSymbolicLink || TypeOf(found) == kNSFileTypeSymbolicLink) {
    compare("link target", LinkTarget(expected), LinkTarget(found));
  }
  const std::map<std::string, Json> xattrsWere = Xattrs(expected);
  const std::map<std::string, Json> xattrsAre = Xattrs(found);
  compare("xattrs", Names(xattrsWere), Names(xattrsAre));
  for (const auto& [name, value] : xattrsWere) {
    const auto other = xattrsAre.find(name);
    if (other != xattrsAre.end() && other->second != value) differences.push_back({"xattr " + name, value, other->second});
  }
  return differences;
}

std::string ValueText(const nlohmann::json& value) {
  if (value.is_null()) return "none";
  if (value.is_string()) return EscapedText(value.get<std::string>());
  if (value.is_array()) {
    if (value.empty()) return "none";
    std::string text;
    for (const Json& item : value) {
      if (!text.empty()) text += ',';
      text += ValueText(item);
    }
    return text;
  }
  return value.dump();
}

}  // namespace vtr::manifest_tool
