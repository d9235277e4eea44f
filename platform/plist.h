// Property-list files: reading XML or binary ("bplist00") property lists into
// a Value and writing a Value out, strictly and within bounds.
//
// Readers never trust the input: every length, offset, count and reference is
// checked against the bytes given; depth, object count and the expanded size
// of the result are bounded; malformed input gives an Error, never a guessed
// value, a crash or an unbounded allocation. Nothing is fetched from outside
// (no external entities, no network). All functions are thread-compatible.
#ifndef VTR_PLATFORM_PLIST_H_
#define VTR_PLATFORM_PLIST_H_

#include <cstdint>
#include <span>
#include <string>

#include "platform/output_stream.h"
#include "platform/result.h"
#include "platform/value.h"

namespace vtr {

// Bounds a reader enforces. The defaults suit every file the system reads.
struct PlistLimits {
  // Largest input accepted, in bytes.
  uint64_t maxInputBytes = uint64_t{2} << 30;
  // Deepest nesting of arrays and dictionaries (the top object is depth 1).
  uint32_t maxDepth = 512;
  // Largest expanded result: nodes reached counting every reference to a
  // shared object each time it is reached, and string/data bytes likewise.
  // 0 derives a bound from the input size (a multiple of it, with a floor),
  // which no file written by an honest writer comes near. The binary reader
  // derives 16 times the input size, at least 2^20 nodes and 64 MiB.
  uint64_t maxExpandedNodes = 0;
  uint64_t maxExpandedBytes = 0;
};

enum class PlistFormat { kBinary, kXml };

// Reads a property list in either format (told apart by the "bplist00" magic).
Result<Value> ReadPropertyList(std::span<const uint8_t> bytes, const PlistLimits& limits = {});
Result<Value> ReadBinaryPropertyList(std::span<const uint8_t> bytes, const PlistLimits& limits = {});
// XML is read strictly: no entity is declared, expanded or loaded (a document
// type with an internal subset is refused; the usual one-line document type
// is accepted and never fetched), only the property-list elements are known,
// and each value's text must be whole and valid: <integer> decimal with an
// optional sign or "0x" hex, up to UINT64_MAX (above INT64_MAX an unsigned
// value); <real> decimal, "nan" or "inf"; <date> "YYYY-MM-DDTHH:MM:SSZ";
// <data> padded base64. Surrounding whitespace is not trimmed.
Result<Value> ReadXmlPropertyList(std::span<const uint8_t> bytes, const PlistLimits& limits = {});

// Reads the file at path (a regular file; a symbolic link at the last
// component is refused, and so is a file larger than limits.maxInputBytes
// before any of it is read) and parses it as above. Errors name the path.
Result<Value> ReadPropertyListFile(const std::string& path, const PlistLimits& limits = {});

// The property list of value in the given format. Nil values cannot be
// written and make these fail.
Result<Bytes> EncodeBinaryPropertyList(const Value& value);
// XML also fails on a string or key that is not UTF-8 or holds a character
// XML cannot carry (controls other than tab, line feed and carriage return;
// U+FFFE, U+FFFF), and on a date outside the years 0000-9999. Dates are
// written to the whole second (the fraction is dropped).
Result<std::string> EncodeXmlPropertyList(const Value& value);

// Writes value to path atomically (temporary file, fsync, rename, fsync of
// the directory).
Status WritePropertyListFile(const std::string& path, const Value& value, PlistFormat format, mode_t mode = 0644);

// Streams a binary property list whose top object is a dictionary, one entry
// at a time: each entry's objects go to the stream as soon as they are added,
// and only the offset table, the top dictionary's references and what is
// needed to keep keys unique stay in memory. Output is deterministic: the
// same entries added in the same order give the same bytes. Entries keep the
// order they were added in; adding a key again replaces its value (the
// earlier objects stay in the file, unreferenced). Not knowing the number of
// objects in advance, it writes 4-byte references: at most 2^32 objects, and
// add() fails past that.
class BinaryPlistDictionaryWriter {
 public:
  // out must outlive the writer.
  explicit BinaryPlistDictionaryWriter(OutputStream* out);
  ~BinaryPlistDictionaryWriter();
  BinaryPlistDictionaryWriter(const BinaryPlistDictionaryWriter&) = delete;
  BinaryPlistDictionaryWriter& operator=(const BinaryPlistDictionaryWriter&) = delete;

  // Writes the entry's objects. A value that cannot be written (nil, text
  // that is not UTF-8) fails this call only; the writer stays usable. After
  // a stream error every later call fails too.
  Status add(std::string_view key, const Value& value);
  // Writes the top dictionary, the offset table and the trailer, and flushes
  // the stream. No add() may follow.
  Status finish();

 private:
  class Impl;
  Impl* impl_;
};

}  // namespace vtr

#endif  // VTR_PLATFORM_PLIST_H_
