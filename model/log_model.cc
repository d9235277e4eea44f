#include "model/log_model.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <optional>
#include <utility>
#include <vector>

#include "platform/file_dates.h"
#include "platform/file_manager.h"
#include "platform/make_directories.h"
#include "platform/remove_item.h"

namespace vtr {
namespace {

constexpr char kProbeName[] = "testWritability.log";

// Where this thread's messages go instead of being written (ScopedLogDiversion).
thread_local std::vector<std::string>* t_divertedMessages = nullptr;

// "~/x" becomes "$HOME/x"; other paths stay as they are.
std::string ExpandTilde(const std::string& path) {
  if (path.empty() || path[0] != '~' || (path.size() > 1 && path[1] != '/')) return path;
  const char* home = std::getenv("HOME");
  return std::string(home ? home : "") + path.substr(1);
}

std::string ParentOf(const std::string& path) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  return slash == 0 ? "/" : path.substr(0, slash);
}

bool IsDirectory(const std::string& path) {
  struct stat st;
  return ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// Creates dir/testWritability.log holding "a" and removes it again.
bool ProbeWritable(const std::string& directory) {
  const std::string probe = directory + "/" + kProbeName;
  const int fd = ::open(probe.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644);
  if (fd < 0) return false;
  const bool written = ::write(fd, "a", 1) == 1;
  ::close(fd);
  ::unlink(probe.c_str());
  return written;
}

}  // namespace

VTRLogModel& VTRLogModel::sharedInstance() {
  static VTRLogModel* const instance = new VTRLogModel(MakeSyslog(), SystemClock());
  return *instance;
}

VTRLogModel::VTRLogModel(std::shared_ptr<SystemLog> systemLog, std::shared_ptr<Clock> clock)
    : systemLog_(std::move(systemLog)), clock_(std::move(clock)) {}

void VTRLogModel::logMessage(std::string_view message) {
  if (t_divertedMessages != nullptr) {
    t_divertedMessages->emplace_back(message);
    return;
  }
  std::shared_ptr<SystemLog> systemLog;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (logFP_ != nullptr) {
      const std::string line = Format("%@ %@\n", clock_->now(), message);
      std::fputs(line.c_str(), logFP_);
      std::fflush(logFP_);
    }
    systemLog = systemLog_;
  }
  systemLog->write(message);
}

void VTRLogModel::systemLogOnly(std::string_view message) { systemLog()->write(message); }

bool VTRLogModel::enableLogToFile(const std::string& path) {
  const std::string expanded = ExpandTilde(path);
  const std::string parent = ParentOf(expanded);
  if (!IsDirectory(parent) && !MakeDirectories(parent).ok()) return false;
  FILE* fp = std::fopen(expanded.c_str(), "ae");
  std::lock_guard<std::mutex> lock(mutex_);
  logFP_ = fp;
  return fp != nullptr;
}

bool VTRLogModel::logToFileEnabled() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return logFP_ != nullptr;
}

bool VTRLogModel::enableLogToFilesUnder(const std::string& directory, const std::string& prefix, long expireDays) {
  if (!IsDirectory(directory) && !MakeDirectories(directory).ok()) return false;
  if (!ProbeWritable(directory)) return false;

  std::shared_ptr<Clock> clock;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    clock = clock_;
  }
  const Date cutoff{clock->now().secondsSince2001 - static_cast<double>(expireDays) * 86400.0};
  // A directory that cannot be listed is not swept.
  if (Result<std::vector<std::string>> names = ContentsOfDirectory(directory); names.ok()) {
    for (const std::string& name : *names) {
      const std::string fullPath = Format("%@/%@", directory, name);
      systemLogOnly(Format("Checking existing log file (full path) %@ against %@", fullPath, cutoff));
      const std::optional<Date> created = CreationDateOfItem(fullPath);
      if (created && *created < cutoff) {
        systemLogOnly(Format("Removing %@ whose creation date is %@.", fullPath, *created));
        (void)RemoveItem(fullPath);
      }
    }
  }
  return enableLogToFile(fileNameForTodayUnder(directory, prefix));
}

std::string VTRLogModel::fileNameForTodayUnder(const std::string& directory, const std::string& prefix) const {
  std::shared_ptr<Clock> clock;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    clock = clock_;
  }
  const CivilTime today = LocalCivilTime(clock->now());
  return Format("%@/%@-%4ld%02ld%02ld.log", directory, prefix, static_cast<long>(today.year),
                static_cast<long>(today.month), static_cast<long>(today.day));
}

FILE* VTRLogModel::logFP() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return logFP_;
}

void VTRLogModel::setLogFP(FILE* fp) {
  std::lock_guard<std::mutex> lock(mutex_);
  logFP_ = fp;
}

void VTRLogModel::setSystemLog(std::shared_ptr<SystemLog> systemLog) {
  std::lock_guard<std::mutex> lock(mutex_);
  systemLog_ = std::move(systemLog);
}

std::shared_ptr<SystemLog> VTRLogModel::systemLog() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return systemLog_;
}

void VTRLogModel::setClock(std::shared_ptr<Clock> clock) {
  std::lock_guard<std::mutex> lock(mutex_);
  clock_ = std::move(clock);
}

ScopedLogDiversion::ScopedLogDiversion(std::vector<std::string>* messages)
    : previous_(std::exchange(t_divertedMessages, messages)) {}

ScopedLogDiversion::~ScopedLogDiversion() { t_divertedMessages = previous_; }

}  // namespace vtr
