// The XML property-list reader and writer: strict conversion of each value
// kind, refusal of entities and of anything outside the property-list
// vocabulary, bounds, and escaping on the way out.
#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/format.h"
#include "platform/plist.h"
#include "tests/support/test_support.h"

namespace vtr {
namespace {

constexpr std::string_view kDoctype =
    "<!DOCTYPE plist PUBLIC \"-//Apple//DTD PLIST 1.0//EN\" \"http://www.apple.com/DTDs/PropertyList-1.0.dtd\">\n";

std::string Document(std::string_view body) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n" + std::string(kDoctype) + "<plist version=\"1.0\">\n" +
         std::string(body) + "\n</plist>\n";
}

Result<Value> ReadXml(std::string_view xml, const PlistLimits& limits = {}) {
  return ReadXmlPropertyList(std::span(reinterpret_cast<const uint8_t*>(xml.data()), xml.size()), limits);
}

// The error message of a read that must fail, or "" (and a test failure).
std::string ReadError(std::string_view xml, const PlistLimits& limits = {}) {
  Result<Value> result = ReadXml(xml, limits);
  if (result.ok()) {
    ADD_FAILURE() << "accepted: " << xml << "\nas " << result->description();
    return "";
  }
  return result.error().message();
}

// Reads <element>text</element> as the only value of a document.
Result<Value> ReadLeaf(std::string_view element, std::string_view text) {
  return ReadXml(Document(Format("<%s>%s</%s>", element, text, element)));
}

// Each good text must read as its value, of exactly that type (Value equality
// alone would let 5 and 5.0 pass for each other); each bad text must fail.
void CheckLeaves(std::string_view element, const std::vector<std::pair<std::string, Value>>& good,
                 const std::vector<std::string>& bad) {
  for (const auto& [text, expected] : good) {
    SCOPED_TRACE(text);
    Result<Value> result = ReadLeaf(element, text);
    ASSERT_TRUE(result.ok()) << result.error().message();
    EXPECT_EQ(result->type(), expected.type());
    EXPECT_EQ(*result, expected);
  }
  for (const std::string& text : bad) {
    SCOPED_TRACE(text);
    Result<Value> result = ReadLeaf(element, text);
    EXPECT_FALSE(result.ok()) << "read as " << result->description();
  }
}

TEST(XmlPlistReadTest, IntegersAreDecimalOrHexAndNothingElse) {
  CheckLeaves("integer",
              {{"0", Value::Integer(0)},
               {"-0", Value::Integer(0)},
               {"+42", Value::Integer(42)},
               {"007", Value::Integer(7)},
               {"-17", Value::Integer(-17)},
               {"9223372036854775807", Value::Integer(std::numeric_limits<int64_t>::max())},
               {"-9223372036854775808", Value::Integer(std::numeric_limits<int64_t>::min())},
               {"9223372036854775808", Value::Unsigned(uint64_t{1} << 63)},
               {"18446744073709551615", Value::Unsigned(UINT64_MAX)},
               {"0x1F", Value::Integer(31)},
               {"0XffffFFFFffffFFFF", Value::Unsigned(UINT64_MAX)}},
              {"18446744073709551616", "-9223372036854775809", "0x10000000000000000", "12abc", "", " 12", "12 ",
               "\n12\n", "1_000", "1.0", "-", "+-1", "0x", "-0x10", "0x-1", "0x1g",
               "١٢" /* Arabic-Indic digits */});
}

TEST(XmlPlistReadTest, RealsAreWholeDecimalTexts) {
  const double inf = std::numeric_limits<double>::infinity();
  CheckLeaves("real",
              {{"1.5", Value::Real(1.5)},
               {"-0.25", Value::Real(-0.25)},
               {"+2", Value::Real(2)},
               {"1e300", Value::Real(1e300)},
               {"2.5E-3", Value::Real(2.5e-3)},
               {"inf", Value::Real(inf)},
               {"-inf", Value::Real(-inf)}},
              {"", "1.5x", " 1.5", "1.5 ", "1,5", "1e999", "0x1p3", "--1", "+-1", "e5"});
  Result<Value> nan = ReadLeaf("real", "nan");
  ASSERT_TRUE(nan.ok()) << nan.error().message();
  ASSERT_EQ(nan->type(), Value::Type::kReal);
  EXPECT_TRUE(std::isnan(*nan->real()));
}

TEST(XmlPlistReadTest, DatesAreStrictIso8601) {
  CheckLeaves("date",
              {{"2001-01-01T00:00:00Z", Value::DateValue(Date{0})},
               {"1969-07-20T20:17:40Z", Value::DateValue(Date::FromUnix(-14182940))},
               {"2100-03-01T12:00:00Z", Value::DateValue(Date::FromUnix(4107585600))},
               {"2024-02-29T23:59:59Z", Value::DateValue(Date::FromUnix(1709251199))}},
              {"", "garbage", "2024-13-01T00:00:00Z", "2023-02-29T00:00:00Z", "2024-01-01T24:00:00Z",
               "2024-01-01 00:00:00Z", "2024-01-01T00:00:00", "2024-01-01T00:00:00+01:00", " 2024-01-01T00:00:00Z",
               "1970-01-01"});
}

TEST(XmlPlistReadTest, DataIsStrictBase64) {
  CheckLeaves("data",
              {{"", Value::Data(Bytes{})},
               {"AAEC", Value::Data(Bytes{0, 1, 2})},
               {"AA==", Value::Data(Bytes{0})},
               {"AAE=", Value::Data(Bytes{0, 1})},
               {"/+8=", Value::Data(Bytes{0xff, 0xef})},
               {"\n\tAA\n\tEC \r\n", Value::Data(Bytes{0, 1, 2})}},
              {"AAE" /* padding missing */, "A===", "====", "=", "AA=A" /* digit after padding */, "AA==AA==",
               "AB==" /* unused bits set */, "AAF=", "AA!C", "AA-_" /* URL-safe alphabet */, "AAECA"});
}

TEST(XmlPlistReadTest, BooleansAreEmptyElements) {
  CheckLeaves("true", {{"", Value::Boolean(true)}, {" \n", Value::Boolean(true)}}, {"1", "true", "<true/>"});
  CheckLeaves("false", {{"", Value::Boolean(false)}}, {"0"});
  Result<Value> empty = ReadXml("<plist><false/></plist>");
  ASSERT_TRUE(empty.ok()) << empty.error().message();
  EXPECT_EQ(*empty, Value::Boolean(false));
}

TEST(XmlPlistReadTest, StringsKeepTheirTextExactly) {
  CheckLeaves("string",
              {{"", Value::String("")},
               {"  padded\n\ttext  ", Value::String("  padded\n\ttext  ")},
               {"a &amp; b &lt;c&gt; &quot;&apos;", Value::String("a & b <c> \"'")},
               {"&#x41;&#66;&#x1F600;", Value::String("AB\xF0\x9F\x98\x80")},
               {"<![CDATA[<not markup> & ]]>", Value::String("<not markup> & ")},
               {"Grüße, 日本語, ελληνικά", Value::String("Grüße, 日本語, ελληνικά")},
               {"one<!-- comment -->two", Value::String("onetwo")}},
              {"&#1;" /* not an XML character */, "&#0;", "<string/>"});
}

TEST(XmlPlistReadTest, OtherEncodingsArriveAsUtf8) {
  const std::string latin1 = "<?xml version=\"1.0\" encoding=\"ISO-8859-1\"?><plist><string>caf\xE9</string></plist>";
  Result<Value> value = ReadXml(latin1);
  ASSERT_TRUE(value.ok()) << value.error().message();
  EXPECT_EQ(*value, Value::String("caf\xC3\xA9"));

  EXPECT_FALSE(ReadXml("<plist><string>caf\xE9</string></plist>").ok()) << "invalid UTF-8 was accepted";
}

TEST(XmlPlistReadTest, ContainersNestAndKeepEveryEntry) {
  Result<Value> value = ReadXml(Document(R"(
<dict>
  <key>list</key>
  <array><integer>1</integer><array/><dict/></array>
  <key>empty</key><string/>
  <key>nested</key><dict><key>k</key><false/></dict>
</dict>)"));
  ASSERT_TRUE(value.ok()) << value.error().message();
  const Value expected = Value::DictionaryOf({
      {"list", Value::ArrayOf({Value::Integer(1), Value::ArrayOf({}), Value::DictionaryOf(Dictionary())})},
      {"empty", Value::String("")},
      {"nested", Value::DictionaryOf({{"k", Value::Boolean(false)}})},
  });
  EXPECT_EQ(*value, expected);

  // No document type, no version: still a property list.
  Result<Value> bare = ReadXml("<plist><array><true/></array></plist>");
  ASSERT_TRUE(bare.ok()) << bare.error().message();
  EXPECT_EQ(*bare, Value::ArrayOf({Value::Boolean(true)}));
}

TEST(XmlPlistReadTest, MalformedStructureIsRefused) {
  struct Case {
    std::string xml;
    std::string message;  // a part of the error message
  };
  const std::vector<Case> cases = {
      {"<plist></plist>", "holds no value"},
      {"<plist><true/><false/></plist>", "more than one value"},
      {"<array><true/></array>", "not <plist>"},
      {"<plist><plist><true/></plist></plist>", "<plist> inside"},
      {"<plist><dict><key>a</key></dict></plist>", "key \"a\" has no value"},
      {"<plist><dict><key>a</key><key>b</key><true/></dict></plist>", "key \"a\" has no value"},
      {"<plist><dict><true/></dict></plist>", "without a key"},
      {"<plist><dict><key>a</key><true/><key>a</key><false/></dict></plist>", "duplicate key"},
      {"<plist><array><key>a</key></array></plist>", "<key> outside"},
      {"<plist><key>a</key></plist>", "<key> outside"},
      {"<plist><array>text</array></plist>", "text outside"},
      {"<plist>text<true/></plist>", "text outside"},
      {"<plist><integer>1<integer>2</integer></integer></plist>", "inside a value"},
      {"<plist><bool>1</bool></plist>", "unknown element <bool>"},
      {"<plist><Array/></plist>", "unknown element <Array>"},
      {"<plist version=\"1.0\" extra=\"x\"><true/></plist>", "attribute \"extra\""},
      {"<plist><array id=\"1\"/></plist>", "attribute \"id\""},
      {"<plist><true/></plist><plist/>", "junk after document element"},
      {"<plist><true/>", "no element found"},
      {"", "no element found"},
      {"not xml at all", "syntax error"},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.xml);
    const std::string message = ReadError(c.xml);
    EXPECT_NE(message.find(c.message), std::string::npos) << message;
  }
}

TEST(XmlPlistReadTest, EntitiesAndDocumentTypeSubsetsAreRefused) {
  std::string laughs = "<?xml version=\"1.0\"?>\n<!DOCTYPE plist [\n <!ENTITY lol0 \"lol\">\n";
  for (int i = 1; i < 10; ++i) {
    laughs += Format(" <!ENTITY lol%d \"", i);
    for (int k = 0; k < 10; ++k) laughs += Format("&lol%d;", i - 1);
    laughs += "\">\n";
  }
  laughs += "]>\n<plist><string>&lol9;</string></plist>\n";
  EXPECT_NE(ReadError(laughs).find("internal subset is not accepted"), std::string::npos);

  const std::vector<std::string> refused = {
      "<!DOCTYPE plist []><plist><true/></plist>",
      "<!DOCTYPE plist [<!ENTITY x SYSTEM \"file:///etc/passwd\">]><plist><string>&x;</string></plist>",
      "<!DOCTYPE plist SYSTEM \"plist.dtd\" [<!ENTITY % p \"x\">]><plist><true/></plist>",
      "<!DOCTYPE html SYSTEM \"about:legacy-compat\"><plist><true/></plist>",
      // An undeclared entity is an error without a document type, and refused
      // with one (where XML would otherwise skip it).
      "<plist><string>&x;</string></plist>",
      std::string(kDoctype) + "<plist><string>&x;</string></plist>",
      "<?xml-stylesheet href=\"s.css\"?><plist><true/></plist>",
      "<plist><?pi data?><true/></plist>",
  };
  for (const std::string& xml : refused) {
    SCOPED_TRACE(xml);
    ReadError(xml);
  }
}

TEST(XmlPlistReadTest, TheUsualDocumentTypeIsAcceptedAndNeverLoaded) {
  EXPECT_TRUE(ReadXml(Document("<true/>")).ok());

  // A document type naming a local file that declares an entity: were it
  // loaded, &greeting; would expand to "hello".
  testing::TempDir dir;
  testing::WriteFile(dir / "plist.dtd", "<!ENTITY greeting \"hello\">\n");
  const std::string prolog = "<?xml version=\"1.0\"?>\n<!DOCTYPE plist SYSTEM \"" + (dir / "plist.dtd") + "\">\n";
  EXPECT_NE(ReadError(prolog + "<plist><string>&greeting;</string></plist>").find("undeclared entity \"greeting\""),
            std::string::npos);
  Result<Value> value = ReadXml(prolog + "<plist><string>hi</string></plist>");
  ASSERT_TRUE(value.ok()) << value.error().message();
  EXPECT_EQ(*value, Value::String("hi"));
}

TEST(XmlPlistReadTest, DepthIsBounded) {
  constexpr int kDepth = 100000;
  std::string bomb = "<plist>";
  for (int i = 0; i < kDepth; ++i) bomb += "<array>";
  for (int i = 0; i < kDepth; ++i) bomb += "</array>";
  bomb += "</plist>";
  EXPECT_NE(ReadError(bomb).find("nesting deeper than 512 levels"), std::string::npos);

  PlistLimits limits;
  limits.maxDepth = 3;
  EXPECT_TRUE(ReadXml("<plist><array><dict><key>k</key><array><true/></array></dict></array></plist>", limits).ok());
  EXPECT_NE(ReadError("<plist><array><array><array><array/></array></array></array></plist>", limits).find("deeper"),
            std::string::npos);
}

TEST(XmlPlistReadTest, SizeAndObjectLimitsAreEnforced) {
  const std::string xml = "<plist><array><string>abcdef</string><data>AAECAwQF</data><true/></array></plist>";
  PlistLimits limits;
  limits.maxInputBytes = xml.size();
  EXPECT_TRUE(ReadXml(xml, limits).ok());
  limits.maxInputBytes = xml.size() - 1;
  EXPECT_NE(ReadError(xml, limits).find("larger than the limit"), std::string::npos);

  limits = {};
  limits.maxExpandedNodes = 4;  // three leaves and the array
  EXPECT_TRUE(ReadXml(xml, limits).ok());
  limits.maxExpandedNodes = 3;
  EXPECT_FALSE(ReadXml(xml, limits).ok());

  limits = {};
  limits.maxExpandedBytes = 12;  // six string bytes and six data bytes
  EXPECT_TRUE(ReadXml(xml, limits).ok());
  limits.maxExpandedBytes = 11;
  EXPECT_FALSE(ReadXml(xml, limits).ok());
}

TEST(XmlPlistReadTest, EveryTruncationFailsCleanly) {
  const std::string xml = Document(R"(<dict>
	<key>count</key>
	<integer>-12</integer>
	<key>date</key>
	<date>2030-05-06T07:08:09Z</date>
	<key>list</key>
	<array>
		<real>2.5</real>
		<data>AAECAw==</data>
		<true/>
	</array>
	<key>name</key>
	<string>caf&amp;é</string>
</dict>)");
  ASSERT_TRUE(ReadXml(xml).ok());
  const size_t end = xml.rfind("</plist>") + std::string_view("</plist>").size();
  for (size_t length = 0; length < end; ++length) {
    EXPECT_FALSE(ReadXml(std::string_view(xml).substr(0, length)).ok()) << "prefix of " << length << " bytes";
  }
}

// ---- Writing ---------------------------------------------------------------

TEST(XmlPlistWriteTest, LayoutIsTheUsualOne) {
  const Value value = Value::DictionaryOf({
      {"b", Value::ArrayOf({Value::Integer(-1), Value::Boolean(true), Value::ArrayOf({})})},
      {"a", Value::Data(Bytes{0, 1, 2})},
      {"c", Value::DictionaryOf(Dictionary())},
      {"d", Value::Real(5)},
  });
  Result<std::string> xml = EncodeXmlPropertyList(value);
  ASSERT_TRUE(xml.ok()) << xml.error().message();
  EXPECT_EQ(*xml, Document(R"(<dict>
	<key>a</key>
	<data>
	AAEC
	</data>
	<key>b</key>
	<array>
		<integer>-1</integer>
		<true/>
		<array/>
	</array>
	<key>c</key>
	<dict/>
	<key>d</key>
	<real>5</real>
</dict>)"));
}

TEST(XmlPlistWriteTest, TextIsEscapedAndReadsBack) {
  const std::string tricky = "a&b<c>d\"e'f]]>g\r\nh\ti";
  const Value value = Value::DictionaryOf({{"<&>", Value::String(tricky)}});
  Result<std::string> xml = EncodeXmlPropertyList(value);
  ASSERT_TRUE(xml.ok()) << xml.error().message();
  EXPECT_NE(xml->find("<key>&lt;&amp;&gt;</key>"), std::string::npos) << *xml;
  EXPECT_NE(xml->find("<string>a&amp;b&lt;c&gt;d\"e'f]]&gt;g&#13;\nh\ti</string>"), std::string::npos) << *xml;
  Result<Value> back = ReadXml(*xml);
  ASSERT_TRUE(back.ok()) << back.error().message();
  EXPECT_EQ(*back, value);
}

TEST(XmlPlistWriteTest, TextXmlCannotCarryIsRefused) {
  const std::vector<std::string> bad = {
      std::string("nul\0byte", 8),
      "\x01", "\x08", "\x0B", "\x0C", "\x0E", "\x1F",
      "\xEF\xBF\xBE",      // U+FFFE
      "\xEF\xBF\xBF",      // U+FFFF
      "\x80",              // continuation byte alone
      "\xC0\xAF",          // overlong '/'
      "\xED\xA0\x80",      // surrogate
      "\xF4\x90\x80\x80",  // above U+10FFFF
      "\xE2\x82",          // cut short
      "\xFF",
  };
  for (const std::string& text : bad) {
    SCOPED_TRACE(::testing::PrintToString(text));
    EXPECT_FALSE(EncodeXmlPropertyList(Value::String(text)).ok());
    EXPECT_FALSE(EncodeXmlPropertyList(Value::DictionaryOf({{text, Value::Boolean(true)}})).ok());
  }
  // The edges of what is allowed.
  for (const std::string text : {"\t\n", "\x7F", "\xEF\xBF\xBD", "\xF4\x8F\xBF\xBF"}) {
    SCOPED_TRACE(::testing::PrintToString(text));
    Result<std::string> xml = EncodeXmlPropertyList(Value::String(text));
    ASSERT_TRUE(xml.ok()) << xml.error().message();
    Result<Value> back = ReadXml(*xml);
    ASSERT_TRUE(back.ok()) << back.error().message();
    EXPECT_EQ(*back, Value::String(text));
  }
}

TEST(XmlPlistWriteTest, ValuesWithoutXmlFormAreRefused) {
  EXPECT_FALSE(EncodeXmlPropertyList(Value()).ok());
  EXPECT_FALSE(EncodeXmlPropertyList(Value::ArrayOf({Value::Integer(1), Value()})).ok());
  EXPECT_FALSE(EncodeXmlPropertyList(Value::DictionaryOf({{"k", Value()}})).ok());
  EXPECT_FALSE(EncodeXmlPropertyList(Value::DateValue(Date::FromUnix(-62167219201))).ok());  // year -1
  EXPECT_FALSE(EncodeXmlPropertyList(Value::DateValue(Date::FromUnix(253402300800))).ok());  // year 10000
  EXPECT_FALSE(EncodeXmlPropertyList(Value::DateValue(Date{std::nan("")})).ok());
  EXPECT_TRUE(EncodeXmlPropertyList(Value::DateValue(Date::FromUnix(-62167219200))).ok());  // 0000-01-01
  EXPECT_TRUE(EncodeXmlPropertyList(Value::DateValue(Date::FromUnix(253402300799))).ok());  // 9999-12-31
}

}  // namespace
}  // namespace vtr
