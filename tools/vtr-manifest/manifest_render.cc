#include "tools/vtr-manifest/manifest_render.h"

#include "model/file_metadata.h"
#include "platform/file_manager.h"
#include "platform/format.h"
#include "platform/utf8.h"

namespace vtr::manifest_tool {
namespace {

char TypeLetter(const std::string* type) {
  if (type == nullptr) return '?';
  static const struct {
    const char* name;
    char letter;
  } kTypes[] = {
      {kNSFileTypeRegular, '-'},          {kNSFileTypeDirectory, 'd'},    {kNSFileTypeSymbolicLink, 'l'},
      {kNSFileTypeCharacterSpecial, 'c'}, {kNSFileTypeBlockSpecial, 'b'}, {kNSFileTypeSocket, 's'},
  };
  for (const auto& t : kTypes) {
    if (*type == t.name) return t.letter;
  }
  return '?';
}

}  // namespace

std::string EscapedText(std::string_view text) {
  static constexpr char kHex[] = "0123456789abcdef";
  std::string out;
  out.reserve(text.size());
  for (size_t i = 0; i < text.size();) {
    const unsigned char c = static_cast<unsigned char>(text[i]);
    // A whole, valid UTF-8 sequence stays as it is.
    const size_t length = c < 0x80 ? 1 : (c >> 5) == 6 ? 2 : (c >> 4) == 14 ? 3 : (c >> 3) == 30 ? 4 : 0;
    if (c == '\\') {
      out += "\\\\";
    } else if (length > 1 && i + length <= text.size() && IsValidUtf8(text.substr(i, length))) {
      out.append(text.substr(i, length));
      i += length;
      continue;
    } else if (length != 1 || c < 0x20 || c == 0x7f) {
      out += "\\x";
      out += kHex[c >> 4];
      out += kHex[c & 15];
    } else {
      out += static_cast<char>(c);
    }
    ++i;
  }
  return out;
}

namespace {

// The account name where the record has one, else the id, else "-".
std::string Account(const Dictionary* attributes, const char* nameKey, const char* idKey) {
  if (attributes == nullptr) return "-";
  if (const Value* name = attributes->find(nameKey); name != nullptr && name->string() != nullptr) {
    return EscapedText(*name->string());
  }
  if (const Value* id = attributes->find(idKey); id != nullptr && id->integer()) return std::to_string(*id->integer());
  return "-";
}

std::string Mode(const Dictionary* attributes) {
  const Value* mode = attributes != nullptr ? attributes->find(kNSFilePosixPermissions) : nullptr;
  if (mode == nullptr || !mode->integer()) return "-";
  return Format("%04llo", static_cast<unsigned long long>(*mode->integer() & 07777));
}

std::string Size(const Dictionary* attributes) {
  const Value* size = attributes != nullptr ? attributes->find(kNSFileSize) : nullptr;
  if (size == nullptr || !size->unsignedInteger()) return "-";
  return std::to_string(*size->unsignedInteger());
}

}  // namespace

std::string Hex(const Bytes& bytes) {
  static constexpr char kHex[] = "0123456789abcdef";
  std::string out;
  out.reserve(2 * bytes.size());
  for (const uint8_t b : bytes) {
    out += kHex[b >> 4];
    out += kHex[b & 15];
  }
  return out;
}

std::string RecordLine(std::string_view path, const Value& value) {
  const VTRFileMetadata record(value);
  const Dictionary* attributes = record.getFileAttributes();
  const Bytes* hash = record.getHash();
  std::string line;
  line += TypeLetter(record.getFileType());
  line += ' ' + Mode(attributes);
  line += ' ' + Account(attributes, kNSFileOwnerAccountName, kNSFileOwnerAccountID) + ':' +
          Account(attributes, kNSFileGroupOwnerAccountName, kNSFileGroupOwnerAccountID);
  line += ' ' + Size(attributes);
  line += ' ' + (hash != nullptr && !hash->empty() ? Hex(*hash) : std::string("-"));
  line += ' ' + EscapedText(path);
  if (const std::string* target = record.getTargetFile(); target != nullptr && !target->empty()) {
    line += " -> " + EscapedText(*target);
  }
  if (const Dictionary* xattrs = record.getExtendedAttributes(); xattrs != nullptr && !xattrs->empty()) {
    line += " xattrs=";
    bool first = true;
    for (const auto& entry : *xattrs) {
      if (!first) line += ',';
      line += EscapedText(entry.first);
      first = false;
    }
  }
  return line;
}

nlohmann::json ToJson(const Value& value) {
  switch (value.type()) {
    case Value::Type::kNil: return nullptr;
    case Value::Type::kBoolean: return *value.boolean();
    case Value::Type::kInteger: return *value.integer();
    case Value::Type::kUnsigned: return *value.unsignedInteger();
    case Value::Type::kReal: return *value.real();
    case Value::Type::kString: return *value.string();
    case Value::Type::kData: return Hex(*value.data());
    case Value::Type::kDate: return value.date()->iso8601();
    case Value::Type::kArray: {
      nlohmann::json array = nlohmann::json::array();
      for (const Value& item : *value.array()) array.push_back(ToJson(item));
      return array;
    }
    case Value::Type::kDictionary: {
      nlohmann::json object = nlohmann::json::object();
      for (const auto& [key, item] : *value.dictionary()) object[key] = ToJson(item);
      return object;
    }
  }
  return nullptr;
}

}  // namespace vtr::manifest_tool
