// What vtr-manifest shows on standard error while it works: its own
// messages, with --verbose the messages the model logs (the helper's log
// lines, which name the helper's internals and are not meant for a user
// otherwise), one per line, and on a terminal a progress bar kept on the line
// below them.
#ifndef VTR_TOOLS_VTR_MANIFEST_CONSOLE_H_
#define VTR_TOOLS_VTR_MANIFEST_CONSOLE_H_

#include <cstdint>
#include <cstdio>
#include <memory>
#include <mutex>
#include <string_view>

#include "platform/system_log.h"

namespace vtr::manifest_tool {

class Console final : public SystemLog {
 public:
  // Writes to err (not owned). With drawProgress, showProgress draws a bar.
  // With verbose, the model's log lines are shown too.
  Console(FILE* err, bool drawProgress, bool verbose);

  bool drawsProgress() const { return drawProgress_; }

  // A log line of the model: shown only with verbose. May be called from any
  // thread.
  void write(std::string_view message, LogPriority priority) override;
  // One message of the tool on its own line (the bar, if any, is drawn again
  // below it). May be called from any thread.
  void print(std::string_view message);
  // Draws the bar at percent (shown capped at 100).
  void showProgress(int64_t percent);
  // Ends the bar's line, if one was drawn.
  void finish();

 private:
  void drawBar();

  std::mutex mutex_;
  FILE* err_;
  const bool drawProgress_;
  const bool verbose_;
  bool barShown_ = false;
  int64_t percent_ = 0;
};

// Sends the shared log model's messages to console for as long as it lives.
class ConsoleLogInstaller {
 public:
  explicit ConsoleLogInstaller(std::shared_ptr<Console> console);
  ~ConsoleLogInstaller();
  ConsoleLogInstaller(const ConsoleLogInstaller&) = delete;
  ConsoleLogInstaller& operator=(const ConsoleLogInstaller&) = delete;

 private:
  std::shared_ptr<SystemLog> previous_;
};

}  // namespace vtr::manifest_tool

#endif  // VTR_TOOLS_VTR_MANIFEST_CONSOLE_H_
