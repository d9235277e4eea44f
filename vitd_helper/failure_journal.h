// Why a command answers NO, for the system journal: the day file keeps the
// lines it always had, and the journal (priority err) gets the step that
// failed, the path it acted on and the system's error text, so that
// `journalctl -t vitd_helper -p err` explains every false answer.
#ifndef VTR_VITD_HELPER_FAILURE_JOURNAL_H_
#define VTR_VITD_HELPER_FAILURE_JOURNAL_H_

#include <string_view>

#include "platform/result.h"

namespace vtr {

// "<step> <path>: <why.description()>" to the system log alone, at err;
// e.g. "Cannot remove /private/var/x: /private/var/x/a: Operation not
// permitted".
void JournalFailure(std::string_view step, std::string_view path, const Error& why);

}  // namespace vtr

#endif  // VTR_VITD_HELPER_FAILURE_JOURNAL_H_
