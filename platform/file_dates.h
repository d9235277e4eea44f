// Dates of a file-system item as the system reports them.
#ifndef VTR_PLATFORM_FILE_DATES_H_
#define VTR_PLATFORM_FILE_DATES_H_

#include <sys/stat.h>

#include <optional>
#include <string>

#include "platform/date.h"

namespace vtr {

// The creation date of the item at path (the last component is not
// followed): its birth time where the file system records one, else its
// modification time. nullopt when the item cannot be examined.
std::optional<Date> CreationDateOfItem(const std::string& path);
// The same for the entry name of the open directory dirFd.
std::optional<Date> CreationDateOfItemAt(int dirFd, const std::string& name);

// The same choice over statx results already read (the birth time only when
// the mask says the file system filled it in).
Date CreationDateFromStatx(const struct statx& stx);

// The modification time of statx results.
Date ModificationDateFromStatx(const struct statx& stx);

}  // namespace vtr

#endif  // VTR_PLATFORM_FILE_DATES_H_
