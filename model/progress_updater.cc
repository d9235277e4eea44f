#include "model/progress_updater.h"

#include "model/log.h"

namespace vtr {
namespace {

// Two's-complement wrap-around instead of undefined overflow.
int64_t WrappingAdd(int64_t a, int64_t b) {
  return static_cast<int64_t>(static_cast<uint64_t>(a) + static_cast<uint64_t>(b));
}
int64_t WrappingTimes100(int64_t a) { return static_cast<int64_t>(static_cast<uint64_t>(a) * 100u); }

int64_t Percent(int64_t finished, int64_t total) {
  if (total == 0) return 0;
  const int64_t scaled = WrappingTimes100(finished);
  // The one quotient that overflows: INT64_MIN / -1.
  if (total == -1) return WrappingAdd(~scaled, 1);
  return scaled / total;
}

}  // namespace

VTRProgressUpdater& VTRProgressUpdater::sharedInstance() {
  static VTRProgressUpdater* const instance = new VTRProgressUpdater();
  return *instance;
}

void VTRProgressUpdater::initializePercentageWithTotal(int64_t total) {
  VTRLog("Initializing percent with total %lld", total);
  finished_ = 0;
  total_ = total;
  reportedPercent_ = 0;
}

void VTRProgressUpdater::updatePercentageWithIncrement(int64_t increment) {
  finished_ = WrappingAdd(finished_, increment);
  const int64_t percent = Percent(finished_, total_);
  if (percent <= reportedPercent_) return;
  VTRLog("Percentage increased to %lld", percent);
  if (sender_) sender_(percent);
  reportedPercent_ = percent;
}

}  // namespace vtr
