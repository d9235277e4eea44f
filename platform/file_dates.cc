#include "platform/file_dates.h"

#include <fcntl.h>

namespace vtr {

Date ModificationDateFromStatx(const struct statx& stx) {
  return Date::FromUnix(stx.stx_mtime.tv_sec, stx.stx_mtime.tv_nsec);
}

Date CreationDateFromStatx(const struct statx& stx) {
  if (stx.stx_mask & STATX_BTIME) return Date::FromUnix(stx.stx_btime.tv_sec, stx.stx_btime.tv_nsec);
  return ModificationDateFromStatx(stx);
}

std::optional<Date> CreationDateOfItem(const std::string& path) { return CreationDateOfItemAt(AT_FDCWD, path); }

std::optional<Date> CreationDateOfItemAt(int dirFd, const std::string& name) {
  struct statx stx;
  if (::statx(dirFd, name.c_str(), AT_SYMLINK_NOFOLLOW, STATX_BTIME | STATX_MTIME, &stx) != 0) {
    return std::nullopt;
  }
  return CreationDateFromStatx(stx);
}

}  // namespace vtr
