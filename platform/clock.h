// The source of the current time, injectable so that time-dependent rules
// (log expiry, file names of the day) can be tested to the second.
#ifndef VTR_PLATFORM_CLOCK_H_
#define VTR_PLATFORM_CLOCK_H_

#include <memory>

#include "platform/date.h"

namespace vtr {

class Clock {
 public:
  virtual ~Clock() = default;
  virtual Date now() const = 0;
};

// The real time (CLOCK_REALTIME). Shared, stateless.
std::shared_ptr<Clock> SystemClock();

// A clock that answers whatever it was last set to.
class FixedClock final : public Clock {
 public:
  explicit FixedClock(Date now) : now_(now) {}
  Date now() const override { return now_; }
  void set(Date now) { now_ = now; }

 private:
  Date now_;
};

// Calendar fields of a date in the machine's local time zone.
CivilTime LocalCivilTime(const Date& date);

}  // namespace vtr

#endif  // VTR_PLATFORM_CLOCK_H_
