// The listing of this system's firmware variables, read directly from the
// efivarfs folder (no helper involved: reading needs no privilege the
// helper would add, and a listing must work when the helper is down).
#ifndef VTR_TOOLS_VITDCTL_NVRAM_LISTING_H_
#define VTR_TOOLS_VITDCTL_NVRAM_LISTING_H_

#include <cstdio>
#include <string>

namespace vtr::vitdctl {

// Prints the variables of the efivarfs folder inside root ("" for the
// machine's own) to out: one line each, NAME = "VALUE" (escaped; values that
// are not UTF-8 as hex:...), or with json a JSON array of objects
// {"name", "attributes", "value" (text, or null when not UTF-8), "base64"}.
// Returns an exit status: 0, or 3 when the folder cannot be read (the
// reason on standard error).
int ListNvram(const std::string& root, bool json, FILE* out);

}  // namespace vtr::vitdctl

#endif  // VTR_TOOLS_VITDCTL_NVRAM_LISTING_H_
