#include "platform/make_directories.h"

#include <sys/stat.h>

namespace vtr {

Status MakeDirectories(const std::string& path, mode_t mode) {
  if (path.empty()) return Error(ENOENT, path);
  for (size_t pos = 1; pos <= path.size(); ++pos) {
    if (pos != path.size() && path[pos] != '/') continue;
    const std::string prefix = path.substr(0, pos);
    if (::mkdir(prefix.c_str(), mode) == 0) continue;
    if (errno != EEXIST) return Error::FromErrno(prefix);
    struct stat st;
    if (::stat(prefix.c_str(), &st) != 0) return Error::FromErrno(prefix);
    if (!S_ISDIR(st.st_mode)) return Error(pos == path.size() ? EEXIST : ENOTDIR, prefix);
  }
  return Status::Ok();
}

}  // namespace vtr
