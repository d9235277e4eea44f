// ManifestFileWriter: streams the records of a manifest fill into a binary
// property-list file as they come, so that a whole device's manifest never
// sits in memory. The file is the dictionary a filled VTRManifest holds, its
// entries in the order the fill delivered them.
//
// The file appears atomically: the entries go to a temporary file (nameless
// while it is written, see AtomicFile), which replaces the target only on
// commit(). An object destroyed
// without a successful commit leaves the target as it was. When the file is
// written inside the tree being walked (as the device manifest is), the walk
// meets the temporary file; its record is left out, so the manifest holds
// what it would hold had the file been written after the walk.
//
// Threads: used by the thread that runs the fill.
#ifndef VTR_MODEL_MANIFEST_FILE_H_
#define VTR_MODEL_MANIFEST_FILE_H_

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <string>

#include "model/manifest.h"
#include "platform/atomic_file.h"
#include "platform/output_stream.h"
#include "platform/plist.h"
#include "platform/result.h"

namespace vtr {

class ManifestFileWriter {
 public:
  // Opens the temporary file for path (whose directory must exist). Fails
  // when it cannot be created.
  static Result<std::unique_ptr<ManifestFileWriter>> Create(const std::string& path, mode_t mode = 0644);
  // The same in the open directory dir (see AtomicFile::CreateIn).
  static Result<std::unique_ptr<ManifestFileWriter>> CreateIn(UniqueFd dir, const std::string& path,
                                                              mode_t mode = 0644);
  ManifestFileWriter(const ManifestFileWriter&) = delete;
  ManifestFileWriter& operator=(const ManifestFileWriter&) = delete;

  // Adds record under key (a key added again takes the new record), unless
  // it is the record of the temporary file itself. After a failure nothing
  // more is written and every later call repeats the error.
  Status add(const std::string& key, const VTRFileMetadata& record);

  // A fill handler adding each record. It answers true even when writing
  // failed: a file that cannot be written does not change what the fill
  // does or answers; commit() reports the error. Valid while this lives.
  VTRManifest::Handler handler();

  // Completes the property list, syncs it and puts it in place of the
  // target. Fails with the first error met since Create (the target is then
  // untouched). Call at most once.
  Status commit();

  // The temporary file the entries go to until commit(), when it has a
  // name (empty otherwise). A fill of a tree that holds it must skip it, or
  // the manifest would describe itself half written.
  std::string temporaryPath() const { return file_.temporaryPath(); }

 private:
  static Result<std::unique_ptr<ManifestFileWriter>> Make(Result<AtomicFile> file, const std::string& path);
  ManifestFileWriter(AtomicFile file, int64_t device, uint64_t inode);
  // Whether record describes the temporary file being written.
  bool isOwnFile(const VTRFileMetadata& record) const;

  AtomicFile file_;
  // The temporary file's identity, as records give it.
  const int64_t device_;
  const uint64_t inode_;
  FdOutputStream stream_;
  BinaryPlistDictionaryWriter writer_;
  Status failure_;
};

}  // namespace vtr

#endif  // VTR_MODEL_MANIFEST_FILE_H_
