#include "platform/date.h"

#include <cmath>
#include <cstdio>

namespace vtr {
namespace {

// Days since 1970-01-01 of a proleptic Gregorian date, and back (the
// well-known era-based algorithms; exact for every representable year).
int64_t DaysFromCivil(int64_t y, int m, int d) {
  y -= m <= 2;
  const int64_t era = (y >= 0 ? y : y - 399) / 400;
  const int64_t yoe = y - era * 400;
  const int64_t doy = (153 * (m + (m > 2 ? -3 : 9)) + 2) / 5 + d - 1;
  const int64_t doe = yoe * 365 + yoe / 4 - yoe / 100 + doy;
  return era * 146097 + doe - 719468;
}

void CivilFromDays(int64_t z, int64_t* y, int* m, int* d) {
  z += 719468;
  const int64_t era = (z >= 0 ? z : z - 146096) / 146097;
  const int64_t doe = z - era * 146097;
  const int64_t yoe = (doe - doe / 1460 + doe / 36524 - doe / 146096) / 365;
  const int64_t doy = doe - (365 * yoe + yoe / 4 - yoe / 100);
  const int64_t mp = (5 * doy + 2) / 153;
  *d = static_cast<int>(doy - (153 * mp + 2) / 5 + 1);
  *m = static_cast<int>(mp < 10 ? mp + 3 : mp - 9);
  *y = yoe + era * 400 + (*m <= 2);
}

int64_t FloorDiv(int64_t a, int64_t b) { return a / b - ((a % b != 0) && ((a < 0) != (b < 0))); }

bool ParseDigits(std::string_view text, size_t pos, size_t count, int* out) {
  int value = 0;
  for (size_t i = pos; i < pos + count; ++i) {
    if (text[i] < '0' || text[i] > '9') return false;
    value = value * 10 + (text[i] - '0');
  }
  *out = value;
  return true;
}

// Whole seconds of a date, rounded down, clamped to what int64 holds.
int64_t WholeUnixSeconds(const Date& date) {
  const double s = std::floor(date.unixSeconds());
  if (!(s > -9.2e18)) return INT64_MIN / 2;
  if (!(s < 9.2e18)) return INT64_MAX / 2;
  return static_cast<int64_t>(s);
}

}  // namespace

Date Date::FromUnix(int64_t seconds, int64_t nanoseconds) {
  return Date{static_cast<double>(seconds - kSecondsFrom1970To2001) + static_cast<double>(nanoseconds) * 1e-9};
}

CivilTime CivilFromUnix(int64_t unixSeconds) {
  CivilTime t;
  const int64_t days = FloorDiv(unixSeconds, 86400);
  const int64_t rest = unixSeconds - days * 86400;
  CivilFromDays(days, &t.year, &t.month, &t.day);
  t.hour = static_cast<int>(rest / 3600);
  t.minute = static_cast<int>(rest % 3600 / 60);
  t.second = static_cast<int>(rest % 60);
  return t;
}

int64_t UnixFromCivil(const CivilTime& c) {
  return DaysFromCivil(c.year, c.month, c.day) * 86400 + c.hour * 3600 + c.minute * 60 + c.second;
}

std::string Date::description() const {
  const CivilTime t = CivilFromUnix(WholeUnixSeconds(*this));
  char buf[64];
  std::snprintf(buf, sizeof buf, "%04lld-%02d-%02d %02d:%02d:%02d +0000", static_cast<long long>(t.year), t.month,
                t.day, t.hour, t.minute, t.second);
  return buf;
}

std::string Date::iso8601() const {
  const CivilTime t = CivilFromUnix(WholeUnixSeconds(*this));
  char buf[64];
  std::snprintf(buf, sizeof buf, "%04lld-%02d-%02dT%02d:%02d:%02dZ", static_cast<long long>(t.year), t.month, t.day,
                t.hour, t.minute, t.second);
  return buf;
}

std::optional<Date> Date::ParseIso8601(std::string_view text) {
  // YYYY-MM-DDTHH:MM:SSZ
  if (text.size() != 20 || text[4] != '-' || text[7] != '-' || text[10] != 'T' || text[13] != ':' ||
      text[16] != ':' || text[19] != 'Z') {
    return std::nullopt;
  }
  int year, month, day, hour, minute, second;
  if (!ParseDigits(text, 0, 4, &year) || !ParseDigits(text, 5, 2, &month) || !ParseDigits(text, 8, 2, &day) ||
      !ParseDigits(text, 11, 2, &hour) || !ParseDigits(text, 14, 2, &minute) || !ParseDigits(text, 17, 2, &second)) {
    return std::nullopt;
  }
  static constexpr int kDaysInMonth[] = {31, 29, 31, 30, 31, 30, 31, 31, 30, 31, 30, 31};
  if (month < 1 || month > 12 || day < 1 || day > kDaysInMonth[month - 1] || hour > 23 || minute > 59 ||
      second > 59) {
    return std::nullopt;
  }
  const bool leap = (year % 4 == 0 && year % 100 != 0) || year % 400 == 0;
  if (month == 2 && day == 29 && !leap) return std::nullopt;
  const int64_t unix = UnixFromCivil(CivilTime{year, month, day, hour, minute, second});
  return Date{static_cast<double>(unix - kSecondsFrom1970To2001)};
}

}  // namespace vtr
