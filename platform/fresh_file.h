// FreshFile: a regular file the helper makes beside an entry it will
// replace, so that what it vouches for (content it has checked, attributes
// that grant privilege) lies on an inode no other process has open, has
// mapped or can reach by another link.
//
// The file is made unnamed (O_TMPFILE) where the file system allows it, else
// under a new unique name (O_CREAT | O_EXCL, never through a link), in both
// cases root's with mode 0600 and open for reading and writing; install()
// puts it in place of the entry in one rename. A named file that was never
// installed is removed again when the object goes.
#ifndef VTR_PLATFORM_FRESH_FILE_H_
#define VTR_PLATFORM_FRESH_FILE_H_

#include <string>

#include "platform/result.h"
#include "platform/unique_fd.h"

namespace vtr {

class FreshFile {
 public:
  // A new file in the open directory dirFd (which must stay open while the
  // object lives); errors name pathForErrors.
  static Result<FreshFile> MakeIn(int dirFd, const std::string& pathForErrors);

  FreshFile(FreshFile&& other) noexcept;
  FreshFile& operator=(FreshFile&&) = delete;
  FreshFile(const FreshFile&) = delete;
  ~FreshFile();

  int fd() const { return fd_.get(); }

  // Replaces the entry name of the directory (whatever stands there that is
  // not a directory; its inode loses this name and nothing else) with this
  // file, atomically: the name never stands empty or half written. May be
  // called again after it failed (once the caller has lifted what stood in
  // the way); immutable or append-only flags on this file must wait until
  // after it (the kernel neither links nor renames such a file, nor
  // replaces one: EPERM).
  Status install(const std::string& name);

 private:
  FreshFile(int dirFd, UniqueFd fd, std::string name, std::string path)
      : dirFd_(dirFd), fd_(std::move(fd)), name_(std::move(name)), path_(std::move(path)) {}

  int dirFd_;
  UniqueFd fd_;
  std::string name_;  // empty while the file has no name
  std::string path_;
};

}  // namespace vtr

#endif  // VTR_PLATFORM_FRESH_FILE_H_
