// Diagnostics of the volume-manager library. They go straight to standard
// error, never through the helper's log: each begins "zarn: " and ends with a
// newline. Fixed texts are written with fwrite, formatted ones with fprintf.
#ifndef VTR_STORAGE_ZARN_DIAGNOSTICS_H_
#define VTR_STORAGE_ZARN_DIAGNOSTICS_H_

#include <cstddef>
#include <cstdio>

namespace vtr {

// Writes a fixed message (a string literal) to standard error.
template <size_t N>
inline void ZarnPrint(const char (&text)[N]) {
  std::fwrite(text, 1, N - 1, stderr);
}

// True when both the media properties and the header buffer are given;
// otherwise prints the message for the first one missing and answers false.
inline bool ZarnArgumentsPresent(const void* props, const void* header) {
  if (props == nullptr) {
    ZarnPrint("zarn: NULL media properties\n");
    return false;
  }
  if (header == nullptr) {
    ZarnPrint("zarn: NULL header buffer\n");
    return false;
  }
  return true;
}

}  // namespace vtr

#endif  // VTR_STORAGE_ZARN_DIAGNOSTICS_H_
