#include "xpc/sec_task.h"

#include <mutex>
#include <span>
#include <vector>

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

namespace {

// The entitlements of the executables seen lately, by what identifies a
// file's content: the helper checks a peer's entitlement for every frame it
// sends, and an executable cannot change without its ctime changing.
struct ExecutableKey {
  dev_t device;
  ino_t inode;
  int64_t ctimeSeconds;
  long ctimeNanoseconds;
  off_t size;
  bool operator==(const ExecutableKey&) const = default;
};
constexpr size_t kMaxCachedExecutables = 64;
std::mutex cacheMutex;
std::vector<std::pair<ExecutableKey, Result<Value>>> cache;

Result<Value> ReadEntitlementsUncached(int executableFd, const struct stat& st);

}  // namespace

Result<Value> ReadEntitlements(int executableFd) {
  struct stat st;
  if (::fstat(executableFd, &st) != 0) return Error::FromErrno("fstat");
  if (Status trusted = CheckEntitlementsTrusted(st); !trusted) return trusted.error();
  const ExecutableKey key{st.st_dev, st.st_ino, st.st_ctim.tv_sec, st.st_ctim.tv_nsec, st.st_size};
  {
    std::lock_guard<std::mutex> lock(cacheMutex);
    for (const auto& [known, entitlements] : cache) {
      if (known == key) return entitlements;
    }
  }
  Result<Value> entitlements = ReadEntitlementsUncached(executableFd, st);
  std::lock_guard<std::mutex> lock(cacheMutex);
  if (cache.size() >= kMaxCachedExecutables) cache.clear();
  cache.emplace_back(key, entitlements);
  return entitlements;
}

namespace {

Result<Value> ReadEntitlementsUncached(int executableFd, const struct stat&) {
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

}  // namespace

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
