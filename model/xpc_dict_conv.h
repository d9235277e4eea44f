// Conversion of an incoming message dictionary into a plain Value
// dictionary, so that commands read their parameters with key lookups.
//
// Only the value types the protocol uses are carried over: bool (boolean),
// string (string), int64 (integer) and dictionary (converted by the same
// rules). Every other type, and any key or string that is not valid UTF-8,
// is left out with the log line "The value for key %@ has a type that is not
// supported yet"; the walk never stops early. Stateless and thread-safe.
#ifndef VTR_MODEL_XPC_DICT_CONV_H_
#define VTR_MODEL_XPC_DICT_CONV_H_

#include <optional>

#include "platform/value.h"
#include "xpc/xpc_object.h"

namespace vtr {

struct XPCDictionaryConversion {
  // The converted dictionary; nil when message is not a dictionary. An empty
  // message gives an empty dictionary.
  static Value dictionaryWithXPCDictionary(const XpcObject& message);
  // The conversion of one dictionary (what dictionaryWithXPCDictionary calls,
  // and what it calls for each nested dictionary).
  static Value initWithXPCDictionary(const XpcDictionary& dictionary);
};

}  // namespace vtr

#endif  // VTR_MODEL_XPC_DICT_CONV_H_
