// Writing a file so that readers see the old content or the whole new one,
// never a part: the bytes go to a temporary file in the target's directory,
// which is synced and then renamed over it, and the directory is synced
// after. The temporary file has no name while it is written (O_TMPFILE), so
// that a kill leaves nothing behind; it is linked as ".NAME.XXXXXX" only for
// the moment between the sync and the rename. On file systems without
// O_TMPFILE it bears that name from the start.
#ifndef VTR_PLATFORM_ATOMIC_FILE_H_
#define VTR_PLATFORM_ATOMIC_FILE_H_

#include <sys/types.h>

#include <cstdint>
#include <span>
#include <string>

#include "platform/result.h"
#include "platform/unique_fd.h"

namespace vtr {

class AtomicFile {
 public:
  // Creates the temporary file in the target's directory (which must
  // exist; it is not created). The target is not touched until
  // commit(). A symbolic link at the target is replaced, never followed.
  static Result<AtomicFile> Create(const std::string& path, mode_t mode = 0644);
  // The same in the directory dir, already open (no path is resolved): the
  // target is the entry named by path's last component.
  static Result<AtomicFile> CreateIn(UniqueFd dir, const std::string& path, mode_t mode = 0644);

  AtomicFile(AtomicFile&& other) noexcept;
  AtomicFile& operator=(AtomicFile&&) = delete;
  AtomicFile(const AtomicFile&) = delete;
  AtomicFile& operator=(const AtomicFile&) = delete;
  // Removes the temporary file unless commit() succeeded.
  ~AtomicFile();

  // The temporary file, open for writing.
  int fd() const { return fd_.get(); }
  const std::string& path() const { return path_; }
  // Where the bytes go until commit() when the file has a name
  // (".NAME.XXXXXX" beside the target); empty while it has none.
  std::string temporaryPath() const;

  // fsync the file, name it, rename it over the target, fsync the
  // directory.
  Status commit();

 private:
  AtomicFile(UniqueFd dir, UniqueFd fd, std::string path, std::string name, std::string tempName);
  // Links the nameless file as ".NAME.XXXXXX" (tempName_).
  Status nameAnonymousFile();

  UniqueFd dir_;
  UniqueFd fd_;
  std::string path_;
  std::string name_;
  std::string tempName_;  // empty while the file has no name
  bool committed_ = false;
};

// Writes bytes to path atomically (see AtomicFile).
Status WriteFileAtomically(const std::string& path, std::span<const uint8_t> bytes, mode_t mode = 0644);

}  // namespace vtr

#endif  // VTR_PLATFORM_ATOMIC_FILE_H_
