// Strict conversions between the UTF-8 of Value strings and the big-endian
// UTF-16 that binary property lists store non-ASCII strings in.
#include "platform/plist_binary_format.h"

namespace vtr::bplist {
namespace {

void AppendUtf8(char32_t c, std::string* out) {
  if (c < 0x80) {
    out->push_back(static_cast<char>(c));
  } else if (c < 0x800) {
    out->push_back(static_cast<char>(0xC0 | (c >> 6)));
    out->push_back(static_cast<char>(0x80 | (c & 0x3F)));
  } else if (c < 0x10000) {
    out->push_back(static_cast<char>(0xE0 | (c >> 12)));
    out->push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | (c & 0x3F)));
  } else {
    out->push_back(static_cast<char>(0xF0 | (c >> 18)));
    out->push_back(static_cast<char>(0x80 | ((c >> 12) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3F)));
    out->push_back(static_cast<char>(0x80 | (c & 0x3F)));
  }
}

void AppendUnit(char16_t unit, std::vector<uint8_t>* out) {
  out->push_back(static_cast<uint8_t>(unit >> 8));
  out->push_back(static_cast<uint8_t>(unit));
}

bool IsHighSurrogate(uint32_t u) { return u >= 0xD800 && u <= 0xDBFF; }
bool IsLowSurrogate(uint32_t u) { return u >= 0xDC00 && u <= 0xDFFF; }

// Decodes the UTF-8 sequence at text[*pos], advancing *pos; false when it is
// malformed.
bool NextCodePoint(std::string_view text, size_t* pos, char32_t* c) {
  const auto lead = static_cast<uint8_t>(text[*pos]);
  size_t length;
  char32_t min;
  if (lead < 0x80) {
    *c = lead;
    ++*pos;
    return true;
  } else if (lead >= 0xC2 && lead <= 0xDF) {
    length = 2, min = 0x80, *c = lead & 0x1F;
  } else if (lead >= 0xE0 && lead <= 0xEF) {
    length = 3, min = 0x800, *c = lead & 0x0F;
  } else if (lead >= 0xF0 && lead <= 0xF4) {
    length = 4, min = 0x10000, *c = lead & 0x07;
  } else {
    return false;
  }
  if (text.size() - *pos < length) return false;
  for (size_t i = 1; i < length; ++i) {
    const auto next = static_cast<uint8_t>(text[*pos + i]);
    if ((next & 0xC0) != 0x80) return false;
    *c = (*c << 6) | (next & 0x3F);
  }
  if (*c < min || *c > 0x10FFFF || IsHighSurrogate(*c) || IsLowSurrogate(*c)) return false;
  *pos += length;
  return true;
}

}  // namespace

bool AppendUtf8FromUtf16BigEndian(std::span<const uint8_t> units, std::string* out) {
  const size_t count = units.size() / 2;
  for (size_t i = 0; i < count; ++i) {
    const uint32_t u = ReadBigEndian(&units[2 * i], 2);
    if (IsLowSurrogate(u)) return false;
    if (!IsHighSurrogate(u)) {
      AppendUtf8(u, out);
      continue;
    }
    if (i + 1 == count) return false;
    const uint32_t low = ReadBigEndian(&units[2 * (i + 1)], 2);
    if (!IsLowSurrogate(low)) return false;
    AppendUtf8(0x10000 + ((u - 0xD800) << 10) + (low - 0xDC00), out);
    ++i;
  }
  return true;
}

bool AppendUtf16BigEndianFromUtf8(std::string_view text, std::vector<uint8_t>* out, uint64_t* unitCount) {
  size_t pos = 0;
  while (pos < text.size()) {
    char32_t c;
    if (!NextCodePoint(text, &pos, &c)) return false;
    if (c < 0x10000) {
      AppendUnit(static_cast<char16_t>(c), out);
      *unitCount += 1;
    } else {
      c -= 0x10000;
      AppendUnit(static_cast<char16_t>(0xD800 + (c >> 10)), out);
      AppendUnit(static_cast<char16_t>(0xDC00 + (c & 0x3FF)), out);
      *unitCount += 2;
    }
  }
  return true;
}

}  // namespace vtr::bplist
