#include "vitd_helper/operations.h"

#include "model/log.h"
#include "platform/file_manager.h"
#include "platform/paths.h"

namespace vtr {
namespace {

constexpr char kRootPreferencesFolder[] = "/var/root/Library/Preferences/";
constexpr char kMobilePreferencesFolder[] = "/var/mobile/Library/Preferences/";
constexpr char kPreferencesFileName[] = "com.orvane.Vitrell.plist";
constexpr char kMobileAccount[] = "mobile";
constexpr char kStagingFolderName[] = "VTR_staging";
constexpr char kLogFilePrefix[] = "vitd-";
constexpr char kPrepareDirectoryMethod[] = "-[VTRHOperations prepareDirectory:writableByMobile:]";

// Owner and group "mobile", by account name.
Status GiveToMobile(const std::string& path) {
  const Value owner = Value::String(kMobileAccount);
  return SetAttributes(Dictionary({{kNSFileOwnerAccountName, owner}, {kNSFileGroupOwnerAccountName, owner}}), path);
}

}  // namespace

VTRHOperations& VTRHOperations::sharedInstance() {
  static VTRHOperations* const instance = new VTRHOperations();
  return *instance;
}

bool VTRHOperations::migratePreferencesFile() {
  const std::string source = AppendPathComponent(kRootPreferencesFolder, kPreferencesFileName);
  const std::string target = AppendPathComponent(kMobilePreferencesFolder, kPreferencesFileName);
  if (!FileExists(source) || FileExists(target)) return false;
  if (!MoveItem(source, target).ok()) {
    VTRLog("Couldn't move %@ to %@", source, target);
    return false;
  }
  if (!GiveToMobile(target).ok()) {
    VTRLog("Couldn't change ownership for %@", target);
    return false;
  }
  return true;
}

bool VTRHOperations::prepareDirectory(const std::string& path, bool writableByMobile) {
  if (!FileExists(path) && !CreateDirectory(path, true).ok()) return false;
  if (writableByMobile) {
    // These two messages pass the path where the method name stands and have
    // no argument for their last conversion; their texts are kept as they are.
    Result<Value> attributes = AttributesOfItem(path);
    if (!attributes.ok()) {
      VTRLog("%s: Cannot get attribute from %@", path, nullptr);
      return false;
    }
    const uint64_t permissions = attributes->get(kNSFilePosixPermissions).unsignedInteger().value_or(0);
    const auto opened = static_cast<uint16_t>(permissions | 0077);
    Status set = SetAttributes(Dictionary({{kNSFilePosixPermissions, Value::Unsigned(opened)}}), path);
    if (!set.ok()) {
      VTRLog("%s: Cannot set attribute for %@ - %@", path, set.error().description(), nullptr);
      return false;
    }
  }
  const std::string staging = AppendPathComponent(path, kStagingFolderName);
  if (FileExists(staging)) {
    Status removed = RemoveItem(staging);
    if (!removed.ok()) {
      VTRLog("%s: Could not remove the path %@ with error - %@(0x%x)", kPrepareDirectoryMethod, staging,
             removed.error().description(), static_cast<unsigned>(removed.error().code()));
      return false;
    }
  }
  return true;
}

bool VTRHOperations::prepareLogContainer(const std::string& path) {
  if (!prepareDirectory(path, true)) return false;
  if (Result<std::vector<std::string>> names = ContentsOfDirectory(path); names.ok()) {
    for (const std::string& name : *names) {
      if (HasPrefix(name, kLogFilePrefix)) (void)GiveToMobile(AppendPathComponent(path, name));
    }
  }
  return true;
}

bool VTRHOperations::removeDirectory(const std::string& path) {
  if (!FileExists(path)) return true;
  return RemoveItem(path).ok();
}

}  // namespace vtr
