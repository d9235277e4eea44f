// Reading XML property lists with expat.
//
// The document is hostile until proven otherwise, so the reader accepts only
// the property-list vocabulary and converts every value strictly:
//  - No entity is ever declared, expanded or fetched: an entity declaration,
//    a document type with an internal subset, a reference to an undeclared
//    entity and processing instructions all end the parse. The usual one-line
//    document type of a property list (an external identifier only) is
//    accepted; nothing it names is loaded.
//  - <integer> is an optional sign and decimal digits, or "0x" and hex digits
//    (written by some tools, read by Python's plistlib); values above
//    INT64_MAX up to UINT64_MAX become unsigned. <real> is a whole decimal or
//    "nan"/"inf" text. <date> is "YYYY-MM-DDTHH:MM:SSZ". <data> is padded
//    base64 whose unused bits are zero, with whitespace allowed anywhere.
//    Surrounding whitespace is not trimmed: " 12" is not an integer.
//  - Nesting is bounded by PlistLimits::maxDepth, the input by maxInputBytes.
//    XML cannot share objects, so the expanded result is never larger than
//    the input; maxExpandedNodes/Bytes are enforced only when set explicitly.
// Values are built bottom-up on an explicit stack: no recursion that a deep
// document could exhaust.
#include <expat.h>

#include <algorithm>
#include <charconv>
#include <cstring>
#include <limits>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/format.h"
#include "platform/plist.h"

namespace vtr {
namespace {

enum class Element { kPlist, kArray, kDict, kKey, kString, kInteger, kReal, kDate, kData, kTrue, kFalse };

struct ElementName {
  std::string_view name;
  Element element;
};

constexpr ElementName kElementNames[] = {
    {"plist", Element::kPlist},  {"array", Element::kArray},     {"dict", Element::kDict},
    {"key", Element::kKey},      {"string", Element::kString},   {"integer", Element::kInteger},
    {"real", Element::kReal},    {"date", Element::kDate},       {"data", Element::kData},
    {"true", Element::kTrue},    {"false", Element::kFalse},
};

std::optional<Element> ElementNamed(std::string_view name) {
  for (const ElementName& entry : kElementNames) {
    if (entry.name == name) return entry.element;
  }
  return std::nullopt;
}

std::string_view NameOf(Element element) {
  for (const ElementName& entry : kElementNames) {
    if (entry.element == element) return entry.name;
  }
  return "?";
}

bool IsContainer(Element element) {
  return element == Element::kPlist || element == Element::kArray || element == Element::kDict;
}

bool IsXmlSpace(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r'; }

bool IsAllSpace(std::string_view text) { return std::all_of(text.begin(), text.end(), IsXmlSpace); }

// ---- Strict conversions of element text -------------------------------

std::optional<Value> IntegerValue(uint64_t magnitude, bool negative) {
  constexpr uint64_t kInt64Max = static_cast<uint64_t>(std::numeric_limits<int64_t>::max());
  if (!negative) {
    return magnitude <= kInt64Max ? Value::Integer(static_cast<int64_t>(magnitude)) : Value::Unsigned(magnitude);
  }
  if (magnitude > kInt64Max + 1) return std::nullopt;
  return Value::Integer(static_cast<int64_t>(0 - magnitude));  // two's complement, exact for INT64_MIN
}

// All of text as an unsigned number in base, or nullopt (empty, stray
// characters, overflow).
std::optional<uint64_t> ParseUnsigned(std::string_view text, int base) {
  // from_chars takes no sign for unsigned types and no leading space.
  uint64_t value = 0;
  const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value, base);
  if (ec != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return value;
}

std::optional<Value> ParseInteger(std::string_view text) {
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    const std::optional<uint64_t> value = ParseUnsigned(text.substr(2), 16);
    if (!value) return std::nullopt;
    return IntegerValue(*value, false);
  }
  bool negative = false;
  if (!text.empty() && (text[0] == '-' || text[0] == '+')) {
    negative = text[0] == '-';
    text.remove_prefix(1);
  }
  const std::optional<uint64_t> magnitude = ParseUnsigned(text, 10);
  if (!magnitude) return std::nullopt;
  return IntegerValue(*magnitude, negative);
}

std::optional<Value> ParseReal(std::string_view text) {
  // from_chars takes no '+' and no leading space; allow the sign ourselves.
  bool negative = false;
  if (!text.empty() && (text[0] == '-' || text[0] == '+')) {
    negative = text[0] == '-';
    text.remove_prefix(1);
  }
  if (text.empty() || text[0] == '-' || text[0] == '+') return std::nullopt;
  double value = 0;
  const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
  // Out of range (overflow to infinity, underflow to zero) is refused rather
  // than rounded: such a text was not written from a double.
  if (ec != std::errc() || end != text.data() + text.size()) return std::nullopt;
  return Value::Real(negative ? -value : value);
}

// The value of a base64 digit, or -1.
int Base64Digit(char c) {
  if (c >= 'A' && c <= 'Z') return c - 'A';
  if (c >= 'a' && c <= 'z') return c - 'a' + 26;
  if (c >= '0' && c <= '9') return c - '0' + 52;
  if (c == '+') return 62;
  if (c == '/') return 63;
  return -1;
}

std::optional<Bytes> DecodeBase64(std::string_view text) {
  Bytes out;
  out.reserve(text.size() / 4 * 3);
  uint32_t group = 0;
  int digits = 0;   // digits in the current group of four
  int padding = 0;  // '=' seen; only more '=' and space may follow
  for (const char c : text) {
    if (IsXmlSpace(c)) continue;
    if (c == '=') {
      // Padding completes a group of two or three digits, at most twice.
      if (digits + padding < 2 || ++padding > 2 || digits + padding > 4) return std::nullopt;
      continue;
    }
    const int digit = Base64Digit(c);
    if (digit < 0 || padding > 0) return std::nullopt;
    group = group << 6 | static_cast<uint32_t>(digit);
    if (++digits == 4) {
      out.push_back(static_cast<uint8_t>(group >> 16));
      out.push_back(static_cast<uint8_t>(group >> 8));
      out.push_back(static_cast<uint8_t>(group));
      group = 0;
      digits = 0;
    }
  }
  if (digits == 0) return padding == 0 ? std::optional<Bytes>(std::move(out)) : std::nullopt;
  if (digits + padding != 4) return std::nullopt;
  // The bits past the last whole byte must be zero, or two texts would name
  // the same bytes.
  if (digits == 2) {
    if (group & 0xf) return std::nullopt;
    out.push_back(static_cast<uint8_t>(group >> 4));
  } else {
    if (group & 0x3) return std::nullopt;
    out.push_back(static_cast<uint8_t>(group >> 10));
    out.push_back(static_cast<uint8_t>(group >> 2));
  }
  return out;
}

// The value of a leaf element other than <string> from its whole text, or
// nullopt when the text is not a valid value of that element.
std::optional<Value> ConvertLeaf(Element element, std::string_view text) {
  switch (element) {
    case Element::kInteger:
      return ParseInteger(text);
    case Element::kReal:
      return ParseReal(text);
    case Element::kDate: {
      const std::optional<Date> date = Date::ParseIso8601(text);
      if (!date) return std::nullopt;
      return Value::DateValue(*date);
    }
    case Element::kData: {
      std::optional<Bytes> bytes = DecodeBase64(text);
      if (!bytes) return std::nullopt;
      return Value::Data(std::move(*bytes));
    }
    case Element::kTrue:
      return Value::Boolean(true);
    case Element::kFalse:
      return Value::Boolean(false);
    default:
      return std::nullopt;
  }
}

// ---- The parser ----------------------------------------------------------

struct ParserDeleter {
  void operator()(XML_ParserStruct* parser) const { XML_ParserFree(parser); }
};
using ParserPtr = std::unique_ptr<XML_ParserStruct, ParserDeleter>;

// One open <plist>, <array> or <dict> whose children are being collected.
struct Frame {
  Element element;
  Array items;                     // <plist> and <array>
  DictionaryBuilder entries;       // <dict>
  std::optional<std::string> key;  // <dict>: a key waiting for its value
};

class XmlPlistReader {
 public:
  explicit XmlPlistReader(const PlistLimits& limits) : limits_(limits) {}

  Result<Value> read(std::span<const uint8_t> bytes);

 private:
  static void XMLCALL OnStartElement(void* self, const XML_Char* name, const XML_Char** attributes);
  static void XMLCALL OnEndElement(void* self, const XML_Char* name);
  static void XMLCALL OnCharacters(void* self, const XML_Char* text, int length);
  static void XMLCALL OnStartDoctype(void* self, const XML_Char* name, const XML_Char* systemId,
                                     const XML_Char* publicId, int hasInternalSubset);
  static void XMLCALL OnEntityDecl(void* self, const XML_Char* name, int isParameterEntity, const XML_Char* value,
                                   int valueLength, const XML_Char* base, const XML_Char* systemId,
                                   const XML_Char* publicId, const XML_Char* notationName);
  static void XMLCALL OnSkippedEntity(void* self, const XML_Char* name, int isParameterEntity);
  static void XMLCALL OnProcessingInstruction(void* self, const XML_Char* target, const XML_Char* data);
  static int XMLCALL OnExternalEntityRef(XML_Parser parser, const XML_Char* context, const XML_Char* base,
                                         const XML_Char* systemId, const XML_Char* publicId);

  void startElement(std::string_view name, const XML_Char** attributes);
  void endElement();
  void characters(std::string_view text);
  // Checks that a value may start here (inside a container, in the right
  // place of a dict); fails otherwise.
  bool valueMayStart(std::string_view name);
  void pushContainer(Element element);
  void popContainer();
  void addValue(Value value);
  bool countNode(uint64_t bytes);
  // Records the first error and stops expat; later events are ignored.
  void fail(std::string what);

  const PlistLimits& limits_;
  XML_Parser parser_ = nullptr;
  std::vector<Frame> frames_;
  std::optional<Element> leaf_;  // an open element whose text is its value
  std::string text_;
  std::optional<Value> result_;
  std::optional<Error> error_;
  uint64_t nodes_ = 0;
  uint64_t valueBytes_ = 0;
};

Result<Value> XmlPlistReader::read(std::span<const uint8_t> bytes) {
  if (bytes.size() > limits_.maxInputBytes) {
    return Error::Invalid(Format("XML property list of %zu bytes is larger than the limit of %llu bytes",
                                 bytes.size(), static_cast<unsigned long long>(limits_.maxInputBytes)));
  }
  ParserPtr parser(XML_ParserCreate(nullptr));
  if (!parser) return Error(ENOMEM, "cannot create an XML parser");
  parser_ = parser.get();
  XML_SetUserData(parser_, this);
  // Parameter entities and the external subset are never read.
  XML_SetParamEntityParsing(parser_, XML_PARAM_ENTITY_PARSING_NEVER);
  XML_SetElementHandler(parser_, OnStartElement, OnEndElement);
  XML_SetCharacterDataHandler(parser_, OnCharacters);
  XML_SetStartDoctypeDeclHandler(parser_, OnStartDoctype);
  XML_SetEntityDeclHandler(parser_, OnEntityDecl);
  XML_SetSkippedEntityHandler(parser_, OnSkippedEntity);
  XML_SetProcessingInstructionHandler(parser_, OnProcessingInstruction);
  XML_SetExternalEntityRefHandler(parser_, OnExternalEntityRef);

  // expat takes an int length: feed large inputs in pieces.
  constexpr size_t kChunk = size_t{1} << 24;
  size_t offset = 0;
  do {
    const size_t length = std::min(kChunk, bytes.size() - offset);
    const bool last = offset + length == bytes.size();
    const char* chunk = reinterpret_cast<const char*>(bytes.data()) + offset;
    if (XML_Parse(parser_, chunk, static_cast<int>(length), last) != XML_STATUS_OK) {
      if (error_) return *error_;
      return Error::Invalid(Format("XML property list, line %lu: %s",
                                   static_cast<unsigned long>(XML_GetCurrentLineNumber(parser_)),
                                   XML_ErrorString(XML_GetErrorCode(parser_))));
    }
    offset += length;
  } while (offset < bytes.size());
  if (error_) return *error_;
  if (!result_) return Error::Invalid("XML property list has no <plist> value");
  return std::move(*result_);
}

void XmlPlistReader::fail(std::string what) {
  if (error_) return;
  error_ = Error::Invalid(Format("XML property list, line %lu: %s",
                                 static_cast<unsigned long>(XML_GetCurrentLineNumber(parser_)), what));
  XML_StopParser(parser_, XML_FALSE);
}

void XmlPlistReader::startElement(std::string_view name, const XML_Char** attributes) {
  const std::optional<Element> element = ElementNamed(name);
  if (!element) return fail(Format("unknown element <%s>", name));
  if (leaf_) return fail(Format("element <%s> inside a value that holds text", name));
  if (*element == Element::kPlist) {
    if (!frames_.empty() || result_) return fail("<plist> inside a property list");
    for (const XML_Char** a = attributes; *a != nullptr; a += 2) {
      if (std::strcmp(a[0], "version") != 0) return fail(Format("unknown attribute \"%s\" of <plist>", a[0]));
    }
    frames_.push_back(Frame{Element::kPlist, {}, {}, {}});
    return;
  }
  if (*attributes != nullptr) return fail(Format("unexpected attribute \"%s\" of <%s>", attributes[0], name));
  if (frames_.empty()) return fail(Format("document element is <%s>, not <plist>", name));
  if (*element == Element::kKey) {
    Frame& top = frames_.back();
    if (top.element != Element::kDict) return fail("<key> outside a dictionary");
    if (top.key) return fail(Format("key \"%s\" has no value", *top.key));
  } else if (!valueMayStart(name)) {
    return;
  }
  if (IsContainer(*element)) return pushContainer(*element);
  leaf_ = element;
  text_.clear();
}

bool XmlPlistReader::valueMayStart(std::string_view name) {
  const Frame& top = frames_.back();
  if (top.element == Element::kDict && !top.key) {
    fail(Format("<%s> in a dictionary without a key", name));
    return false;
  }
  if (top.element == Element::kPlist && !top.items.empty()) {
    fail("<plist> holds more than one value");
    return false;
  }
  return true;
}

void XmlPlistReader::pushContainer(Element element) {
  // frames_ holds the <plist> frame below the containers.
  if (frames_.size() > limits_.maxDepth) {
    return fail(Format("nesting deeper than %u levels", limits_.maxDepth));
  }
  frames_.push_back(Frame{element, {}, {}, {}});
}

void XmlPlistReader::endElement() {
  if (leaf_) {
    const Element element = *leaf_;
    leaf_.reset();
    if (element == Element::kKey) {
      if (!countNode(text_.size())) return;
      frames_.back().key = std::move(text_);
      return;
    }
    if (element == Element::kString) {
      if (!countNode(text_.size())) return;
      return addValue(Value::String(std::move(text_)));
    }
    std::optional<Value> value = ConvertLeaf(element, text_);
    // Enough of a bad text to recognise it in the message, not all of it.
    if (!value) return fail(Format("invalid <%s> value \"%s\"", NameOf(element), text_.substr(0, 40)));
    const Bytes* data = value->data();
    if (!countNode(data ? data->size() : 0)) return;
    return addValue(std::move(*value));
  }
  popContainer();
}

void XmlPlistReader::popContainer() {
  Frame frame = std::move(frames_.back());
  frames_.pop_back();
  if (frame.element == Element::kPlist) {
    if (frame.items.empty()) return fail("<plist> holds no value");
    result_ = std::move(frame.items.front());
    return;
  }
  if (!countNode(0)) return;
  if (frame.element == Element::kArray) return addValue(Value::ArrayOf(std::move(frame.items)));
  if (frame.key) return fail(Format("key \"%s\" has no value", *frame.key));
  std::optional<Value> dict = frame.entries.buildUnique();
  if (!dict) return fail("dictionary has a duplicate key");
  addValue(std::move(*dict));
}

void XmlPlistReader::addValue(Value value) {
  Frame& top = frames_.back();
  if (top.element == Element::kDict) {
    top.entries.add(std::move(*top.key), std::move(value));
    top.key.reset();
  } else {
    top.items.push_back(std::move(value));
  }
}

bool XmlPlistReader::countNode(uint64_t bytes) {
  ++nodes_;
  valueBytes_ += bytes;
  if (limits_.maxExpandedNodes != 0 && nodes_ > limits_.maxExpandedNodes) {
    fail("more objects than the limit");
    return false;
  }
  if (limits_.maxExpandedBytes != 0 && valueBytes_ > limits_.maxExpandedBytes) {
    fail("more string and data bytes than the limit");
    return false;
  }
  return true;
}

void XmlPlistReader::characters(std::string_view text) {
  if (leaf_ && *leaf_ != Element::kTrue && *leaf_ != Element::kFalse) {
    text_.append(text);
  } else if (!IsAllSpace(text)) {
    fail("text outside a value that holds text");
  }
}

// ---- expat callbacks -----------------------------------------------------

void XMLCALL XmlPlistReader::OnStartElement(void* self, const XML_Char* name, const XML_Char** attributes) {
  auto* reader = static_cast<XmlPlistReader*>(self);
  if (!reader->error_) reader->startElement(name, attributes);
}

void XMLCALL XmlPlistReader::OnEndElement(void* self, const XML_Char*) {
  auto* reader = static_cast<XmlPlistReader*>(self);
  if (!reader->error_) reader->endElement();
}

void XMLCALL XmlPlistReader::OnCharacters(void* self, const XML_Char* text, int length) {
  auto* reader = static_cast<XmlPlistReader*>(self);
  if (!reader->error_) reader->characters(std::string_view(text, static_cast<size_t>(length)));
}

void XMLCALL XmlPlistReader::OnStartDoctype(void* self, const XML_Char* name, const XML_Char*, const XML_Char*,
                                            int hasInternalSubset) {
  auto* reader = static_cast<XmlPlistReader*>(self);
  if (std::strcmp(name, "plist") != 0) return reader->fail(Format("document type \"%s\" is not plist", name));
  if (hasInternalSubset) reader->fail("a document type with an internal subset is not accepted");
}

void XMLCALL XmlPlistReader::OnEntityDecl(void* self, const XML_Char* name, int, const XML_Char*, int,
                                          const XML_Char*, const XML_Char*, const XML_Char*, const XML_Char*) {
  static_cast<XmlPlistReader*>(self)->fail(Format("entity \"%s\" declared; entities are not accepted", name));
}

void XMLCALL XmlPlistReader::OnSkippedEntity(void* self, const XML_Char* name, int) {
  static_cast<XmlPlistReader*>(self)->fail(Format("reference to undeclared entity \"%s\"", name));
}

void XMLCALL XmlPlistReader::OnProcessingInstruction(void* self, const XML_Char* target, const XML_Char*) {
  static_cast<XmlPlistReader*>(self)->fail(Format("processing instruction \"%s\" is not accepted", target));
}

int XMLCALL XmlPlistReader::OnExternalEntityRef(XML_Parser parser, const XML_Char*, const XML_Char*,
                                                const XML_Char*, const XML_Char*) {
  // Unreachable while entity declarations are refused; never fetch anyway.
  static_cast<XmlPlistReader*>(XML_GetUserData(parser))->fail("external entities are not accepted");
  return XML_STATUS_ERROR;
}

}  // namespace

Result<Value> ReadXmlPropertyList(std::span<const uint8_t> bytes, const PlistLimits& limits) {
  return XmlPlistReader(limits).read(bytes);
}

}  // namespace vtr
