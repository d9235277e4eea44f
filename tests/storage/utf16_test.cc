#include "storage/utf16.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace vtr {
namespace {

std::string Encode(const std::vector<uint16_t>& units, size_t capacity, size_t srcBytes = SIZE_MAX) {
  std::vector<uint8_t> src;
  for (uint16_t u : units) {
    src.push_back(static_cast<uint8_t>(u));
    src.push_back(static_cast<uint8_t>(u >> 8));
  }
  std::vector<uint8_t> dst(capacity + 4, 0xEE);
  size_t length = 999;
  EXPECT_EQ(utf_encodestr2(src.data(), srcBytes == SIZE_MAX ? src.size() : srcBytes, dst.data(), &length, capacity),
            0);
  EXPECT_LE(length, capacity);
  for (size_t i = length; i < dst.size(); ++i) EXPECT_EQ(dst[i], 0xEE) << "written past the output at " << i;
  return std::string(dst.begin(), dst.begin() + static_cast<ptrdiff_t>(length));
}

TEST(Utf16Test, Conversion) {
  const struct {
    const char* name;
    std::vector<uint16_t> units;
    size_t capacity;
    std::string utf8;
  } cases[] = {
      {"ascii", {'Z', 'a', 'r', 'n', 0, 0}, 256, "Zarn"},
      {"zero units are skipped", {0, 'A', 0, 0, 'B'}, 256, "AB"},
      {"nothing", {}, 256, ""},
      {"two bytes", {0x00E9, 0x07FF}, 256, "\xC3\xA9\xDF\xBF"},
      {"three bytes", {0x0800, 0x20AC, 0xFFFF}, 256, "\xE0\xA0\x80\xE2\x82\xAC\xEF\xBF\xBF"},
      // A surrogate pair is two characters of three bytes each.
      {"surrogates", {0xD83D, 0xDE00}, 256, "\xED\xA0\xBD\xED\xB8\x80"},
      // Stops before the first character that does not fit, even if a later one would.
      {"capacity", {'a', 0x00E9, 'b'}, 2, "a"},
      {"exact fit", {'a', 0x20AC}, 4, "a\xE2\x82\xAC"},
      {"no room", {'a'}, 0, ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    EXPECT_EQ(Encode(c.units, c.capacity), c.utf8);
  }
  // An odd byte count reads only whole units.
  EXPECT_EQ(Encode({'a', 'b'}, 16, 3), "a");
}

}  // namespace
}  // namespace vtr
