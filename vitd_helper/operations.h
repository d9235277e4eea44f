// VTRHOperations: the privileged file-system work the demo-mode daemon asks
// for, done as root. Whatever must afterwards be usable without privilege is
// handed to the account "mobile" (owner and group by name).
//
// Every method runs synchronously on the caller's thread, returns true on
// success, and reports a failure by false plus at most one log line; nothing
// is retried or rolled back. The object has no state; the helper calls it one
// command at a time.
#ifndef VTR_VITD_HELPER_OPERATIONS_H_
#define VTR_VITD_HELPER_OPERATIONS_H_

#include <string>

namespace vtr {

class VTRHOperations {
 public:
  static VTRHOperations& sharedInstance();

  // Moves "/var/root/Library/Preferences/com.orvane.Vitrell.plist" to
  // "/var/mobile/Library/Preferences/" and gives it to mobile. False, with no
  // message, when there is nothing to move or the target exists already
  // (never overwritten).
  bool migratePreferencesFile();

  // Makes sure the directory path exists (created with its parents when
  // missing); when writableByMobile, adds read, write and search permission
  // for group and others to what it has; then removes its "VTR_staging"
  // folder if there is one.
  bool prepareDirectory(const std::string& path, bool writableByMobile);

  // prepareDirectory(path, true), then hands every entry whose name begins
  // with "vitd-" to mobile (failures there are ignored).
  bool prepareLogContainer(const std::string& path);

  // Removes path with everything below it; true when it was not there.
  bool removeDirectory(const std::string& path);
};

}  // namespace vtr

#endif  // VTR_VITD_HELPER_OPERATIONS_H_
