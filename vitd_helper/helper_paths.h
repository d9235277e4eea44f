// The helper's fixed paths, gathered in one value that the operations are
// given: the daemon uses the defaults; a test resolves the same paths
// beneath a directory of its own (the resolver's root), so nothing here
// needs changing for it.
#ifndef VTR_VITD_HELPER_HELPER_PATHS_H_
#define VTR_VITD_HELPER_HELPER_PATHS_H_

#include <string>
#include <vector>

namespace vtr {

struct HelperPaths {
  // migratePreferencesFile: the file moves from the first folder to the second.
  std::string rootPreferencesFolder = "/var/root/Library/Preferences/";
  std::string mobilePreferencesFolder = "/var/mobile/Library/Preferences/";
  std::string preferencesFileName = "com.orvane.Vitrell.plist";
  // Containers: the folder a prepared directory loses, the log entries handed to mobile.
  std::string stagingFolderName = "VTR_staging";
  std::string logEntryPrefix = "vitd-";
  // createDeviceManifest: the spellings that select the whole device, what
  // it scans, relative to what, without what, and where the manifest goes.
  std::vector<std::string> wholeDeviceRoots = {"/private", "/private/", "/private/var", "/private/var/"};
  std::string wholeDeviceScanRoot = "/private/var";
  std::string wholeDeviceRelativeTo = "/private";
  std::vector<std::string> wholeDeviceSkipped = {
      "/private/var/mobile/Containers",
      "/private/var/mobile/Applications",
      "/private/var/mobile/BuildraBuiltProducts",
  };
  std::string deviceManifest = "/private/var/VTRWorkContainer/DeviceManifest.plist";
  // moveStagingToFinal: where staged content ends.
  std::string finalLocation = "/var/backup";
  // restoreAttributes: the trust anchors of the two signing policies and
  // where the device says whether it is fused.
  std::string productionAnchors = "/usr/share/vitd/anchors/production";
  std::string testAnchors = "/usr/share/vitd/anchors/test";
  std::string efiVariables = "/sys/firmware/efi/efivars";
  // The account files and folders are handed to.
  std::string mobileAccount = "mobile";
};

}  // namespace vtr

#endif  // VTR_VITD_HELPER_HELPER_PATHS_H_
