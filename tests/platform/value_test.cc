#include "platform/value.h"

#include <gtest/gtest.h>

#include <climits>

#include "platform/date.h"
#include "platform/format.h"

namespace vtr {
namespace {

TEST(ValueTest, DescriptionOfScalarsAsObjectsPrint) {
  EXPECT_EQ(Value::String("bare text").description(), "bare text");
  EXPECT_EQ(Value::Boolean(true).description(), "1");
  EXPECT_EQ(Value::Boolean(false).description(), "0");
  EXPECT_EQ(Value::Integer(-42).description(), "-42");
  EXPECT_EQ(Value::Unsigned(UINT64_MAX).description(), "18446744073709551615");
  EXPECT_EQ(Value::Real(1.5).description(), "1.5");
  EXPECT_EQ(Value::Data(Bytes{0xde, 0xad, 0xbe, 0xef, 0x01}).description(), "<deadbeef 01>");
  EXPECT_EQ(Value::Data(Bytes{}).description(), "<>");
  EXPECT_EQ(Value::DateValue(Date::FromUnix(1795253400)).description(), "2026-11-21 09:30:00 +0000");
  EXPECT_EQ(Value().description(), "(null)");
}

TEST(ValueTest, DescriptionOfNestedCollectionsIsOldStylePropertyListText) {
  const Value v = Value::DictionaryOf({
      {"Path", Value::String("/private/var")},
      {"Inclusive", Value::Boolean(false)},
      {"List", Value::ArrayOf({Value::Integer(1), Value::String("two words"), Value::ArrayOf({})})},
      {"Nested", Value::DictionaryOf({{"a key", Value::String("")}})},
  });
  EXPECT_EQ(v.description(),
            "{\n"
            "    Inclusive = 0;\n"
            "    List = (\n"
            "        1,\n"
            "        \"two words\",\n"
            "        (\n"
            "        )\n"
            "    );\n"
            "    Nested = {\n"
            "        \"a key\" = \"\";\n"
            "    };\n"
            "    Path = /private/var;\n"
            "}");
  EXPECT_EQ(Format("Entering %s with parameter: %@", "-[X y:]", Value::ArrayOf({Value::String("q\"uote")})),
            "Entering -[X y:] with parameter: (\n    \"q\\\"uote\"\n)");
}

TEST(ValueTest, EqualityComparesNumbersByValueButNeverBooleansWithNumbers) {
  EXPECT_EQ(Value::Integer(5), Value::Unsigned(5));
  EXPECT_EQ(Value::Integer(5), Value::Real(5.0));
  EXPECT_NE(Value::Integer(5), Value::Real(5.5));
  EXPECT_NE(Value::Integer(-1), Value::Unsigned(UINT64_MAX));
  EXPECT_NE(Value::Unsigned(UINT64_MAX), Value::Real(1.8446744073709552e19 * 2));
  EXPECT_NE(Value::Integer(INT64_MAX), Value::Real(9223372036854775807.0));  // the double is 2^63
  EXPECT_NE(Value::Boolean(true), Value::Integer(1));
  EXPECT_EQ(Value::Boolean(true), Value::Boolean(true));
  EXPECT_NE(Value::String("a"), Value::Data(Bytes{'a'}));
  EXPECT_EQ(Value::Data(Bytes{1, 2}), Value::Data(Bytes{1, 2}));
  EXPECT_EQ(Value(), Value());
  EXPECT_EQ(Value::DictionaryOf({{"k", Value::Integer(420)}}), Value::DictionaryOf({{"k", Value::Unsigned(420)}}));
  EXPECT_NE(Value::DictionaryOf({{"k", Value::Integer(1)}}), Value::DictionaryOf({{"j", Value::Integer(1)}}));
}

TEST(ValueTest, TypedAccessAnswersOnlyForItsType) {
  const Value dict = Value::DictionaryOf({{"n", Value::Integer(7)}, {"s", Value::String("x")}});
  EXPECT_EQ(dict.get("n").integer(), 7);
  EXPECT_EQ(dict.get("s").integer(), std::nullopt);
  EXPECT_TRUE(dict.get("missing").isNil());
  EXPECT_TRUE(Value::String("x").get("n").isNil());
  EXPECT_EQ(Value::Unsigned(UINT64_MAX).integer(), std::nullopt);
  EXPECT_EQ(Value::Integer(-1).unsignedInteger(), std::nullopt);
  EXPECT_EQ(Value::Boolean(true).integer(), std::nullopt);
  EXPECT_TRUE(Value::Integer(2).boolValue());
  // Strings read as the platform reads them.
  for (const char* yes : {"YES", "yes", "true", "T", "1", "  9", "+1", "-0001", "Yawn", "12abc"}) {
    EXPECT_TRUE(Value::String(yes).boolValue()) << yes;
  }
  for (const char* no : {"", "NO", "false", "0", "  ", "-", "000", "abc", "x1", "\n0"}) {
    EXPECT_FALSE(Value::String(no).boolValue()) << no;
  }
  EXPECT_FALSE(Value().boolValue());
  // Integer values, as versions are read.
  const std::pair<Value, int32_t> ints[] = {
      {Value::Integer(2), 2},       {Value::Real(2.9), 2},          {Value::Real(-2.9), -2},
      {Value::String("2.5"), 2},    {Value::String(" +12abc"), 12}, {Value::String("-7"), -7},
      {Value::String("x1"), 0},     {Value::String("99999999999"), INT32_MAX},
      {Value::Boolean(true), 1},    {Value::Real(1e30), INT32_MAX}, {Value::Data({1}), 0},
      {Value::Integer(int64_t{1} << 32 | 3), 3},
  };
  for (const auto& [value, expected] : ints) EXPECT_EQ(value.intValue(), expected) << value.description();
}

TEST(ValueTest, DictionariesKeepKeysSortedAndUnique) {
  DictionaryBuilder builder;
  builder.add("b", Value::Integer(1));
  builder.add("a", Value::Integer(2));
  builder.add("b", Value::Integer(3));
  DictionaryBuilder strict = builder;
  const Value built = builder.build();
  ASSERT_EQ(built.dictionary()->size(), 2u);
  EXPECT_EQ(built.dictionary()->begin()->first, "a");
  EXPECT_EQ(built.get("b").integer(), 3);  // the last of a repeated key wins
  EXPECT_FALSE(strict.buildUnique().has_value());
}

TEST(DateTest, CalendarConversionAcrossCenturiesAndEpochs) {
  struct Case {
    int64_t unix;
    const char* description;
  } cases[] = {
      {0, "1970-01-01 00:00:00 +0000"},
      {978307200, "2001-01-01 00:00:00 +0000"},
      {-1, "1969-12-31 23:59:59 +0000"},
      {951782400, "2000-02-29 00:00:00 +0000"},
      {4102444800, "2100-01-01 00:00:00 +0000"},
      {2147483648, "2038-01-19 03:14:08 +0000"},
      {-30610224000, "1000-01-01 00:00:00 +0000"},
  };
  for (const Case& c : cases) {
    EXPECT_EQ(Date::FromUnix(c.unix).description(), c.description) << c.unix;
    EXPECT_EQ(UnixFromCivil(CivilFromUnix(c.unix)), c.unix);
  }
  // Fractions round down to the whole second, also before 1970.
  EXPECT_EQ(Date::FromUnix(-1, 500000000).description(), "1969-12-31 23:59:59 +0000");
}

TEST(DateTest, Iso8601IsParsedStrictly) {
  EXPECT_EQ(Date::ParseIso8601("2001-01-01T00:00:00Z"), Date{0});
  EXPECT_EQ(Date::ParseIso8601("2024-02-29T12:00:00Z")->iso8601(), "2024-02-29T12:00:00Z");
  for (const char* bad : {"2023-02-29T12:00:00Z", "2001-13-01T00:00:00Z", "2001-01-01T24:00:00Z",
                          "2001-01-01 00:00:00Z", "2001-01-01T00:00:00", "garbage", "", "2001-1-01T00:00:00Z",
                          "2001-01-01T00:00:60Z", "+001-01-01T00:00:00Z"}) {
    EXPECT_FALSE(Date::ParseIso8601(bad).has_value()) << bad;
  }
}

}  // namespace
}  // namespace vtr
