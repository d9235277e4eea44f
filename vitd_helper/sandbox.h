// Confinement of the helper to a sandbox root (--root DIR): everything the
// helper needs from outside the root is opened first, then it chroots, so
// that every path, fixed or sent by a client, resolves inside DIR.
#ifndef VTR_VITD_HELPER_SANDBOX_H_
#define VTR_VITD_HELPER_SANDBOX_H_

#include <string>

#include "platform/result.h"
#include "platform/unique_fd.h"

namespace vtr {

// Loads the account database from root/etc/passwd and root/etc/group, opens
// /proc, and chroots into root (the working directory becomes its "/").
// Returns the /proc directory. The system log must already be open.
Result<UniqueFd> EnterSandboxRoot(const std::string& root);

}  // namespace vtr

#endif  // VTR_VITD_HELPER_SANDBOX_H_
