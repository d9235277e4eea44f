#include "vitd_helper/sandbox.h"

#include <unistd.h>

#include <memory>

#include "platform/accounts.h"
#include "xpc/peer_identity.h"

namespace vtr {

Result<UniqueFd> EnterSandboxRoot(const std::string& root) {
  Result<AccountDatabase> accounts = AccountDatabase::Load(root + "/etc/passwd", root + "/etc/group");
  if (!accounts.ok()) return accounts.error();
  AccountDatabase::SetShared(std::make_shared<const AccountDatabase>(std::move(accounts).value()));

  Result<UniqueFd> proc = OpenProcDirectory("/proc");
  if (!proc.ok()) return proc.error();

  if (::chdir(root.c_str()) != 0) return Error::FromErrno(root);
  if (::chroot(".") != 0) return Error::FromErrno(root);
  if (::chdir("/") != 0) return Error::FromErrno(root);
  return std::move(proc).value();
}

}  // namespace vtr
