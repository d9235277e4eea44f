// SecTask: the entitlements of the process behind a connection, looked up
// for each message.
//
// A client's entitlements are a property-list dictionary (XML or binary)
// held in the ELF section ".vtr_entitlements" of its executable; NUL bytes
// after the property list are ignored. They are believed only when that
// executable, opened through the peer's /proc entry, is a regular file owned
// by root that neither its group nor others may write: anyone else could
// have written the section themselves.
//
// A SecTask is created from the identity captured at accept and fails when
// the peer process has gone or now runs another executable. It reads the
// entitlements once, at creation. Thread-compatible.
#ifndef VTR_XPC_SEC_TASK_H_
#define VTR_XPC_SEC_TASK_H_

#include <sys/stat.h>

#include <cstddef>
#include <string_view>

#include "platform/result.h"
#include "platform/value.h"
#include "xpc/peer_identity.h"

namespace vtr {

inline constexpr char kEntitlementsSectionName[] = ".vtr_entitlements";
// Larger sections are not read: entitlements are a few keys.
inline constexpr size_t kMaxEntitlementsBytes = 64 * 1024;

// Ok when a file with these attributes may vouch for its own entitlements:
// a regular file owned by root, not writable by group or others. Otherwise
// an Error saying which condition failed.
Status CheckEntitlementsTrusted(const struct stat& st);

// The entitlements dictionary of the executable open on fd (borrowed): a
// dictionary Value, or nil when the file carries no entitlements section.
// An Error when the file may not vouch for itself (see above), is not a
// readable ELF file, or its section is too large, not a property list or
// not a dictionary.
Result<Value> ReadEntitlements(int executableFd);

class SecTask {
 public:
  // The task of the peer: checks that it is still the process that
  // connected, running the same executable, and reads that executable's
  // entitlements. An Error when the process is gone or changed. A file that
  // may not vouch for itself or whose section is unreadable gives a task
  // without entitlements, not an Error.
  static Result<SecTask> CreateWithPeer(const PeerIdentity& peer);
  // A task holding the given entitlements dictionary, for tests of the
  // command core that have no peer process.
  static SecTask WithEntitlements(Value entitlements);

  // The value of the named entitlement; nil when there is none (no such
  // key, no section, untrusted or unreadable executable).
  Value copyValueForEntitlement(std::string_view name) const;

  // Why the task holds no entitlements, when reading them failed; Ok
  // otherwise. For diagnostics.
  const Status& entitlementsStatus() const { return entitlementsStatus_; }

 private:
  SecTask() = default;

  Value entitlements_;
  Status entitlementsStatus_;
};

}  // namespace vtr

#endif  // VTR_XPC_SEC_TASK_H_
