#include "vitd_helper/failure_journal.h"

#include "model/log.h"

namespace vtr {

void JournalFailure(std::string_view step, std::string_view path, const Error& why) {
  VTRJournalError("%@ %@: %@", step, path, why.description());
}

}  // namespace vtr
