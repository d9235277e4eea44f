#include "xpc/sec_task.h"

#include <span>

#include "platform/format.h"
#include "platform/plist.h"
#include "xpc/elf_section.h"

namespace vtr {

Status CheckEntitlementsTrusted(const struct stat& st) {
  if (!S_ISREG(st.st_mode)) return Error(EPERM, "the executable is not a regular file");
  if (st.st_uid != 0) return Error(EPERM, Format("the executable is owned by uid %u, not root", st.st_uid));
  if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
    return Error(EPERM, Format("the executable is writable by group or others (mode %04o)", st.st_mode & 07777));
  }
  return Status::Ok();
}

Result<Value> ReadEntitlements(int executableFd) {
  struct stat st;
  if (::fstat(executableFd, &st) != 0) return Error::FromErrno("fstat");
  if (Status trusted = CheckEntitlementsTrusted(st); !trusted) return trusted.error();

  auto section = ReadElfSection(executableFd, kEntitlementsSectionName, kMaxEntitlementsBytes);
  if (!section) return section.error();
  if (!section->has_value()) return Value();
  std::span<const uint8_t> bytes(**section);
  while (!bytes.empty() && bytes.back() == 0) bytes = bytes.first(bytes.size() - 1);

  PlistLimits limits;
  limits.maxInputBytes = kMaxEntitlementsBytes;
  limits.maxDepth = 16;
  Result<Value> plist = ReadPropertyList(bytes, limits);
  if (!plist) return Error::Invalid("entitlements: " + plist.error().description());
  if (plist->type() != Value::Type::kDictionary) return Error::Invalid("entitlements are not a dictionary");
  return plist;
}

Result<SecTask> SecTask::CreateWithPeer(const PeerIdentity& peer) {
  Result<UniqueFd> executable = peer.openExecutable();
  if (!executable) return executable.error();
  SecTask task;
  Result<Value> entitlements = ReadEntitlements(executable->get());
  if (entitlements) {
    task.entitlements_ = std::move(*entitlements);
  } else {
    task.entitlementsStatus_ = entitlements.error();
  }
  return task;
}

SecTask SecTask::WithEntitlements(Value entitlements) {
  SecTask task;
  task.entitlements_ = std::move(entitlements);
  return task;
}

Value SecTask::copyValueForEntitlement(std::string_view name) const { return entitlements_.get(name); }

}  // namespace vtr
