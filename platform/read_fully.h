// Reading an open file to its end, bounded: the one way the helper reads
// small files whole (accounts, its areas file).
#ifndef VTR_PLATFORM_READ_FULLY_H_
#define VTR_PLATFORM_READ_FULLY_H_

#include <cstddef>
#include <string>

#include "platform/result.h"

namespace vtr {

// Everything fd holds from its current offset to its end. An Error (EFBIG)
// as soon as more than limit bytes arrive (the file may grow while it is
// read), or the read's errno; retries EINTR. fd stays the caller's.
Result<std::string> ReadFully(int fd, size_t limit);

// The bytes the regular file open as fd held when this was called: its size
// is read once, a file over limit is refused (EFBIG) and one of another kind
// (EINVAL) before anything is read, and nothing past that size is read
// (a file that grows meanwhile gives its first bytes only; one that shrinks,
// the bytes up to its end). One allocation of the size. fd stays the
// caller's; its offset is not used.
Result<std::string> ReadRegularFile(int fd, size_t limit);

// The whole of the regular file (or pipe) at path (links followed: for the tools,
// which read what their user names), at most limit bytes; "-" reads
// standard input. Errors name the path.
Result<std::string> ReadFileNamed(const std::string& path, size_t limit);

}  // namespace vtr

#endif  // VTR_PLATFORM_READ_FULLY_H_
