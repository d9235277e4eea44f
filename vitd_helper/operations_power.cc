// Firmware variables, reboot and quit: the operations that act on the
// machine rather than on files.
#include <sys/reboot.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "model/log.h"
#include "platform/nvram_store.h"
#include "vitd_helper/failure_journal.h"
#include "vitd_helper/operations.h"

namespace vtr {
namespace {

constexpr char kNoOptionsNode[] = "Couldn't locate options node in IODeviceTree";
constexpr char kWriteFailed[] = "Couldn't write nvram";
constexpr char kSyncFailed[] = "Couldn't force sync new nvram to device";

std::span<const uint8_t> BytesOf(const std::string& text) {
  return {reinterpret_cast<const uint8_t*>(text.data()), text.size()};
}

}  // namespace

bool VTRHOperations::writeNVRam(const std::optional<std::string>& name, const std::optional<std::string>& value) {
  Result<NvramStore> store = NvramStore::Open(resolver_.root(), paths_.efiVariables);
  if (!store.ok()) {
    VTRLogError(kNoOptionsNode);
    JournalFailure("Cannot open the firmware variables", paths_.efiVariables, store.error());
    return false;
  }
  Status written = !name || !value ? Status(Error::Invalid("\"Name\" and \"Value\" must both be strings"))
                                   : store->write(*name, BytesOf(*value));
  if (!written.ok()) {
    VTRLogError(kWriteFailed);
    JournalFailure("Cannot write the firmware variable", name.value_or("(none)"), written.error());
    return false;
  }
  // The firmware commits each write itself; the "sync" checks that what it
  // holds now is the value (an absent variable reads as the empty one).
  Result<std::optional<std::vector<uint8_t>>> held = store->read(*name);
  const std::span<const uint8_t> wanted = BytesOf(*value);
  if (!held.ok() || !std::ranges::equal(held->value_or(std::vector<uint8_t>()), wanted)) {
    VTRLogError(kSyncFailed);
    JournalFailure("Cannot read back the firmware variable", *name,
                   held.ok() ? Error::Invalid("it holds another value") : held.error());
    return false;
  }
  return true;
}

bool VTRHOperations::deleteNvram(const std::optional<std::string>& name) {
  Result<NvramStore> store = NvramStore::Open(resolver_.root(), paths_.efiVariables);
  if (!store.ok()) {
    VTRLogError(kNoOptionsNode);
    JournalFailure("Cannot open the firmware variables", paths_.efiVariables, store.error());
    return false;
  }
  Status removed = name ? store->remove(*name) : Status(Error::Invalid("the variable name must be a string"));
  if (!removed.ok()) {
    VTRLogError(kSyncFailed);
    JournalFailure("Cannot remove the firmware variable", name.value_or("(none)"), removed.error());
    return false;
  }
  return true;
}

bool VTRHOperations::reboot() {
  if (rebootScope_ == RebootScope::kOwnPidNamespace && ::getpid() != 1) {
    VTRLogError(
        "Not rebooting: the helper runs in a sandbox root and is not the first process of its own PID namespace");
    return false;
  }
  ::sync();
  ::reboot(RB_AUTOBOOT);
  VTRLogError("Reboot failed: %s", std::strerror(errno));
  return false;
}

void VTRHOperations::quitHelper() { std::exit(0); }

}  // namespace vtr
