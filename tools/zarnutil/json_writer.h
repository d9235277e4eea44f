// A small writer of compact JSON text, enough for zarnutil's reports:
// objects, arrays, unsigned integers and strings. The caller nests the calls
// correctly; the writer adds the separators. Not thread-safe.
#ifndef VTR_TOOLS_ZARNUTIL_JSON_WRITER_H_
#define VTR_TOOLS_ZARNUTIL_JSON_WRITER_H_

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace vtr {

class JsonWriter {
 public:
  void beginObject() { open('{'); }
  void endObject() { close('}'); }
  void beginArray() { open('['); }
  void endArray() { close(']'); }
  // The key of the next member of the current object.
  void key(std::string_view name);
  void number(uint64_t value);
  void string(std::string_view utf8);
  void boolean(bool value);

  // The text written so far.
  const std::string& text() const { return out_; }

 private:
  void beforeValue();
  void open(char bracket);
  void close(char bracket);

  std::string out_;
  std::vector<bool> hasMembers_;  // per open container
  bool afterKey_ = false;
};

// text as a quoted JSON string: quotes, backslashes and control characters
// escaped, and every byte that is not part of well-formed UTF-8 replaced by
// U+FFFD, so the result is valid JSON (and safe to print on a terminal).
std::string JsonQuote(std::string_view text);

}  // namespace vtr

#endif  // VTR_TOOLS_ZARNUTIL_JSON_WRITER_H_
