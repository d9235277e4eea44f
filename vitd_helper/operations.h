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

  // Records the metadata of the tree at path into the device manifest
  // "/private/var/VTRWorkContainer/DeviceManifest.plist", a binary property
  // list written whole or not at all. Any of "/private", "/private/",
  // "/private/var" and "/private/var/" selects the whole device: the scan of
  // "/private/var" keyed relative to "/private", without the application
  // areas, reporting progress. Any other path is scanned relative to itself
  // without its immediate hidden entries. inclusive adds the scanned
  // directory itself. The result is the scan's; a file that cannot be
  // written is not a failure.
  bool createDeviceManifest(const std::string& path, bool inclusive);

  // Makes stagingPath a hard link of source (a directory: its directories
  // recreated, its files linked, its symbolic links recreated).
  bool createHardLinks(const std::string& source, const std::string& stagingPath);

  // Moves the staging directory to "/var/backup", replacing what was there.
  bool moveStagingToFinal(const std::string& stagingPath);
};

}  // namespace vtr

#endif  // VTR_VITD_HELPER_OPERATIONS_H_
