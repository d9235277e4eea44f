// Points in time as the system keeps them: seconds (with fraction) since the
// reference date 2001-01-01 00:00:00 UTC, the unit binary property lists store.
// Calendar conversion is proleptic Gregorian and works for any year.
#ifndef VTR_PLATFORM_DATE_H_
#define VTR_PLATFORM_DATE_H_

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace vtr {

// Seconds between 1970-01-01 and 2001-01-01, both UTC.
inline constexpr int64_t kSecondsFrom1970To2001 = 978307200;

struct Date {
  double secondsSince2001 = 0;

  static Date FromUnix(int64_t seconds, int64_t nanoseconds = 0);
  double unixSeconds() const { return secondsSince2001 + kSecondsFrom1970To2001; }

  // "2026-11-21 09:30:00 +0000": the description "%@" prints (UTC, whole
  // seconds rounded down).
  std::string description() const;
  // "2026-11-21T09:30:00Z": the text of a <date> element (UTC, whole seconds).
  std::string iso8601() const;
  // Parses the <date> text strictly: "YYYY-MM-DDTHH:MM:SSZ" (year of four
  // digits; month, day and time fields in range). Anything else: nullopt.
  static std::optional<Date> ParseIso8601(std::string_view text);

  friend bool operator==(const Date&, const Date&) = default;
  friend auto operator<=>(const Date&, const Date&) = default;
};

// A broken-down calendar date and time.
struct CivilTime {
  int64_t year = 1970;
  int month = 1;   // 1..12
  int day = 1;     // 1..31
  int hour = 0;
  int minute = 0;
  int second = 0;
};

// UTC calendar fields of a Unix time in whole seconds.
CivilTime CivilFromUnix(int64_t unixSeconds);
// Unix time of UTC calendar fields (fields are not range-checked here).
int64_t UnixFromCivil(const CivilTime& civil);

}  // namespace vtr

#endif  // VTR_PLATFORM_DATE_H_
