// VTRHOperations: the privileged file-system work the demo-mode daemon asks
// for, done as root. Whatever must afterwards be usable without privilege is
// handed to the account "mobile" (owner and group by name).
//
// Every path a client sends goes through the client-path resolver
// (client_path_resolver.h) and every step after it acts on the descriptors
// opened there; the helper's own fixed paths (helper_paths.h) are opened the
// same way, without the area rules. A refused path is one log line ("Refused
// path ...") and false.
//
// Every method runs synchronously on the caller's thread, returns true on
// success, and reports a failure by false plus at most one log line; nothing
// is retried. The helper calls it one command at a time.
#ifndef VTR_VITD_HELPER_OPERATIONS_H_
#define VTR_VITD_HELPER_OPERATIONS_H_

#include <memory>
#include <optional>
#include <string>

#include "platform/result.h"
#include "platform/unique_fd.h"
#include "vitd_helper/client_path_resolver.h"
#include "vitd_helper/helper_paths.h"

namespace vtr {

class VTRHOperations {
 public:
  // The process's operations: default paths, the default client areas, the
  // root directory "/" (the sandbox root once the helper has chrooted).
  // Created on first use; the daemon sets its areas before serving.
  static VTRHOperations& sharedInstance();

  VTRHOperations(HelperPaths paths, ClientPathResolver resolver);

  // Replaces the client areas (the daemon loads them at start).
  void setClientAreas(ClientAreas areas);
  const ClientPathResolver& resolver() const { return resolver_; }
  const HelperPaths& paths() const { return paths_; }

  // Moves the preferences file from root's preferences folder to mobile's
  // and gives it to mobile. False, with no message, when there is nothing to
  // move or the target exists already (never overwritten). A file with more
  // than one link is never handed over.
  bool migratePreferencesFile();

  // Makes sure the directory path exists (created with its parents when
  // missing); when writableByMobile, adds read, write and search permission
  // for group and others to what it has; then removes its "VTR_staging"
  // folder if there is one.
  bool prepareDirectory(const std::string& path, bool writableByMobile);

  // prepareDirectory(path, true), then hands every entry whose name begins
  // with "vitd-" to mobile: directories, and regular files with one link;
  // never a symbolic link or a special file (failures there are ignored).
  bool prepareLogContainer(const std::string& path);

  // Removes path with everything below it; true when it was not there.
  bool removeDirectory(const std::string& path);

  // Records the metadata of the tree at path into the device manifest, a
  // binary property list written whole or not at all. Any of the whole-
  // device spellings selects the whole device: its scan root keyed relative
  // to the parent, without the application areas, reporting progress. Any
  // other path is scanned relative to itself without its immediate hidden
  // entries. Closed trees are never scanned. inclusive adds the scanned
  // directory itself. The result is the scan's; a file that cannot be
  // written is not a failure. SIGTERM ends the scan within a second (false).
  bool createDeviceManifest(const std::string& path, bool inclusive);

  // Makes stagingPath a hard link of source (a directory: its directories
  // recreated, its files linked, its symbolic links recreated), both in the
  // client areas; the destination may not lie inside the source.
  bool createHardLinks(const std::string& source, const std::string& stagingPath);

  // Moves the staging directory (a real directory, no link) to the final
  // location, replacing what was there (also when the move fails). The
  // final location holds the old content whole or the new whole at every
  // moment, and a kill or power cut never leaves the staging folder in part
  // with its copy in place (see final_location.h).
  bool moveStagingToFinal(const std::string& stagingPath);

  // At start-up, before serving: finishes what a kill interrupted, a move
  // to the final location and the device manifest's file; each thing found
  // is one log line.
  void finishInterruptedWork();

  // Reads and verifies the signed manifest at manifestPath, picks its file
  // manifest (the whole device when containerType or identifier is absent;
  // else the "AppData" entry's "Manifest", or the "GroupData" or
  // "ExtensionData" entry itself) and lays every record onto the item at
  // the same relative path under root, in key order; the first that fails
  // ends the run. Both paths are client paths; every record's path is
  // resolved beneath root's descriptor with no link followed and no "..",
  // so nothing outside root changes.
  bool restoreAttributesUnder(const std::string& root, const std::string& manifestPath,
                              const std::optional<std::string>& containerType,
                              const std::optional<std::string>& identifier);

  // The firmware variables (platform/nvram_store.h) in the efivarfs folder
  // inside the helper's root, looked up by each call and never created:
  // without it, "Couldn't locate options node in IODeviceTree" and false.
  //
  // Sets name to value's UTF-8 bytes (an empty value leaves no variable),
  // then reads it back and compares, the "sync". A missing or invalid name
  // or a missing value writes nothing ("Couldn't write nvram"); a read-back
  // that differs fails with "Couldn't force sync new nvram to device".
  bool writeNVRam(const std::optional<std::string>& name, const std::optional<std::string>& value);
  // Removes name; a variable that is not there is already removed. Any
  // failure, an invalid name included, is logged with the sync message
  // "Couldn't force sync new nvram to device", as the platform does.
  bool deleteNvram(const std::optional<std::string>& name);

  // Where a reboot may reach.
  enum class RebootScope {
    kMachine,  // the helper serves the machine itself
    // The helper runs in a sandbox root: it reboots only as the first
    // process of its own PID namespace, where the kernel ends that
    // namespace instead of the machine.
    kOwnPidNamespace,
  };
  // kOwnPidNamespace unless the daemon, serving the machine, says otherwise.
  void setRebootScope(RebootScope scope) { rebootScope_ = scope; }
  // Flushes the file systems and restarts (the machine, or the PID
  // namespace, see RebootScope). Returns false only when that cannot be
  // done, after one log line saying why.
  bool reboot();
  // Ends the process with status 0 at once; nothing is cleaned up and no
  // reply follows. The log's lines are already written.
  [[noreturn]] void quitHelper();

 private:
  // The checked client path, or nullopt after the refusal is logged.
  std::optional<CheckedPath> checkClientPath(const std::string& path, ClientUse use) const;
  // The parts of finishInterruptedWork: a move (final_location.h), and the
  // named temporary file of a manifest killed between its naming and its
  // rename.
  void finishInterruptedMove();
  void removeUnfinishedManifest();
  // prepareDirectory, answering the directory opened.
  Result<UniqueFd> prepareDirectoryAt(const std::string& path, bool writableByMobile);

  HelperPaths paths_;
  ClientPathResolver resolver_;
  RebootScope rebootScope_ = RebootScope::kOwnPidNamespace;
};

}  // namespace vtr

#endif  // VTR_VITD_HELPER_OPERATIONS_H_
