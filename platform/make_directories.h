// Creating a directory with its missing parents (mkdir -p).
#ifndef VTR_PLATFORM_MAKE_DIRECTORIES_H_
#define VTR_PLATFORM_MAKE_DIRECTORIES_H_

#include <sys/types.h>

#include <string>

#include "platform/result.h"

namespace vtr {

// Creates path and every missing parent with the given mode (less the
// umask). An existing directory is success; an existing non-directory at
// path or at a parent is an error (EEXIST / ENOTDIR).
Status MakeDirectories(const std::string& path, mode_t mode = 0755);

}  // namespace vtr

#endif  // VTR_PLATFORM_MAKE_DIRECTORIES_H_
