// The commands a request may name: the one place that maps a request key to
// the responder's method. A key not in the table is answered as a method the
// responder does not have; the table holds the command keys and nothing else,
// so no other method of the responder can be reached by a request.
#ifndef VTR_VITD_HELPER_COMMAND_TABLE_H_
#define VTR_VITD_HELPER_COMMAND_TABLE_H_

#include <string_view>

#include "platform/value.h"
#include "vitd_helper/message_responder.h"

namespace vtr {

struct Command {
  std::string_view key;  // the request key, e.g. "prepareWorkContainer:"
  bool (VTRHMessageResponder::*method)(const Value& parameter);
};

// The command named by key, or null.
const Command* FindCommand(std::string_view key);

}  // namespace vtr

#endif  // VTR_VITD_HELPER_COMMAND_TABLE_H_
