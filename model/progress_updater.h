// VTRProgressUpdater: turns a long operation's running byte count into
// whole-percent "Progress" messages for the client.
//
// The operation sets the total before it starts and adds what it has done as
// it goes; each time the whole percent rises above the last one sent, the
// new percent is logged and handed to the sender. Only rises are sent, each
// percent at most once, never 0, and without a cap: an operation that does
// more than its total reports more than 100.
//
// The sender is how the percent reaches the client; the daemon installs one
// that writes a "Progress" message to the current connection (this layer
// knows nothing of connections). Without a sender the percent is still
// computed and logged.
//
// Threads: not synchronised. The shared instance is used only from inside the
// running command, one command at a time; setSender() is called before
// serving.
#ifndef VTR_MODEL_PROGRESS_UPDATER_H_
#define VTR_MODEL_PROGRESS_UPDATER_H_

#include <cstdint>
#include <functional>

namespace vtr {

class VTRProgressUpdater {
 public:
  using Sender = std::function<void(int64_t percent)>;

  // The process-wide updater, created once with all counters 0.
  static VTRProgressUpdater& sharedInstance();

  VTRProgressUpdater() = default;
  VTRProgressUpdater(const VTRProgressUpdater&) = delete;
  VTRProgressUpdater& operator=(const VTRProgressUpdater&) = delete;

  // Starts a run: logs "Initializing percent with total %lld", sets the total
  // and puts finished and reportedPercent back to 0. Sends nothing.
  void initializePercentageWithTotal(int64_t total);

  // Adds increment (which may be negative) to finished, and sends
  // finished * 100 / total (truncated; 0 when total is 0) if it is greater
  // than the last percent sent. Arithmetic wraps around in 64 bits as the
  // system's does; totals near that limit are not guarded.
  void updatePercentageWithIncrement(int64_t increment);

  int64_t total() const { return total_; }
  void setTotal(int64_t total) { total_ = total; }
  int64_t finished() const { return finished_; }
  void setFinished(int64_t finished) { finished_ = finished; }
  int64_t reportedPercent() const { return reportedPercent_; }
  void setReportedPercent(int64_t percent) { reportedPercent_ = percent; }

  // Where percents go; an empty function sends nothing.
  void setSender(Sender sender) { sender_ = std::move(sender); }

 private:
  int64_t total_ = 0;
  int64_t finished_ = 0;
  int64_t reportedPercent_ = 0;
  Sender sender_;
};

}  // namespace vtr

#endif  // VTR_MODEL_PROGRESS_UPDATER_H_
