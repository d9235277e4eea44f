#include "platform/clock.h"

#include <time.h>

#include <cmath>

namespace vtr {
namespace {

class RealClock final : public Clock {
 public:
  Date now() const override {
    struct timespec ts;
    clock_gettime(CLOCK_REALTIME, &ts);
    return Date::FromUnix(ts.tv_sec, ts.tv_nsec);
  }
};

}  // namespace

std::shared_ptr<Clock> SystemClock() {
  static const std::shared_ptr<Clock> clock = std::make_shared<RealClock>();
  return clock;
}

CivilTime LocalCivilTime(const Date& date) {
  const time_t t = static_cast<time_t>(std::floor(date.unixSeconds()));
  struct tm tm;
  if (localtime_r(&t, &tm) == nullptr) return CivilFromUnix(t);
  return CivilTime{tm.tm_year + int64_t{1900}, tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec};
}

}  // namespace vtr
