// The system log: where every message of the helper goes, with or without a
// log file. syslog(3) (ident "vitd_helper", facility daemon), or standard
// error when the daemon runs with --stderr. Implementations are thread-safe.
#ifndef VTR_PLATFORM_SYSTEM_LOG_H_
#define VTR_PLATFORM_SYSTEM_LOG_H_

#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

namespace vtr {

class SystemLog {
 public:
  virtual ~SystemLog() = default;
  // Sends one message (no trailing newline needed).
  virtual void write(std::string_view message) = 0;
};

// syslog(3) with the given ident. The connection to the log socket is opened
// at once, so that it survives a later chroot.
std::shared_ptr<SystemLog> MakeSyslog(const char* ident = "vitd_helper");
// One line per message on standard error.
std::shared_ptr<SystemLog> MakeStderrLog();

// Keeps every message in memory, for tests.
class MemorySystemLog final : public SystemLog {
 public:
  void write(std::string_view message) override;
  std::vector<std::string> messages() const;
  // True when some message equals text exactly.
  bool contains(std::string_view text) const;
  void clear();

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> messages_;
};

}  // namespace vtr

#endif  // VTR_PLATFORM_SYSTEM_LOG_H_
