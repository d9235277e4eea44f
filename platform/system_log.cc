#include "platform/system_log.h"

#include <syslog.h>
#include <unistd.h>

#include <algorithm>

#include "platform/output_stream.h"

namespace vtr {
namespace {

class Syslog final : public SystemLog {
 public:
  explicit Syslog(const char* ident) { openlog(ident, LOG_NDELAY | LOG_PID, LOG_DAEMON); }
  void write(std::string_view message, LogPriority priority) override {
    syslog(priority == LogPriority::kNotice ? LOG_NOTICE : LOG_ERR, "%.*s", static_cast<int>(message.size()),
           message.data());
  }
};

class StderrLog final : public SystemLog {
 public:
  void write(std::string_view message, LogPriority) override {
    std::string line(message);
    line += '\n';
    std::lock_guard<std::mutex> lock(mutex_);
    (void)WriteFully(STDERR_FILENO, line.data(), line.size());
  }

 private:
  std::mutex mutex_;
};

}  // namespace

std::shared_ptr<SystemLog> MakeSyslog(const char* ident) { return std::make_shared<Syslog>(ident); }
std::shared_ptr<SystemLog> MakeStderrLog() { return std::make_shared<StderrLog>(); }

void MemorySystemLog::write(std::string_view message, LogPriority priority) {
  std::lock_guard<std::mutex> lock(mutex_);
  lines_.push_back({std::string(message), priority});
}

std::vector<std::string> MemorySystemLog::textsWhere(bool (*keep)(LogPriority)) const {
  std::lock_guard<std::mutex> lock(mutex_);
  std::vector<std::string> texts;
  for (const LogLine& line : lines_) {
    if (keep(line.priority)) texts.push_back(line.text);
  }
  return texts;
}

std::vector<std::string> MemorySystemLog::messages() const {
  return textsWhere([](LogPriority) { return true; });
}

std::vector<std::string> MemorySystemLog::dayFileMessages() const {
  return textsWhere([](LogPriority p) { return p != LogPriority::kJournalError; });
}

std::vector<std::string> MemorySystemLog::journalOnlyMessages() const {
  return textsWhere([](LogPriority p) { return p == LogPriority::kJournalError; });
}

std::vector<std::string> MemorySystemLog::errors() const {
  return textsWhere([](LogPriority p) { return p != LogPriority::kNotice; });
}

bool MemorySystemLog::contains(std::string_view text) const {
  std::lock_guard<std::mutex> lock(mutex_);
  return std::any_of(lines_.begin(), lines_.end(), [text](const LogLine& line) { return line.text == text; });
}

void MemorySystemLog::clear() {
  std::lock_guard<std::mutex> lock(mutex_);
  lines_.clear();
}

}  // namespace vtr
