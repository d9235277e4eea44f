// Conversion of partition names from UTF-16LE, as stored in partition
// entries, to UTF-8.
#ifndef VTR_STORAGE_UTF16_H_
#define VTR_STORAGE_UTF16_H_

#include <cstddef>
#include <cstdint>

namespace vtr {

// Converts the srcBytes / 2 little-endian code units at src to UTF-8 in dst
// and stores the number of bytes written in *dstLengthOut. Zero units are
// skipped (they do not end the text); every other unit is encoded on its own
// in one to three bytes, surrogates included (a pair is not combined). The
// conversion stops before the first character that does not fit in the
// dstCapacity bytes left. No terminator is written. Returns 0.
int utf_encodestr2(const uint8_t* src, size_t srcBytes, uint8_t* dst, size_t* dstLengthOut, size_t dstCapacity);

}  // namespace vtr

#endif  // VTR_STORAGE_UTF16_H_
