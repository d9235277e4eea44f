// Writing XML property lists.
//
// The output is what any property-list reader expects: the XML declaration,
// the usual document type line, <plist version="1.0"> and the value indented
// with tabs, dictionary keys in sorted order. Text is escaped (& < > and a
// carriage return, which XML would otherwise turn into a line feed) and
// validated: a string that is not UTF-8, or that holds a character XML 1.0
// cannot carry (most controls below U+0020, U+FFFE, U+FFFF), makes the encode
// fail rather than produce a file no reader accepts. Dates keep whole seconds,
// the precision of the <date> text. The walk keeps its own stack, so no depth
// of value can exhaust the thread's.
#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "platform/base64.h"
#include "platform/format.h"
#include "platform/plist.h"

namespace vtr {
namespace {

constexpr std::string_view kHeader =
    "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
    "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" \"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n"
    "<plist version=\"1.0\">\n";
constexpr std::string_view kFooter = "</plist>\n";

// Base64 characters per line of a <data> element.
constexpr size_t kBase64LineLength = 68;

// Length of the UTF-8 sequence at text[i] and its code point, or 0 when the
// bytes there are not valid UTF-8 (overlong forms and surrogates included).
size_t DecodeUtf8(std::string_view text, size_t i, char32_t* codePoint) {
  const auto byte = [&](size_t k) { return static_cast<uint8_t>(text[k]); };
  const uint8_t lead = byte(i);
  if (lead < 0x80) {
    *codePoint = lead;
    return 1;
  }
  size_t length;
  char32_t cp;
  char32_t minimum;
  if ((lead & 0xe0) == 0xc0) {
    length = 2, cp = lead & 0x1f, minimum = 0x80;
  } else if ((lead & 0xf0) == 0xe0) {
    length = 3, cp = lead & 0x0f, minimum = 0x800;
  } else if ((lead & 0xf8) == 0xf0) {
    length = 4, cp = lead & 0x07, minimum = 0x10000;
  } else {
    return 0;
  }
  if (text.size() - i < length) return 0;
  for (size_t k = 1; k < length; ++k) {
    if ((byte(i + k) & 0xc0) != 0x80) return 0;
    cp = cp << 6 | (byte(i + k) & 0x3f);
  }
  if (cp < minimum || cp > 0x10ffff || (cp >= 0xd800 && cp <= 0xdfff)) return 0;
  *codePoint = cp;
  return length;
}

bool IsXmlChar(char32_t cp) {
  if (cp < 0x20) return cp == '\t' || cp == '\n' || cp == '\r';
  return cp != 0xfffe && cp != 0xffff;
}

// Appends text with the markup characters escaped; fails on text XML cannot
// carry.
Status AppendEscaped(std::string_view text, std::string* out) {
  for (size_t i = 0; i < text.size();) {
    char32_t cp = 0;
    const size_t length = DecodeUtf8(text, i, &cp);
    if (length == 0) {
      return Error::Invalid(Format("string is not valid UTF-8 at byte %zu; it cannot be written as XML", i));
    }
    if (!IsXmlChar(cp)) {
      return Error::Invalid(
          Format("string holds the character U+%04X, which XML cannot carry", static_cast<unsigned>(cp)));
    }
    switch (cp) {
      case '&': out->append("&amp;"); break;
      case '<': out->append("&lt;"); break;
      case '>': out->append("&gt;"); break;
      case '\r': out->append("&#13;"); break;
      default: out->append(text.substr(i, length));
    }
    i += length;
  }
  return Status::Ok();
}

std::string RealText(double d) {
  if (std::isnan(d)) return "nan";
  if (std::isinf(d)) return d < 0 ? "-inf" : "inf";
  // The shortest text that reads back as the same double.
  char buf[32];
  const auto [end, ec] = std::to_chars(buf, buf + sizeof buf, d);
  return std::string(buf, ec == std::errc() ? end : buf);
}

// The walk over the value: each open array or dictionary and how far into it
// the writer has come.
struct OpenContainer {
  const Value* value;
  size_t next = 0;
};

class XmlPlistWriter {
 public:
  Result<std::string> encode(const Value& top);

 private:
  Status writeValue(const Value& value);
  Status writeScalar(const Value& value);
  Status writeData(const Bytes& bytes);
  Status writeDate(const Date& date);
  void line(std::string_view text);
  void indent() { out_.append(stack_.size(), '\t'); }
  void closeContainer();

  std::string out_;
  std::vector<OpenContainer> stack_;
};

Result<std::string> XmlPlistWriter::encode(const Value& top) {
  out_.append(kHeader);
  if (Status s = writeValue(top); !s.ok()) return s.error();
  while (!stack_.empty()) {
    OpenContainer& open = stack_.back();
    const Value& container = *open.value;
    const Value* child = nullptr;
    if (const Array* array = container.array(); array != nullptr && open.next < array->size()) {
      child = &(*array)[open.next++];
    } else if (const Dictionary* dict = container.dictionary(); dict != nullptr && open.next < dict->size()) {
      const auto& entry = *(dict->begin() + static_cast<std::ptrdiff_t>(open.next++));
      indent();
      out_.append("<key>");
      if (Status s = AppendEscaped(entry.first, &out_); !s.ok()) return s.error();
      out_.append("</key>\n");
      child = &entry.second;
    }
    if (child == nullptr) {
      closeContainer();
      continue;
    }
    if (Status s = writeValue(*child); !s.ok()) return s.error();
  }
  out_.append(kFooter);
  return std::move(out_);
}

// Writes a scalar or an empty container whole, or opens a non-empty container
// for the loop in encode() to fill.
Status XmlPlistWriter::writeValue(const Value& value) {
  const Array* array = value.array();
  const Dictionary* dict = value.dictionary();
  if (array == nullptr && dict == nullptr) return writeScalar(value);
  const std::string_view name = array != nullptr ? "array" : "dict";
  if ((array != nullptr && array->empty()) || (dict != nullptr && dict->empty())) {
    line(Format("<%s/>", name));
    return Status::Ok();
  }
  line(Format("<%s>", name));
  stack_.push_back(OpenContainer{&value});
  return Status::Ok();
}

void XmlPlistWriter::closeContainer() {
  const bool isArray = stack_.back().value->array() != nullptr;
  stack_.pop_back();
  line(isArray ? "</array>" : "</dict>");
}

Status XmlPlistWriter::writeScalar(const Value& value) {
  switch (value.type()) {
    case Value::Type::kBoolean:
      line(*value.boolean() ? "<true/>" : "<false/>");
      return Status::Ok();
    case Value::Type::kInteger:
      line(Format("<integer>%lld</integer>", static_cast<long long>(*value.integer())));
      return Status::Ok();
    case Value::Type::kUnsigned:
      line(Format("<integer>%llu</integer>", static_cast<unsigned long long>(*value.unsignedInteger())));
      return Status::Ok();
    case Value::Type::kReal:
      line(Format("<real>%s</real>", RealText(*value.real())));
      return Status::Ok();
    case Value::Type::kString: {
      indent();
      out_.append("<string>");
      if (Status s = AppendEscaped(*value.string(), &out_); !s.ok()) return s;
      out_.append("</string>\n");
      return Status::Ok();
    }
    case Value::Type::kData:
      return writeData(*value.data());
    case Value::Type::kDate:
      return writeDate(*value.date());
    default:
      return Error::Invalid(Format("a %s value cannot be written in a property list", TypeName(value.type())));
  }
}

Status XmlPlistWriter::writeData(const Bytes& bytes) {
  if (bytes.empty()) {
    line("<data></data>");
    return Status::Ok();
  }
  std::string base64;
  AppendBase64(bytes, &base64);
  line("<data>");
  for (size_t i = 0; i < base64.size(); i += kBase64LineLength) {
    line(std::string_view(base64).substr(i, kBase64LineLength));
  }
  line("</data>");
  return Status::Ok();
}

Status XmlPlistWriter::writeDate(const Date& date) {
  // Only years 0000-9999 have a <date> text that reads back.
  static const double kFirst = static_cast<double>(UnixFromCivil(CivilTime{0, 1, 1, 0, 0, 0}));
  static const double kEnd = static_cast<double>(UnixFromCivil(CivilTime{10000, 1, 1, 0, 0, 0}));
  if (!(date.unixSeconds() >= kFirst && date.unixSeconds() < kEnd)) {
    return Error::Invalid(Format("date %f is outside the years 0000-9999 an XML property list can hold",
                                 date.secondsSince2001));
  }
  line(Format("<date>%s</date>", date.iso8601()));
  return Status::Ok();
}

void XmlPlistWriter::line(std::string_view text) {
  indent();
  out_.append(text);
  out_.push_back('\n');
}

}  // namespace

Result<std::string> EncodeXmlPropertyList(const Value& value) { return XmlPlistWriter().encode(value); }

}  // namespace vtr
