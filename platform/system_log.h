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

// How urgent a message is: a failure (a command that cannot do its work, a
// refused client or path) or a notice of what happens. kJournalError is a
// failure told to the system log alone: the reason behind a NO answer that
// the helper's own day file has no line for (the system log carries it as
// kError).
enum class LogPriority { kNotice, kError, kJournalError };

// One message with its priority, as held until it is written.
struct LogLine {
  std::string text;
  LogPriority priority = LogPriority::kNotice;
};

class SystemLog {
 public:
  virtual ~SystemLog() = default;
  // Sends one message (no trailing newline needed).
  virtual void write(std::string_view message, LogPriority priority) = 0;
};

// syslog(3) with the given ident, at LOG_ERR for failures and LOG_NOTICE for
// the rest. The connection to the log socket is opened
// at once, so that it survives a later chroot.
std::shared_ptr<SystemLog> MakeSyslog(const char* ident = "vitd_helper");
// One line per message on standard error.
std::shared_ptr<SystemLog> MakeStderrLog();

// Keeps every message in memory, for tests.
class MemorySystemLog final : public SystemLog {
 public:
  void write(std::string_view message, LogPriority priority) override;
  std::vector<std::string> messages() const;
  // The messages a day file gets too (all but kJournalError), and those
  // the system log alone gets.
  std::vector<std::string> dayFileMessages() const;
  std::vector<std::string> journalOnlyMessages() const;
  // The messages written as failures (kError and kJournalError).
  std::vector<std::string> errors() const;
  // True when some message equals text exactly.
  bool contains(std::string_view text) const;
  void clear();

 private:
  // The texts of the lines whose priority keep accepts, in order.
  std::vector<std::string> textsWhere(bool (*keep)(LogPriority)) const;

  mutable std::mutex mutex_;
  std::vector<LogLine> lines_;
};

}  // namespace vtr

#endif  // VTR_PLATFORM_SYSTEM_LOG_H_
