#include "tools/vtr-manifest/console.h"

#include <string>

#include "model/log_model.h"

namespace vtr::manifest_tool {
namespace {

constexpr int kBarWidth = 40;

}  // namespace

Console::Console(FILE* err, bool drawProgress, bool verbose)
    : err_(err), drawProgress_(drawProgress), verbose_(verbose) {}

void Console::write(std::string_view message, LogPriority) {
  if (verbose_) print(message);
}

void Console::print(std::string_view message) {
  std::lock_guard<std::mutex> lock(mutex_);
  if (barShown_) std::fputs("\r\033[K", err_);
  std::fprintf(err_, "%.*s\n", static_cast<int>(message.size()), message.data());
  if (barShown_) drawBar();
  std::fflush(err_);
}

void Console::showProgress(int64_t percent) {
  if (!drawProgress_) return;
  std::lock_guard<std::mutex> lock(mutex_);
  percent_ = percent;
  barShown_ = true;
  drawBar();
  std::fflush(err_);
}

void Console::finish() {
  std::lock_guard<std::mutex> lock(mutex_);
  if (!barShown_) return;
  std::fputc('\n', err_);
  std::fflush(err_);
  barShown_ = false;
}

void Console::drawBar() {
  const int64_t shown = percent_ < 0 ? 0 : (percent_ > 100 ? 100 : percent_);
  const int filled = static_cast<int>(shown * kBarWidth / 100);
  std::fprintf(err_, "\r[%s%s] %3lld%%", std::string(filled, '#').c_str(), std::string(kBarWidth - filled, '-').c_str(),
               static_cast<long long>(shown));
}

ConsoleLogInstaller::ConsoleLogInstaller(std::shared_ptr<Console> console)
    : previous_(VTRLogModel::sharedInstance().systemLog()) {
  VTRLogModel::sharedInstance().setSystemLog(std::move(console));
}

ConsoleLogInstaller::~ConsoleLogInstaller() { VTRLogModel::sharedInstance().setSystemLog(previous_); }

}  // namespace vtr::manifest_tool
