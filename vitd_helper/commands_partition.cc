// The data-partition commands. They call the resize drivers directly, not
// the operations object.
#include "model/log.h"
#include "vitd_helper/message_responder.h"
#include "vitd_helper/partition_resize.h"

namespace vtr {

bool VTRHMessageResponder::shrinkDataPartition(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder shrinkDataPartition:]", parameter);
  return ShrinkDataPartition() == 0;
}

bool VTRHMessageResponder::expandDataPartition(const Value& parameter) {
  VTRLog("Entering %s with parameter: %@", "-[VTRHMessageResponder expandDataPartition:]", parameter);
  return ExpandDataPartition() == 0;
}

}  // namespace vtr
