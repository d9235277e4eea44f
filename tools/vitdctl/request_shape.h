// The shape of a request as the helper understands it: the fourteen request
// keys and what each takes (a path string, a dictionary with these entries,
// or anything, which the command ignores). vitdctl checks a request file
// against it before sending, so that a key the helper does not know or a
// parameter of the wrong kind is refused at once with a hint, rather than
// met with the helper's silence or a false answer. `send --raw` skips it.
#ifndef VTR_TOOLS_VITDCTL_REQUEST_SHAPE_H_
#define VTR_TOOLS_VITDCTL_REQUEST_SHAPE_H_

#include "client/vitd_client.h"
#include "platform/result.h"

namespace vtr::vitdctl {

// Ok when every key of request (a dictionary) is a command of the helper and
// its value has the command's shape; otherwise an Error whose message names
// the first fault and how to put it right.
Status CheckRequestShape(const vitd_value& request);

}  // namespace vtr::vitdctl

#endif  // VTR_TOOLS_VITDCTL_REQUEST_SHAPE_H_
