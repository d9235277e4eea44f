#include "model/xpc_dict_conv.h"

#include <gtest/gtest.h>

#include "tests/support/test_support.h"

namespace vtr {
namespace {

TEST(XpcDictConvTest, CarriesBooleansStringsIntegersAndNestedDictionaries) {
  testing::LogCapture log;
  const XpcObject message = XpcObject::Dictionary({
      {"reboot:", XpcObject::Bool(true)},
      {"createDeviceManifest:",
       XpcObject::Dictionary({{"Path", XpcObject::String("/private/var")}, {"Inclusive", XpcObject::Bool(false)}})},
      {"n", XpcObject::Int64(-7)},
  });
  const Value converted = XPCDictionaryConversion::dictionaryWithXPCDictionary(message);
  EXPECT_EQ(converted, Value::DictionaryOf({
                           {"reboot:", Value::Boolean(true)},
                           {"createDeviceManifest:", Value::DictionaryOf({{"Path", Value::String("/private/var")},
                                                                          {"Inclusive", Value::Boolean(false)}})},
                           {"n", Value::Integer(-7)},
                       }));
  // A boolean stays a boolean, not the number 1.
  EXPECT_EQ(converted.get("reboot:").type(), Value::Type::kBoolean);
  EXPECT_TRUE(log.messages().empty());
}

TEST(XpcDictConvTest, LeavesOutOtherTypesAndInvalidTextWithALogLineEach) {
  testing::LogCapture log;
  const XpcObject message = XpcObject::Dictionary({
      {"u", XpcObject::Uint64(1)},
      {"d", XpcObject::Double(2)},
      {"a", XpcObject::Array({})},
      {"t", XpcObject::Date(0)},
      {"bytes", XpcObject::Data({1})},
      {"bad", XpcObject::String("\xc3\x28")},
      {"nested", XpcObject::Dictionary({{"x", XpcObject::Null()}, {"ok", XpcObject::String("yes")}})},
      {"k\xff", XpcObject::Bool(true)},
      {"kept", XpcObject::Int64(1)},
  });
  const Value converted = XPCDictionaryConversion::dictionaryWithXPCDictionary(message);
  EXPECT_EQ(converted, Value::DictionaryOf({{"nested", Value::DictionaryOf({{"ok", Value::String("yes")}})},
                                            {"kept", Value::Integer(1)}}));
  for (const char* key : {"u", "d", "a", "t", "bytes", "bad", "x", "k\xef\xbf\xbd"}) {
    EXPECT_TRUE(log.contains(std::string("The value for key ") + key + " has a type that is not supported yet"))
        << key;
  }
}

TEST(XpcDictConvTest, EmptyGivesEmptyAndANonDictionaryNil) {
  EXPECT_EQ(XPCDictionaryConversion::dictionaryWithXPCDictionary(XpcObject::Dictionary(XpcDictionary())),
            Value::DictionaryOf(Dictionary()));
  EXPECT_TRUE(XPCDictionaryConversion::dictionaryWithXPCDictionary(XpcObject::String("x")).isNil());
}

}  // namespace
}  // namespace vtr
