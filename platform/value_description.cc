// The "%@" description of a Value: old-style property-list text.
#include <charconv>
#include <cstdio>

#include "platform/value.h"

namespace vtr {
namespace {

constexpr int kIndentWidth = 4;

// Strings inside a collection are quoted unless they are a plain word.
bool NeedsQuotes(std::string_view s) {
  if (s.empty()) return true;
  for (unsigned char c : s) {
    const bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_' ||
                       c == '$' || c == '.' || c == '/' || c == ':';
    if (!plain) return true;
  }
  return false;
}

void AppendQuoted(std::string& out, std::string_view s) {
  out += '"';
  for (char c : s) {
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\t': out += "\\t"; break;
      case '\r': out += "\\r"; break;
      default: out += c;
    }
  }
  out += '"';
}

void AppendWord(std::string& out, std::string_view s, bool nested) {
  if (nested && NeedsQuotes(s)) {
    AppendQuoted(out, s);
  } else {
    out += s;
  }
}

void AppendReal(std::string& out, double d) {
  char buf[64];
  auto [end, ec] = std::to_chars(buf, buf + sizeof buf, d);
  if (ec == std::errc()) out.append(buf, end);
}

void AppendData(std::string& out, const Bytes& bytes) {
  static constexpr char kHex[] = "0123456789abcdef";
  out += '<';
  for (size_t i = 0; i < bytes.size(); ++i) {
    if (i > 0 && i % 4 == 0) out += ' ';
    out += kHex[bytes[i] >> 4];
    out += kHex[bytes[i] & 15];
  }
  out += '>';
}

void Describe(std::string& out, const Value& v, int depth) {
  const std::string indent(static_cast<size_t>(depth) * kIndentWidth, ' ');
  const std::string inner(static_cast<size_t>(depth + 1) * kIndentWidth, ' ');
  const bool nested = depth > 0;
  switch (v.type()) {
    case Value::Type::kNil:
      out += "(null)";
      break;
    case Value::Type::kBoolean:
      out += *v.boolean() ? '1' : '0';
      break;
    case Value::Type::kInteger:
      out += std::to_string(*v.integer());
      break;
    case Value::Type::kUnsigned:
      out += std::to_string(*v.unsignedInteger());
      break;
    case Value::Type::kReal:
      AppendReal(out, *v.real());
      break;
    case Value::Type::kString:
      AppendWord(out, *v.string(), nested);
      break;
    case Value::Type::kData:
      AppendData(out, *v.data());
      break;
    case Value::Type::kDate:
      AppendWord(out, v.date()->description(), nested);
      break;
    case Value::Type::kArray: {
      out += "(\n";
      const Array& items = *v.array();
      for (size_t i = 0; i < items.size(); ++i) {
        out += inner;
        Describe(out, items[i], depth + 1);
        out += i + 1 < items.size() ? ",\n" : "\n";
      }
      out += indent + ")";
      break;
    }
    case Value::Type::kDictionary:
      out += "{\n";
      for (const auto& [key, value] : *v.dictionary()) {
        out += inner;
        AppendWord(out, key, true);
        out += " = ";
        Describe(out, value, depth + 1);
        out += ";\n";
      }
      out += indent + "}";
      break;
  }
}

}  // namespace

std::string Value::description() const {
  std::string out;
  Describe(out, *this, 0);
  return out;
}

}  // namespace vtr
