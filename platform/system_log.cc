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
  void write(std::string_view message) override {
    syslog(LOG_NOTICE, "%.*s", static_cast<int>(message.size()), message.data());
  }
};

class StderrLog final : public SystemLog {
 public:
  void write(std::string_view message) override {
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

void MemorySystemLog::write(std::string_view message) {
  std::lock_guard<std::mutex> lock(mutex_);
  messages_.emplace_back(message);
}

std::vector<std::string> MemorySystemLog::messages() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return messages_;
}

bool MemorySystemLog::contains(std::string_view text) const {
  std::lock_guard<std::mutex> lock(mutex_);
  return std::find(messages_.begin(), messages_.end(), text) != messages_.end();
}

void MemorySystemLog::clear() {
  std::lock_guard<std::mutex> lock(mutex_);
  messages_.clear();
}

}  // namespace vtr
