#include "model/xpc_dict_conv.h"

#include "model/log.h"
#include "platform/utf8.h"

namespace vtr {
namespace {

// The converted value, or nullopt when the type is not carried over.
std::optional<Value> ConvertValue(const XpcObject& object) {
  switch (object.type()) {
    case XpcObject::Type::kBool:
      return Value::Boolean(*object.boolValue());
    case XpcObject::Type::kInt64:
      return Value::Integer(*object.int64Value());
    case XpcObject::Type::kString:
      if (!IsValidUtf8(*object.string())) return std::nullopt;
      return Value::String(*object.string());
    case XpcObject::Type::kDictionary:
      // Nesting is bounded by the wire codec (64 levels), so recursion is too.
      return XPCDictionaryConversion::initWithXPCDictionary(*object.dictionary());
    default:
      return std::nullopt;
  }
}

}  // namespace

Value XPCDictionaryConversion::dictionaryWithXPCDictionary(const XpcObject& message) {
  const XpcDictionary* dictionary = message.dictionary();
  if (dictionary == nullptr) return Value();
  return initWithXPCDictionary(*dictionary);
}

Value XPCDictionaryConversion::initWithXPCDictionary(const XpcDictionary& dictionary) {
  DictionaryBuilder builder;
  builder.reserve(dictionary.size());
  for (const auto& [key, object] : dictionary) {
    std::optional<Value> value = IsValidUtf8(key) ? ConvertValue(object) : std::nullopt;
    if (!value) {
      VTRLogError("The value for key %@ has a type that is not supported yet", ToValidUtf8(key));
      continue;
    }
    builder.add(key, std::move(*value));
  }
  Value result = builder.build();
  VTRDebugLog("Converted from xpc to NSDictonary: %@", result);
  return result;
}

}  // namespace vtr
