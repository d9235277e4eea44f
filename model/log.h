// The logging functions every part of the helper uses.
//
//   VTRLog("Couldn't move %@ to %@", source, target);
//
// VTRLog formats the message (printf conversions plus %@, checked when the
// call is compiled; see platform/format.h) and hands it to the shared
// VTRLogModel. VTRLogError does the same for a failure, which the system log
// then carries at error priority (the day file reads the same).
// VTRJournalError tells the system log alone, at error priority, why a
// command answers NO (the step, the path, the system's error text) where the
// day file keeps no line for it. VTRDebugLog takes the same arguments and
// does nothing: the step-by-step traces passed to it are never formatted nor
// emitted.
#ifndef VTR_MODEL_LOG_H_
#define VTR_MODEL_LOG_H_

#include "model/log_model.h"
#include "platform/format.h"

namespace vtr {

template <typename... Args>
void VTRLog(FormatString<std::type_identity_t<Args>...> format, const Args&... args) {
  VTRLogModel::sharedInstance().logWithFormat<Args...>(LogPriority::kNotice, format, args...);
}

template <typename... Args>
void VTRLogError(FormatString<std::type_identity_t<Args>...> format, const Args&... args) {
  VTRLogModel::sharedInstance().logWithFormat<Args...>(LogPriority::kError, format, args...);
}

template <typename... Args>
void VTRJournalError(FormatString<std::type_identity_t<Args>...> format, const Args&... args) {
  VTRLogModel::sharedInstance().logWithFormat<Args...>(LogPriority::kJournalError, format, args...);
}

template <typename... Args>
inline void VTRDebugLog(FormatString<std::type_identity_t<Args>...>, const Args&...) {}

}  // namespace vtr

#endif  // VTR_MODEL_LOG_H_
