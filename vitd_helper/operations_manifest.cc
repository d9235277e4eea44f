// The device manifest: the metadata of a tree (or of the whole device)
// recorded into a fixed binary property-list file.
#include <algorithm>
#include <array>
#include <memory>

#include "model/log.h"
#include "model/manifest.h"
#include "model/manifest_file.h"
#include "model/progress_updater.h"
#include "vitd_helper/operations.h"

namespace vtr {
namespace {

constexpr std::array<std::string_view, 4> kWholeDeviceRoots = {"/private", "/private/", "/private/var",
                                                                "/private/var/"};
constexpr char kWholeDeviceScanRoot[] = "/private/var";
constexpr char kWholeDeviceRelativeTo[] = "/private";
const std::vector<std::string> kWholeDeviceSkipped = {
    "/private/var/mobile/Containers",
    "/private/var/mobile/Applications",
    "/private/var/mobile/BuildraBuiltProducts",
};
constexpr char kDeviceManifestPath[] = "/private/var/VTRWorkContainer/DeviceManifest.plist";

}  // namespace

bool VTRHOperations::createDeviceManifest(const std::string& path, bool inclusive) {
  VTRLog("Will create device manifest...");
  // No transaction is needed to keep SIGTERM out: the listener reads it only
  // between requests, so the file below is always finished first.
  VTRManifest manifest;
  std::string scanRoot, relativeTo;
  std::vector<std::string> skip;
  // Plain string equality: "/private//var" or "/private/var/mobile" scan as
  // ordinary trees.
  const bool wholeDevice =
      std::find(kWholeDeviceRoots.begin(), kWholeDeviceRoots.end(), path) != kWholeDeviceRoots.end();
  if (wholeDevice) {
    scanRoot = kWholeDeviceScanRoot;
    relativeTo = kWholeDeviceRelativeTo;
    skip = kWholeDeviceSkipped;
    manifest.setProgressUpdater(&VTRProgressUpdater::sharedInstance());
  } else {
    scanRoot = path;
    relativeTo = path;
    skip = VTRManifest::immediateHiddenFilesUnderPath(path);
  }

  // The records stream into the file as the scan makes them. When the file
  // cannot be made (its directory is missing) the scan still runs and
  // answers; only the file is missing, as it would be had the write failed.
  Result<std::unique_ptr<ManifestFileWriter>> output = ManifestFileWriter::Create(kDeviceManifestPath);
  if (output.ok()) skip.push_back((*output)->temporaryPath());
  const VTRManifest::Handler discard = [](const VTRFileMetadata&, const std::string&) { return true; };
  const bool scanned = manifest.enumerateAndCollectMetaData(scanRoot, relativeTo, skip, inclusive,
                                                            output.ok() ? (*output)->handler() : discard);
  if (!scanned) {
    VTRLog("Cannot create device manifest - 1");
    return false;  // the temporary file goes; an earlier manifest stays
  }
  if (output.ok()) (void)(*output)->commit();
  VTRLog("Device manifest created (for %@)", path);
  return true;
}

}  // namespace vtr
