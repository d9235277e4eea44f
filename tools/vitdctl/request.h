// Requests for the helper: read from a file (XML or binary property list, or
// JSON) or made by a sub-command, as the message object that is sent.
#ifndef VTR_TOOLS_VITDCTL_REQUEST_H_
#define VTR_TOOLS_VITDCTL_REQUEST_H_

#include <memory>
#include <string>
#include <vector>

#include "client/vitd_client.h"
#include "platform/result.h"
#include "platform/value.h"

namespace vtr::vitdctl {

struct ValueFree {
  void operator()(vitd_value* value) const { vitd_value_free(value); }
};
// A client-library value that frees itself.
using UniqueValue = std::unique_ptr<vitd_value, ValueFree>;

// The request dictionary in the file at path ("-" for standard input). JSON
// when the name ends in ".json" or the text starts with "{" (after white
// space); a property list otherwise. The top level must be a dictionary.
Result<UniqueValue> ReadRequestFile(const std::string& path);

// A property-list value as a message value (dates become nanoseconds since
// 1970, unsigned integers uint64, reals doubles, nil null).
UniqueValue MessageValueOf(const Value& value);

// One sub-command: the request key it sends and how its arguments become
// the key's value.
struct SubCommand {
  const char* name;      // as typed: "prepareWorkContainer"
  const char* usage;     // arguments, e.g. "PATH"
  const char* summary;   // one line for --help
  // The request's value from the arguments after the name, or an Error
  // describing the misuse.
  Result<UniqueValue> (*parameter)(const std::vector<std::string>& args);
  // The command ends the helper (or the machine): the connection closing
  // without a reply is its success.
  bool endsHelper = false;
};

// Every sub-command, in the order --help lists them.
const std::vector<SubCommand>& SubCommands();
const SubCommand* FindSubCommand(const std::string& name);


}  // namespace vtr::vitdctl

#endif  // VTR_TOOLS_VITDCTL_REQUEST_H_
