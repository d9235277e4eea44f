#include "tools/zarnutil/report_format.h"

#include <uuid/uuid.h>

#include <cstdio>

#include "storage/utf16.h"

namespace vtr {

std::string UuidText(std::span<const uint8_t, 16> bytes) {
  uuid_t id;
  std::copy(bytes.begin(), bytes.end(), id);
  char text[37];
  uuid_unparse_lower(id, text);
  return text;
}

std::string EntryName(const ZarnEntryView& entry) {
  uint8_t name[256];
  size_t length = 0;
  utf_encodestr2(entry.name().data(), entry.name().size(), name, &length, sizeof name);
  return std::string(reinterpret_cast<const char*>(name), length);
}

std::string Hex(uint64_t value, int digits) {
  char text[24];
  std::snprintf(text, sizeof text, "0x%0*llx", digits, static_cast<unsigned long long>(value));
  return text;
}

std::string HumanSize(uint64_t bytes) {
  static constexpr const char* kUnits[] = {"KiB", "MiB", "GiB", "TiB", "PiB", "EiB"};
  if (bytes < 1024) return std::to_string(bytes) + (bytes == 1 ? " byte" : " bytes");
  double value = static_cast<double>(bytes) / 1024;
  int unit = 0;
  while (value >= 1024 && unit < 5) {
    value /= 1024;
    ++unit;
  }
  char text[32];
  if (value == static_cast<double>(static_cast<uint64_t>(value))) {
    std::snprintf(text, sizeof text, "%llu %s", static_cast<unsigned long long>(value), kUnits[unit]);
  } else {
    std::snprintf(text, sizeof text, "%.1f %s", value, kUnits[unit]);
  }
  return text;
}

std::string JsonLine(const Json& value) {
  return value.dump(-1, ' ', false, Json::error_handler_t::replace) + "\n";
}

std::string JsonQuote(std::string_view text) {
  return Json(std::string(text)).dump(-1, ' ', false, Json::error_handler_t::replace);
}

}  // namespace vtr
