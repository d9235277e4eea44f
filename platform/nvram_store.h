// NvramStore: this system's firmware variables, as the kernel's efivarfs
// shows them (normally /sys/firmware/efi/efivars).
//
// A variable NAME of the system's vendor GUID is the file
// NAME-da3c1531-e7a2-45a1-875c-5c2980f00b0d: 4 bytes of attributes (little
// endian), then the value. efivarfs is not a plain folder, and the store is
// right on both (tests use a plain folder, a virtual machine the real one):
//
// - A write is one write(2) of the attributes 0x00000007 (non-volatile,
//   boot and runtime access) and the whole value: that one call is one
//   SetVariable, atomic in the firmware. efivarfs refuses rename(2) and
//   fsync(2), so there is no temporary file; it ignores O_TRUNC, which a
//   plain folder needs so that no tail of a longer old value stays.
// - efivarfs marks a variable immutable; the flag is cleared for a write or
//   an unlink and set again after a write (CAP_LINUX_IMMUTABLE). A variable
//   that was immutable before a write is immutable after it.
// - The firmware holds no empty variable: writing an empty value removes
//   the variable, and reading an absent one gives nothing.
//
// Names are checked before anything is touched: see IsValidName.
#ifndef VTR_PLATFORM_NVRAM_STORE_H_
#define VTR_PLATFORM_NVRAM_STORE_H_

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/result.h"
#include "platform/unique_fd.h"

namespace vtr {

class NvramStore {
 public:
  // The vendor GUID of this system's variables.
  static constexpr std::string_view kVendorGuid = "da3c1531-e7a2-45a1-875c-5c2980f00b0d";
  // Attributes of every variable written: non-volatile, boot service and
  // runtime access.
  static constexpr uint32_t kAttributes = 0x00000007;
  // The longest name: the file name ("-" and the GUID appended) must fit
  // the 255 bytes a file name may have; the firmware allows more.
  static constexpr size_t kMaxNameBytes = 255 - 1 - kVendorGuid.size();

  // A name the store can hold: 1 to kMaxNameBytes bytes of printable ASCII
  // without "/". efivarfs turns each byte of a file name into one UCS-2
  // character, so a name with bytes above 0x7F would come back changed
  // after the next mount; control characters have no place in a name.
  static bool IsValidName(std::string_view name);

  // The store in the folder at path beneath rootFd (AT_FDCWD: path as it
  // stands), no link followed on the way. ENOENT or ENOTDIR when there is
  // no such folder; it is never created.
  static Result<NvramStore> Open(int rootFd, const std::string& path);

  // Sets name to value (see above); EINVAL for a name that is not valid.
  Status write(std::string_view name, std::span<const uint8_t> value) const;
  // Removes name; a variable that is not there is already removed.
  Status remove(std::string_view name) const;
  // The value of name; nullopt when there is no such variable.
  Result<std::optional<std::vector<uint8_t>>> read(std::string_view name) const;

  struct Variable {
    std::string name;
    uint32_t attributes = 0;
    std::vector<uint8_t> value;
  };
  // Every variable of the vendor GUID, by name.
  Result<std::vector<Variable>> list() const;

 private:
  explicit NvramStore(UniqueFd folder, std::string path) : folder_(std::move(folder)), path_(std::move(path)) {}
  std::string fileName(std::string_view name) const;
  // Reads the whole file name of the folder: attributes and value.
  Result<std::optional<Variable>> readFile(const std::string& file) const;

  UniqueFd folder_;
  std::string path_;  // for messages
};

}  // namespace vtr

#endif  // VTR_PLATFORM_NVRAM_STORE_H_
